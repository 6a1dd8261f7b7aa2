#pragma once

#include <chrono>
#include <functional>
#include <vector>

#include "ostrelctl/ToolClock.h"

namespace ostrel {

/// Lets no time pass: a wait that would last is over at once, and is noted.
class ManualToolClock final : public ToolClock {
 public:
  std::vector<std::chrono::nanoseconds> sleeps;
  std::vector<std::chrono::nanoseconds> fullWaits;
  /// Called within each sleep, and within each wait that is not done.
  std::function<void()> meanwhile = [] {};

  void sleep(std::chrono::nanoseconds duration) override {
    sleeps.push_back(duration);
    meanwhile();
  }
  void wait(std::unique_lock<std::mutex>& lock, std::condition_variable&,
            std::chrono::nanoseconds longest,
            const std::function<bool()>& done) override {
    if (done()) return;
    lock.unlock();
    meanwhile();
    lock.lock();
    if (!done()) fullWaits.push_back(longest);
  }
};

}  // namespace ostrel
