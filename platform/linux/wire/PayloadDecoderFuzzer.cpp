// Any bytes are a payload or an error. A payload is whole: it can be walked, and what
// it shows is a payload again, with nothing left to drop.
#include <cstddef>
#include <cstdint>
#include <vector>

#include "fuzz/Fuzzing.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace {

// The check finds the same whether or not it may read behind the bytes.
void expectTheSameWithBytesBehind(std::span<const std::uint8_t> bytes) {
  using namespace ostrel;
  std::vector<std::uint8_t> longer(bytes.begin(), bytes.end());
  longer.resize(bytes.size() + 64, 'a');
  std::size_t size[2] = {};
  bool hasRepeatedKeys[2] = {};
  const auto alone =
      wire::checkItem(bytes, fuzzing::kPayloadLimits, size[0], hasRepeatedKeys[0]);
  const auto other =
      wire::checkItem({longer.data(), bytes.size()}, fuzzing::kPayloadLimits, size[1],
                      hasRepeatedKeys[1], longer.data() + longer.size());
  fuzzing::expect(alone == other);
  if (alone) return;
  fuzzing::expect(size[0] == size[1] && hasRepeatedKeys[0] == hasRepeatedKeys[1]);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace ostrel;
  using fuzzing::expect;
  expectTheSameWithBytesBehind({data, size});
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
