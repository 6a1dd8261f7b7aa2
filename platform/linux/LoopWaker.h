#pragma once

#include <cstdint>
#include <mutex>
#include <vector>

#include "platform/ThreadAnnotations.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel {

/// Through it other threads tell the listener's loop which connections need it.
/// However many do before the loop looks, it costs them one system call, and none
/// while the loop does not wait.
class LoopWaker {
 public:
  using ConnectionID = std::uint64_t;

  struct Work {
    std::vector<ConnectionID> connections;  // That have something to write or to end.
    bool hasBudgetEased = false;            // A connection that is held back may go on.
  };

  LoopWaker();

  /// Readable when there may be work.
  int descriptor() const { return event_.get(); }

  // Any thread; none blocks.
  void needsAttention(ConnectionID connection);
  void budgetEased();

  // The loop's.

  /// The work since the last call, in `work`, whose memory is used again.
  void take(Work& work);
  /// Before each wait: false when there is work already. From now on whoever
  /// brings some makes `descriptor` readable.
  bool beginWait();
  /// After each wait.
  void endWait();
  /// When `descriptor` was readable.
  void clear();

 private:
  void wake(std::unique_lock<std::mutex> lock);

  const FileDescriptor event_;
  std::mutex mutex_;  // Of what follows.
  Work work_;
  bool isWaiting_ = false;  // And nobody has woken it.
};

}  // namespace ostrel
