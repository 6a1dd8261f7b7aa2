#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <utility>

#include "platform/Clock.h"

namespace ostrel {

/// A clock that stands until the test advances it. Carries the timers of the
/// other manual fakes.
///
/// Begins at 2026-01-31T12:00:00Z, in the zone +0000.
class ManualClock final : public Clock {
 public:
  using TimerID = std::uint64_t;

  static constexpr Date kStart{1769860800.0};

  Date now() const override;
  std::chrono::nanoseconds monotonicNow() const override;
  std::string fileNameDate(Date date) const override;

  /// Moves both clocks on, to each timer on the way in turn: its action runs on
  /// the calling thread, at its own time, without a lock held. `duration` is 0
  /// or more.
  void advance(std::chrono::nanoseconds duration);

  /// Sets the wall clock alone, backwards too.
  void setWallClock(Date date);

  /// The zone of `fileNameDate`, east of Greenwich.
  void setZone(std::chrono::minutes offset);

  /// Runs `action` once the monotonic clock reads `due`; at the next `advance`,
  /// of 0 too, when it reads that already. Timers due together fire in the
  /// order in which they were made.
  TimerID scheduleAt(std::chrono::nanoseconds due, std::function<void()> action);
  /// False when the timer has fired or is unknown.
  bool cancel(TimerID timer);

  std::optional<std::chrono::nanoseconds> nextDue() const;
  std::size_t timerCount() const;

  /// Drops all timers unfired.
  void releaseCallbacks();

 private:
  using Key = std::pair<std::chrono::nanoseconds, TimerID>;

  mutable std::mutex mutex_;
  std::chrono::nanoseconds monotonic_{std::chrono::seconds(1000)};
  Date wall_ = kStart;
  std::chrono::minutes zone_{0};
  TimerID lastTimer_ = 0;
  std::map<Key, std::function<void()>> timers_;
};

}  // namespace ostrel
