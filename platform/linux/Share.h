#pragma once

#include <atomic>
#include <cstddef>

namespace ostrel {

/// An amount of something that may be used up: what is asked for is given whole or
/// refused. Any thread.
class Share {
 public:
  explicit Share(std::size_t most) : most_(most) {}
  Share(const Share&) = delete;
  Share& operator=(const Share&) = delete;

  /// False, with nothing taken, when less than `amount` is left.
  bool take(std::size_t amount) noexcept {
    std::size_t used = used_.load(std::memory_order_relaxed);
    do {
      if (amount > most_ || used > most_ - amount) return false;
    } while (!used_.compare_exchange_weak(used, used + amount));
    return true;
  }

  /// Though less is left: for what cannot be refused.
  void takeAnyway(std::size_t amount) noexcept { used_ += amount; }

  void give(std::size_t amount) noexcept { used_ -= amount; }

  std::size_t most() const { return most_; }
  std::size_t used() const { return used_.load(); }

 private:
  const std::size_t most_;
  std::atomic<std::size_t> used_{0};
};

}  // namespace ostrel
