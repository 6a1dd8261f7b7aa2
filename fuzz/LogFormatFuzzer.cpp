// Whatever a client says, its text stays within its place in a log line: no argument
// ends the line, commands a terminal, is a format or takes more than its share; and any
// format can be filled.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <string>
#include <string_view>

#include "fuzz/Fuzzing.h"
#include "platform/Logging.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace {

using namespace ostrel;
using fuzzing::expect;

// An argument takes 2 KiB and the mark of its cut.
constexpr std::size_t kMostBytes = 2048 + 16;

void expectPlain(std::string_view line) {
  const std::span<const std::uint8_t> bytes(
      reinterpret_cast<const std::uint8_t*>(line.data()), line.size());
  expect(wire::isUTF8(bytes));
  expect(
      std::ranges::none_of(bytes, [](std::uint8_t c) { return c < ' ' || c == 0x7f; }));
  for (std::size_t i = 0; i + 1 < bytes.size(); ++i) {
    expect(bytes[i] != 0xc2 || bytes[i + 1] >= 0xa0);  // Controls of two bytes.
  }
}

void fill(std::string_view text) {
  const std::string alone = format("%@", text);
  expectPlain(alone);
  expect(alone.size() <= kMostBytes);
  const std::string line = format("a %@ b %lli c %@", text, std::int64_t{-7}, text);
  expectPlain(line);
  expect(line.starts_with("a " + alone + " b -7 c ") && line.ends_with(alone));
}

void fillWithValues(std::span<const std::uint8_t> bytes) {
  const auto decoded =
      wire::decodeDictionary(bytes, fuzzing::kPayloadLimits, /*owner=*/{});
  if (!decoded.dictionary) return;
  const std::string line = format("%@", *decoded.dictionary);
  expectPlain(line);
  expect(line.size() <= kMostBytes);
}

void fillAnyFormat(std::string_view anyFormat, std::string_view text) {
  const double endless = std::numeric_limits<double>::infinity();
  const std::uint64_t large = UINT64_MAX;
  const LogArgument arguments[] = {LogArgument(text), LogArgument(endless),
                                   LogArgument(large)};
  for (std::size_t count = 0; count <= std::size(arguments); ++count) {
    expect(formatText(anyFormat, {arguments, count}).size() <=
           anyFormat.size() + count * kMostBytes);
  }
}

}  // namespace

// The first byte says where the format ends and the text begins.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  fill(text);
  fillWithValues({data, size});
  if (size == 0) return 0;
  const std::size_t end = std::min<std::size_t>(1 + data[0], size);
  fillAnyFormat(text.substr(1, end - 1), text.substr(end));
  return 0;
}
