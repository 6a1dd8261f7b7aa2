#include "platform/linux/SystemClock.h"

#include <time.h>

#include <algorithm>
#include <cmath>
#include <mutex>

namespace ostrel {

Date SystemClock::now() const {
  const std::chrono::duration<double> time =
      std::chrono::system_clock::now().time_since_epoch();
  return {time.count()};
}

std::chrono::nanoseconds SystemClock::monotonicNow() const {
  return std::chrono::steady_clock::now().time_since_epoch();
}

std::string SystemClock::fileNameDate(Date date) const {
  // A day within the range, so that no zone leads out of it.
  constexpr double kFirst = -62167219200.0 + 86400.0;
  constexpr double kLast = 253402300799.0 - 86400.0;
  const double seconds = std::isnan(date.secondsSince1970)
                             ? 0.0
                             : std::clamp(date.secondsSince1970, kFirst, kLast);
  const auto time = static_cast<time_t>(std::floor(seconds));
  tm calendar{};
  // The C library guards the zone by itself, unseen by the thread sanitizer.
  static std::mutex zone;
  const std::lock_guard lock(zone);
  tzset();
  localtime_r(&time, &calendar);
  char text[64];
  const std::size_t size = strftime(text, sizeof text, "%Y%m%d-%H%M%S%z", &calendar);
  // The C library does not fill years below 1000.
  std::string padded(text, size);
  const std::size_t yearSize = padded.find('-') - 4;
  return yearSize < 4 ? std::string(4 - yearSize, '0') + padded : padded;
}

}  // namespace ostrel
