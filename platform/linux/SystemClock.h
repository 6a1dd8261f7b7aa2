#pragma once

#include "platform/Clock.h"

namespace ostrel {

/// The kernel's clocks and the process's time zone (`TZ`, else the machine's).
class SystemClock final : public Clock {
 public:
  Date now() const override;
  std::chrono::nanoseconds monotonicNow() const override;
  /// A date that is not finite, or outside the years 0000 to 9999, is taken as
  /// the nearest that can be written; one that is no number as 1970.
  std::string fileNameDate(Date date) const override;
};

}  // namespace ostrel
