#pragma once

#include <compare>
#include <string>

namespace ostrel {

/// A moment in time: seconds since 1970-01-01T00:00:00Z, with fractions. May
/// lie before 1970; never promised to be finite when it came from a client.
struct Date {
  double secondsSince1970 = 0;

  friend auto operator<=>(const Date&, const Date&) = default;
};

/// ISO 8601 in UTC with milliseconds, "2026-01-31T12:00:00.250Z", rounded to
/// the nearest millisecond. Empty when the date is not finite or lies outside
/// the years 0000 to 9999.
std::string iso8601(Date date);

}  // namespace ostrel
