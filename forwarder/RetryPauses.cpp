#include "forwarder/RetryPauses.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cstdint>
#include <ctime>
#include <string>

namespace ostrel {
namespace {

using std::chrono::milliseconds;

constexpr milliseconds kMostAddedToAsked{60'000};

bool isDigits(std::string_view text) {
  return !text.empty() && std::all_of(text.begin(), text.end(), [](char each) {
    return each >= '0' && each <= '9';
  });
}

std::optional<int> digitsAt(std::string_view text, std::size_t place, std::size_t size) {
  const std::string_view digits = text.substr(place, size);
  int number = 0;
  if (digits.size() != size || !isDigits(digits)) return std::nullopt;
  std::from_chars(digits.data(), digits.data() + size, number);
  return number;
}

std::optional<int> monthAt(std::string_view text, std::size_t place) {
  constexpr std::array<std::string_view, 12> kMonths = {
      "Jan", "Feb", "Mar", "Apr", "May", "Jun", "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
  const auto found = std::find(kMonths.begin(), kMonths.end(), text.substr(place, 3));
  if (found == kMonths.end()) return std::nullopt;
  return static_cast<int>(found - kMonths.begin());
}

/// Seconds since 1970 of "Sun, 06 Nov 1994 08:49:37 GMT".
std::optional<std::int64_t> secondsOfDate(std::string_view text) {
  constexpr std::string_view kShape = "Sun, 06 Nov 1994 08:49:37 GMT";
  if (text.size() != kShape.size() || !text.ends_with(" GMT")) return std::nullopt;
  const auto day = digitsAt(text, 5, 2);
  const auto month = monthAt(text, 8);
  const auto year = digitsAt(text, 12, 4);
  const auto hour = digitsAt(text, 17, 2);
  const auto minute = digitsAt(text, 20, 2);
  const auto second = digitsAt(text, 23, 2);
  if (!day || !month || !year || !hour || !minute || !second) return std::nullopt;
  std::tm calendar{};
  calendar.tm_mday = *day;
  calendar.tm_mon = *month;
  calendar.tm_year = *year - 1900;
  calendar.tm_hour = *hour;
  calendar.tm_min = *minute;
  calendar.tm_sec = *second;
  return ::timegm(&calendar);
}

milliseconds clamped(double seconds) {
  constexpr double kMost =
      std::chrono::duration<double>(RetryPauses::kLongestAsked).count();
  // Written so that what is no number counts as 0.
  if (!(seconds > 0)) return milliseconds(0);
  return milliseconds(static_cast<std::int64_t>(std::min(seconds, kMost) * 1000));
}

}  // namespace

std::optional<milliseconds> pauseAsked(std::string_view retryAfter, Date now) {
  if (isDigits(retryAfter)) {
    std::uint64_t seconds = 0;
    const auto parsed = std::from_chars(retryAfter.data(),
                                        retryAfter.data() + retryAfter.size(), seconds);
    if (parsed.ec != std::errc()) return RetryPauses::kLongestAsked;
    return clamped(static_cast<double>(seconds));
  }
  const auto date = secondsOfDate(retryAfter);
  if (!date) return std::nullopt;
  return clamped(static_cast<double>(*date) - now.secondsSince1970);
}

milliseconds RetryPauses::next(std::optional<milliseconds> asked) {
  const milliseconds own = pause_ / 2 + upTo(pause_ / 2);
  pause_ = std::min(pause_ * 3 / 2, kLongest);
  if (!asked || *asked <= own) return own;
  return *asked + upTo(std::min(*asked / 10, kMostAddedToAsked));
}

milliseconds RetryPauses::upTo(milliseconds most) {
  return milliseconds(random_.uniform(static_cast<std::uint32_t>(most.count()) + 1));
}

}  // namespace ostrel
