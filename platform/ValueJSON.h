#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "platform/ErrorObject.h"
#include "platform/Value.h"

namespace ostrel {

enum class JSONLayout { kCompact, kPretty };

/// What to do with what JSON cannot say.
enum class JSONStrictness {
  kError,   // A number that is not finite, or a key that is not text: an error.
  kLenient  // "NaN", "Infinity", "-Infinity" as text; integer keys in decimal.
};

/// Appends `value` as JSON (RFC 8259) in UTF-8. Dates become ISO 8601 text;
/// integers are exact; doubles are the shortest text that reads back the same
/// and always carry a fraction or an exponent; control characters are escaped.
/// `indent` is the depth at which a pretty value stands. On an error nothing is
/// appended. Safe at any nesting.
std::optional<ErrorObject> appendJSON(std::string& out, ValueView value,
                                      JSONLayout layout, JSONStrictness strictness,
                                      int indent);
/// As above, where more than `mostBytes` are an error: no more than these are put
/// together.
std::optional<ErrorObject> appendJSON(std::string& out, ValueView value,
                                      JSONLayout layout, JSONStrictness strictness,
                                      int indent, std::size_t mostBytes);

/// The error that `appendJSON` with `kError` would give, found without making the
/// text. Safe at any nesting.
std::optional<ErrorObject> findJSONError(ValueView value);

}  // namespace ostrel
