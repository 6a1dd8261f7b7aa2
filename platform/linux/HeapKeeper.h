#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>

#include "platform/Task.h"
#include "platform/linux/TimerThread.h"

namespace ostrel {

/// From here on all threads share two heaps; before any is made. With one for each, what
/// is free in one's is of no use to another: under a flood the process was larger by a
/// fifth. With a single one they would wait for one another 5,000 times a second then.
void shareHeaps();

/// Keeps the heap large during a burst of requests and small after it.
///
/// Giving memory back to the system after every batch of requests, and taking it again
/// for the next, costs 4 page faults for 100 messages.
class HeapKeeper : public std::enable_shared_from_this<HeapKeeper> {
 public:
  using Clock = std::chrono::steady_clock;

  /// What the keeper takes from its surroundings.
  struct Calls {
    /// Runs the action once, when so much time has passed; from any thread.
    std::function<void(std::chrono::milliseconds delay, Task action)> scheduleAfter;
    /// Gives free memory back to the system. Called in the actions.
    std::function<void()> giveBack;
    /// What the process has in memory.
    std::function<std::size_t()> residentBytes;
  };

  /// Work makes a burst from so many rounds on; some free memory may stay for less.
  static constexpr std::size_t kRoundsOfBurst = 64;
  /// So long without any work ends it.
  static constexpr std::chrono::milliseconds kQuiet{500};

  /// What the process may have in memory before free memory is given back in the middle
  /// of a burst, and by how much it grows then before that is tried again.
  static constexpr std::size_t kMostResident = 64 * 1024 * 1024;
  static constexpr std::size_t kGrowth = 8 * 1024 * 1024;
  /// How often that is looked at.
  static constexpr std::chrono::milliseconds kBetweenLooks{50};

  /// One for the process. From here on the heap keeps some free memory.
  explicit HeapKeeper(std::shared_ptr<TimerThread> timers);
  /// One for a heap that is somebody else's.
  explicit HeapKeeper(Calls calls);

  /// A round of work; one thread. Some memory accesses, a look at the process's size now
  /// and then, and a timer for each burst.
  void noteWork(Clock::time_point now) {
    if (now >= nextLook_) lookAtSize(now);
    hasWorked_.store(true, std::memory_order_relaxed);
    if (++rounds_ < kRoundsOfBurst || isWatching_.load(std::memory_order_relaxed)) return;
    rounds_ = 0;
    isWatching_.store(true, std::memory_order_relaxed);
    watch();
  }

 private:
  void watch();
  void lookAtSize(Clock::time_point now);

  const Calls calls_;
  // The working thread's.
  std::size_t rounds_ = 0;
  Clock::time_point nextLook_{};
  std::size_t mostResident_ = kMostResident;

  std::atomic<bool> hasWorked_{false};
  std::atomic<bool> isWatching_{false};
};

}  // namespace ostrel
