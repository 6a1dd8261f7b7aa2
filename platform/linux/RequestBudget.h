#pragma once

#include <atomic>
#include <cstddef>

namespace ostrel {

/// Bytes that may be under way, and whether somebody waits for them to become fewer.
/// Any thread.
class RequestBudget {
 public:
  explicit RequestBudget(std::size_t most) : most_(most) {}

  /// True when nothing was under way before. Of 0 bytes neither is ever true: what
  /// charges nothing begins and ends nothing.
  bool take(std::size_t bytes) noexcept {
    return used_.fetch_add(bytes) == 0 && bytes != 0;
  }

  struct Given {
    bool tellsWaiter;  // Which is then no waiter any more.
    bool isLast;       // Nothing is under way any more.
  };
  Given give(std::size_t bytes) noexcept {
    const std::size_t left = used_.fetch_sub(bytes) - bytes;
    return {left <= half() && takeWaiter(), left == 0 && bytes != 0};
  }

  /// From now on so many may be under way; what is beyond it runs off. True: a waiter is
  /// to be told, as by `give`.
  bool limitTo(std::size_t most) noexcept {
    if (most_.exchange(most) >= most) return false;
    return used_.load() <= half() && takeWaiter();
  }

  bool isExceeded() const { return isExceededWith(0); }
  bool isExceededWith(std::size_t more) const {
    return used_.load() + more > most_.load();
  }

  /// Begins to wait until at most half is used; false when that is so already.
  bool await() {
    isAwaited_ = true;
    // Whoever gives after this sees the waiter; whoever gave before is seen here.
    return used_.load() > half();
  }

  std::size_t used() const { return used_.load(); }

 private:
  std::size_t half() const { return most_.load() / 2; }
  bool takeWaiter() noexcept { return isAwaited_.load() && isAwaited_.exchange(false); }

  std::atomic<std::size_t> most_;
  std::atomic<std::size_t> used_{0};
  std::atomic<bool> isAwaited_{false};
};

}  // namespace ostrel
