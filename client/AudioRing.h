#pragma once

#include <algorithm>
#include <atomic>
#include <bit>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>

#include "ostrel/AudioSender.h"

namespace ostrel::reporting {

/// Whole frames on their way from one audio thread to the client's thread. Each
/// side owns one position; neither ever waits for the other.
struct AudioSender::Ring {
 public:
  Ring(std::size_t bytes, std::chrono::microseconds toWait,
       std::weak_ptr<ClientCore> owner)
      : period(std::max(toWait, std::chrono::microseconds(kShortestPeriod))),
        core(std::move(owner)),
        capacity_(std::bit_ceil(std::clamp(bytes, kLeastBytes, kMostBytes))),
        bytes_(std::make_unique<char[]>(capacity_)) {}  // Zeroed, so in memory.

  /// On the audio thread. With a number set before it, 8.5 ns in the whole-path
  /// benchmark (`client_send_ns`).
  bool write(std::string_view frame) noexcept {
    const std::uint64_t tail = tail_.load(std::memory_order_relaxed);
    if (frame.size() > capacity_ - (tail - knownHead_)) {
      knownHead_ = head_.load(std::memory_order_acquire);
      if (frame.size() > capacity_ - (tail - knownHead_)) return false;
    }
    const std::size_t offset = tail & (capacity_ - 1);
    const std::size_t first = std::min(frame.size(), capacity_ - offset);
    std::memcpy(bytes_.get() + offset, frame.data(), first);
    std::memcpy(bytes_.get(), frame.data() + first, frame.size() - first);
    tail_.store(tail + frame.size(), std::memory_order_release);
    return true;
  }

  void countDrop() noexcept {
    dropped_.store(dropped_.load(std::memory_order_relaxed) + 1,
                   std::memory_order_relaxed);
  }
  std::uint64_t dropped() const noexcept {
    return dropped_.load(std::memory_order_relaxed);
  }

  /// On the client's thread: moves all that is there to `out`.
  std::size_t drainInto(std::string& out) {
    const std::uint64_t head = head_.load(std::memory_order_relaxed);
    const std::uint64_t tail = tail_.load(std::memory_order_acquire);
    const std::size_t size = tail - head;
    const std::size_t offset = head & (capacity_ - 1);
    const std::size_t first = std::min(size, capacity_ - offset);
    out.append(bytes_.get() + offset, first);
    out.append(bytes_.get(), size - first);
    head_.store(tail, std::memory_order_release);
    return size;
  }

  std::size_t capacity() const { return capacity_; }

  const std::chrono::microseconds period;
  const std::weak_ptr<ClientCore> core;
  std::atomic<bool> isArmed{true};
  std::atomic<bool> isAbandoned{false};  // Its sender is gone.

  // On the client's thread: drains in a row that found nothing.
  unsigned quietDrains = 0;

 private:
  static constexpr std::chrono::microseconds kShortestPeriod{1'000};
  static constexpr std::size_t kLeastBytes = 4 * 1024;
  static constexpr std::size_t kMostBytes = 64 * 1024 * 1024;

  const std::size_t capacity_;
  const std::unique_ptr<char[]> bytes_;

  // The sides keep off each other's cache lines.
  alignas(64) std::atomic<std::uint64_t> tail_{0};  // Moved by the audio thread,
  std::uint64_t knownHead_ = 0;                     // as these two.
  std::atomic<std::uint64_t> dropped_{0};
  alignas(64) std::atomic<std::uint64_t> head_{0};  // Moved by the client's.
};

}  // namespace ostrel::reporting
