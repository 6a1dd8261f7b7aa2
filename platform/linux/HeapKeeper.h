#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>

#include "platform/Task.h"
#include "platform/linux/TimerThread.h"

namespace ostrel {

/// Keeps the heap large during a burst of requests and small after it.
///
/// Giving memory back to the system after every batch of requests, and taking it again
/// for the next, costs 4 page faults for 100 messages.
class HeapKeeper : public std::enable_shared_from_this<HeapKeeper> {
 public:
  /// What the keeper takes from its surroundings.
  struct Calls {
    /// Runs the action once, when so much time has passed; from any thread.
    std::function<void(std::chrono::milliseconds delay, Task action)> scheduleAfter;
    /// Gives free memory back to the system. Called in the actions.
    std::function<void()> giveBack;
  };

  /// Work makes a burst from so many rounds on; some free memory may stay for less.
  static constexpr std::size_t kRoundsOfBurst = 64;
  /// So long without any work ends it.
  static constexpr std::chrono::milliseconds kQuiet{500};

  /// One for the process. From here on the heap keeps some free memory.
  explicit HeapKeeper(std::shared_ptr<TimerThread> timers);
  /// One for a heap that is somebody else's.
  explicit HeapKeeper(Calls calls);

  /// A round of work; one thread. Two memory accesses, and a timer for each burst.
  void noteWork() {
    hasWorked_.store(true, std::memory_order_relaxed);
    if (++rounds_ < kRoundsOfBurst || isWatching_.load(std::memory_order_relaxed)) return;
    rounds_ = 0;
    isWatching_.store(true, std::memory_order_relaxed);
    watch();
  }

 private:
  void watch();

  const Calls calls_;
  std::size_t rounds_ = 0;  // The working thread's.
  std::atomic<bool> hasWorked_{false};
  std::atomic<bool> isWatching_{false};
};

}  // namespace ostrel
