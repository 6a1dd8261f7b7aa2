#include "platform/Date.h"

#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>

namespace ostrel {

std::string iso8601(Date date) {
  constexpr double kYear0 = -62167219200.0;
  constexpr double kYear10000 = 253402300800.0;
  const double milliseconds = std::round(date.secondsSince1970 * 1000.0);
  if (!(milliseconds >= kYear0 * 1000.0 && milliseconds < kYear10000 * 1000.0)) {
    return {};
  }
  using namespace std::chrono;
  const sys_time<std::chrono::milliseconds> time{
      std::chrono::milliseconds{static_cast<std::int64_t>(milliseconds)}};
  const auto day = floor<days>(time);
  const year_month_day calendar{day};
  const hh_mm_ss clock{time - day};
  char text[32];
  std::snprintf(
      text, sizeof text, "%04d-%02u-%02uT%02d:%02d:%02d.%03dZ",
      static_cast<int>(calendar.year()), static_cast<unsigned>(calendar.month()),
      static_cast<unsigned>(calendar.day()), static_cast<int>(clock.hours().count()),
      static_cast<int>(clock.minutes().count()),
      static_cast<int>(clock.seconds().count()),
      static_cast<int>(clock.subseconds().count()));
  return text;
}

}  // namespace ostrel
