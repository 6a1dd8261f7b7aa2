#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>

namespace ostrel {

/// The time that passes while the tool waits.
class ToolClock {
 public:
  virtual ~ToolClock() = default;

  virtual void sleep(std::chrono::nanoseconds duration) = 0;
  /// Waits on `changed` until `done` or until `longest` is over. `lock` is held
  /// at the call, while `done` is asked, and at the end.
  virtual void wait(std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
                    std::chrono::nanoseconds longest,
                    const std::function<bool()>& done) = 0;
};

/// The time of the world.
ToolClock& realToolClock();

}  // namespace ostrel
