#pragma once

#include <chrono>
#include <string>

#include "platform/Date.h"

namespace ostrel {

/// Wall-clock and monotonic time. All operations from any thread.
class Clock {
 public:
  virtual ~Clock() = default;

  /// The wall clock. It may be set backwards or forwards while the process
  /// runs.
  virtual Date now() const = 0;

  /// Time since some fixed moment; never goes backwards. All waits are
  /// measured on it.
  virtual std::chrono::nanoseconds monotonicNow() const = 0;

  /// `date` in the process's local time zone in the form
  /// "yyyyMMdd-HHmmssZ", for example "20260131-120000+0100".
  virtual std::string fileNameDate(Date date) const = 0;
};

}  // namespace ostrel
