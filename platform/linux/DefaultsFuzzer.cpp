// Any bytes in a defaults file and in a file of device facts can be asked for
// values.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "fuzz/Fuzzing.h"
#include "platform/linux/EtcDeviceInfo.h"
#include "platform/linux/JSONUserDefaults.h"
#include "platform/linux/TestSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const ostrel::testing_support::TemporaryDirectory directory;
  ostrel::fuzzing::silenceLog();
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  directory.write("suite.json", text);
  const auto suite = ostrel::JSONUserDefaults(directory.path()).openSuite("suite");
  for (const auto* key : {"device_name", "disable_reporting", ""}) {
    static_cast<void>(suite->objectForKey(key));
    static_cast<void>(suite->stringForKey(key));
    static_cast<void>(suite->boolForKey(key));
  }
  static_cast<void>(ostrel::parseEnvironmentFile(text));
  return 0;
}
