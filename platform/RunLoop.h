#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string_view>

#include "platform/Task.h"

namespace ostrel {

/// A one-shot timer. Its date stands from when it is made, but it fires only on
/// a run loop that it was added to. Operations from any thread.
class RunLoopTimer {
 public:
  virtual ~RunLoopTimer() = default;

  /// Sets the date to `delay` from now, sooner or later than it was. 0 and below
  /// is now. Nothing once the timer has begun to fire or is invalid.
  virtual void setFireDate(std::chrono::nanoseconds delay) = 0;

  /// The timer fires no more and leaves its run loop.
  virtual void invalidate() = 0;
};

/// The timers of one thread. Used on that thread only.
class RunLoop {
 public:
  virtual ~RunLoop() = default;

  /// Adds a timer that the same factory made. Adding it twice, or after it fired
  /// or became invalid, changes nothing.
  virtual void add(const std::shared_ptr<RunLoopTimer>& timer) = 0;

  /// Fires each timer at its date or soon after, in the order of their dates,
  /// those of one date as they were added. Returns when no timer is left.
  virtual void run() = 0;
};

/// Threads that wait. All operations from any thread.
class RunLoopFactory {
 public:
  virtual ~RunLoopFactory() = default;

  /// Starts a thread that runs `body` with a run loop of its own and ends when
  /// that returns. `name` is for people; some systems cut it to 15 bytes.
  virtual void startThread(std::string_view name, std::function<void(RunLoop&)> body) = 0;

  /// A timer that is due `delay` from now, 0 and below is now. `action` runs
  /// once at most and throws nothing.
  virtual std::shared_ptr<RunLoopTimer> makeTimer(std::chrono::nanoseconds delay,
                                                  Task action) = 0;

  /// Blocks the calling thread.
  virtual void sleep(std::chrono::nanoseconds duration) = 0;
};

}  // namespace ostrel
