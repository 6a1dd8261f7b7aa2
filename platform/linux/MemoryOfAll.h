#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>

#include "platform/linux/Limits.h"

namespace ostrel {

/// Kinds of memory that clients take, and all of them with their sessions.
enum class MemoryKind : std::size_t { kQueued, kUnread, kHalfFrames, kUserInfos, kAll };
inline constexpr std::size_t kMemoryKinds = 5;
/// Bytes of each.
using MemoryUse = std::array<std::size_t, kMemoryKinds>;

/// What all users of the service have in memory together. While that is more than it may
/// be, each has a sixteenth of it at most: whoever has little notices nothing of those
/// who have much.
class MemoryOfAll {
 public:
  static constexpr MemoryUse kMost = {
      limits::kQueuedBytesOfAll, limits::kUnreadReplyBytesOfAll,
      limits::kHalfFrameBytesOfAll, limits::kUserInfoBytesOfAll,
      limits::kMemoryBytesOfAll};

  MemoryOfAll() : MemoryOfAll(kMost) {}
  explicit MemoryOfAll(const MemoryUse& most) : most_(most) {
    for (std::size_t i = 0; i < kMemoryKinds; ++i) mostOfUser_[i] = SIZE_MAX;
  }

  /// They have so much now. One thread.
  void set(const MemoryUse& used) {
    for (std::size_t i = 0; i < kMemoryKinds; ++i) {
      const std::size_t most =
          used[i] > most_[i] ? most_[i] / limits::kUsersInReserve : SIZE_MAX;
      if (mostOfUser_[i].load(std::memory_order_relaxed) != most) mostOfUser_[i] = most;
    }
  }

  /// What a user may have now, as far as the others are concerned. Any thread.
  std::size_t mostOfUser(MemoryKind kind) const {
    return mostOfUser_[static_cast<std::size_t>(kind)].load(std::memory_order_relaxed);
  }

 private:
  const MemoryUse most_;
  std::array<std::atomic<std::size_t>, kMemoryKinds> mostOfUser_;
};

}  // namespace ostrel
