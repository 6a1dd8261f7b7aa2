#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <thread>

#include "platform/Task.h"

namespace ostrel {

/// One thread that runs actions at their time. It sleeps until the next one is
/// due, and without one for ever. All operations from any thread.
class TimerThread {
 public:
  using Time = std::chrono::steady_clock::time_point;

  /// Names a timer. The one made by default names none.
  struct TimerID {
    Time due;
    std::uint64_t number = 0;

    friend auto operator<=>(const TimerID&, const TimerID&) = default;
  };

  /// Throws std::system_error when no thread can be made.
  TimerThread();
  /// Drops the timers that have not fired. May run inside an action.
  ~TimerThread();
  TimerThread(const TimerThread&) = delete;
  TimerThread& operator=(const TimerThread&) = delete;

  /// Runs `action` on the timer thread once `delay` has passed; 0 or below is
  /// soon, and a delay too long for the clock is never. Actions hand work on
  /// and return at once. Those due together run in the order of the calls.
  TimerID scheduleAfter(std::chrono::nanoseconds delay, Task action);

  /// True when the action will not run; false when it has run, runs, or the
  /// timer is none.
  bool cancel(TimerID timer);

 private:
  struct State;

  const std::shared_ptr<State> state_;
  std::thread thread_;
};

}  // namespace ostrel
