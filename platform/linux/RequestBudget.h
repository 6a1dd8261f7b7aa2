#pragma once

#include <atomic>
#include <cstddef>

namespace ostrel {

/// Bytes that may be under way, and whether somebody waits for them to become fewer.
/// Any thread.
class RequestBudget {
 public:
  explicit RequestBudget(std::size_t most) : most_(most) {}

  void take(std::size_t bytes) noexcept { used_ += bytes; }

  /// True when a waiter is to be told, which is then no waiter any more.
  bool give(std::size_t bytes) noexcept {
    return used_.fetch_sub(bytes) - bytes <= most_ / 2 && isAwaited_.load() &&
           isAwaited_.exchange(false);
  }

  bool isExceeded() const { return used_.load() > most_; }

  /// Begins to wait until at most half is used; false when that is so already.
  bool await() {
    isAwaited_ = true;
    // Whoever gives after this sees the waiter; whoever gave before is seen here.
    return used_.load() > most_ / 2;
  }

  std::size_t used() const { return used_.load(); }

 private:
  const std::size_t most_;
  std::atomic<std::size_t> used_{0};
  std::atomic<bool> isAwaited_{false};
};

}  // namespace ostrel
