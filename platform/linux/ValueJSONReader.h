#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/Date.h"
#include "platform/Value.h"

namespace ostrel {

enum class JSONDates {
  kPlain,  // Every object is a dictionary.
  kTagged  // {"$date": "2026-01-31T12:00:00.250Z"} is a date.
};

/// The value that a JSON text stands for: integers exact over the ranges of
/// int64 and uint64, numbers with a fraction or an exponent as doubles; of equal
/// keys the last wins. None with a sentence in `error` when the text is not JSON,
/// holds a null or an integer outside both ranges, or nests deeper than payloads
/// may.
std::optional<Value> valueFromJSON(std::string_view text, JSONDates dates,
                                   std::string& error);

/// A moment in ISO 8601: "2026-01-31T12:00:00.250Z", the fraction of any length
/// or left out, an offset such as "+01:00" in place of "Z".
std::optional<Date> dateFromISO8601(std::string_view text);

}  // namespace ostrel
