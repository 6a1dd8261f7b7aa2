// Any bytes are a payload or an error. A payload is whole: it can be walked, and what
// it shows is a payload again, with nothing left to drop.
#include <cstddef>
#include <cstdint>

#include "fuzz/Fuzzing.h"
#include "platform/linux/wire/PayloadDecoder.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace ostrel;
  using fuzzing::expect;
  const auto decoded =
      wire::decodeDictionary({data, size}, fuzzing::kPayloadLimits, /*owner=*/{});
  expect(decoded.dictionary.has_value() != decoded.error.has_value());
  expect(decoded.size <= size);
  if (!decoded.dictionary) return 0;

  const ValueView value = decoded.dictionary->value();
  static_cast<void>(description(value));
  std::size_t length = 0;
  bool hasRepeatedKeys = false;
  expect(
      !wire::checkItem(value.bytes(), fuzzing::kPayloadLimits, length, hasRepeatedKeys));
  expect(length == value.bytes().size() && !hasRepeatedKeys);
  return 0;
}
