// Any bytes in a channel file are values or an error.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "fuzz/Fuzzing.h"
#include "platform/linux/ChannelFile.h"
#include "platform/linux/TestSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const ostrel::testing_support::TemporaryDirectory directory;
  const auto outcome = ostrel::readChannelFile(directory.write(
      "G.S", std::string_view(reinterpret_cast<const char*>(data), size)));
  ostrel::fuzzing::expect(outcome.value.has_value() != outcome.error.has_value());
  return 0;
}
