// Any payload that the wire lets in has a lenient text that is JSON; its strict text
// is there unless `findJSONError` says otherwise; any text that reads as a value is
// written and read again as the same value.
#include <cstddef>
#include <cstdint>
#include <nlohmann/json.hpp>
#include <string>

#include "fuzz/Fuzzing.h"
#include "platform/ValueJSON.h"
#include "platform/linux/ValueJSONReader.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace {

using namespace ostrel;
using fuzzing::expect;

void writePayload(ValueView value) {
  for (const JSONLayout layout : {JSONLayout::kCompact, JSONLayout::kPretty}) {
    std::string lenient;
    expect(!appendJSON(lenient, value, layout, JSONStrictness::kLenient, /*indent=*/0));
    expect(nlohmann::json::accept(lenient));
    std::string strict;
    const auto error = appendJSON(strict, value, layout, JSONStrictness::kError,
                                  /*indent=*/0);
    expect(error == findJSONError(value));
    expect(error ? strict.empty() : nlohmann::json::accept(strict));
  }
}

void readText(std::string_view text) {
  std::string error;
  const auto value = valueFromJSON(text, JSONDates::kPlain, error);
  expect(value.has_value() == error.empty());
  if (!value) return;
  std::string written;
  expect(!appendJSON(written, *value, JSONLayout::kPretty, JSONStrictness::kError,
                     /*indent=*/0));
  expect(valueFromJSON(written, JSONDates::kPlain, error) == value);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto decoded = wire::decodeDictionary({data, size}, fuzzing::kPayloadLimits,
                                              /*owner=*/{});
  if (decoded.dictionary) writePayload(decoded.dictionary->value());
  readText({reinterpret_cast<const char*>(data), size});
  return 0;
}
