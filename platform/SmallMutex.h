#pragma once

#include <atomic>

namespace ostrel {

/// A mutex of four bytes, for objects of which there are many, held for a few
/// instructions at a time. Taking and releasing a free one is one atomic operation
/// each, in the caller's code: half of what `std::mutex` takes. Whoever finds it
/// taken looks a little longer, then sleeps. Not recursive, not fair.
///
/// It may be destroyed by the next holder as soon as that has it.
class SmallMutex {
 public:
  SmallMutex() = default;
  SmallMutex(const SmallMutex&) = delete;
  SmallMutex& operator=(const SmallMutex&) = delete;

  void lock() noexcept {
    if (!try_lock()) lockTaken();
  }

  bool try_lock() noexcept {
    int expected = kFree;
    return state_.compare_exchange_strong(expected, kTaken, std::memory_order_acquire,
                                          std::memory_order_relaxed);
  }

  void unlock() noexcept {
    if (state_.exchange(kFree, std::memory_order_release) == kAwaited) {
      state_.notify_one();
    }
  }

 private:
  static constexpr int kFree = 0;
  static constexpr int kTaken = 1;
  static constexpr int kAwaited = 2;  // Taken, and somebody may sleep.

  // Longer than a holder that has a core needs.
  static constexpr int kLooks = 200;

  void lockTaken() noexcept {
    for (int i = 0; i < kLooks; ++i) {
      if (state_.load(std::memory_order_relaxed) == kFree && try_lock()) return;
    }
    while (state_.exchange(kAwaited, std::memory_order_acquire) != kFree) {
      state_.wait(kAwaited, std::memory_order_relaxed);
    }
  }

  std::atomic<int> state_{kFree};
};

}  // namespace ostrel
