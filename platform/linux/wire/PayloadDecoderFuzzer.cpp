// Any bytes are a payload or an error. A payload is whole: it can be walked, and what
// it shows is a payload again, with nothing left to drop.
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "platform/linux/Limits.h"
#include "platform/linux/wire/PayloadDecoder.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace ostrel;
  constexpr wire::PayloadLimits kLimits{limits::kNesting, limits::kNodes,
                                        limits::kKeyBytes};
  const auto decoded = wire::decodeDictionary({data, size}, kLimits, /*owner=*/{});
  if (decoded.dictionary.has_value() == decoded.error.has_value()) std::abort();
  if (decoded.size > size) std::abort();
  if (!decoded.dictionary) return 0;

  const ValueView value = decoded.dictionary->value();
  static_cast<void>(description(value));
  std::size_t length = 0;
  bool hasRepeatedKeys = false;
  if (wire::checkItem(value.bytes(), kLimits, length, hasRepeatedKeys)) std::abort();
  if (length != value.bytes().size() || hasRepeatedKeys) std::abort();
  return 0;
}
