// Any bytes in a channel file are values or an error.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/linux/ChannelFile.h"
#include "platform/linux/TestSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const ostrel::testing_support::TemporaryDirectory directory;
  const auto outcome = ostrel::readChannelFile(directory.write(
      "G.S", std::string_view(reinterpret_cast<const char*>(data), size)));
  if (outcome.value.has_value() == outcome.error.has_value()) std::abort();
  return 0;
}
