// What a test and the service with faults share: which calls fail, and how many there
// were.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>

namespace ostrel::crash {

/// Kinds of calls that can be made to fail.
enum class Call : std::uint8_t {
  kAccept,
  kReceive,  // From a socket.
  kSend,
  kRead,  // From files, events and watches.
  kWrite,
  kOpen,
  kSync,
  kRename,
  kTruncate,
  kMap,
  kLock,
  kStatus,
  kDirectory,
  kPoll,
  kPollControl,
  kEvent,
  kWatch,
  kSocket,
  kThread,
  kAllocate,
  kSQLiteAllocate,
};
inline constexpr std::size_t kCallKinds = 21;

/// In memory that both map. The variable OSTREL_FAULTS names its file to the service.
struct SharedFaults {
  /// Instead of an error: the process is killed in the call.
  static constexpr int kKill = -1;

  std::atomic<std::uint32_t> kinds{0};  // Of the calls that count, a bit for each.
  std::atomic<std::int64_t> after{0};   // Calls that succeed before.
  std::atomic<bool> isForEver{false};
  std::atomic<int> error{0};
  std::atomic<std::int64_t> matched{0};
  std::atomic<std::int64_t> failed{0};
  std::array<std::atomic<std::int64_t>, kCallKinds> calls{};  // All that were made.
};

}  // namespace ostrel::crash
