#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <vector>

#include "platform/ThreadAnnotations.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel {

/// Through it other threads tell the listener's loop which connections need it.
/// However many do before the loop looks, it costs them one system call.
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

  /// The work since the last call, in `work`, whose memory is used again. The loop
  /// calls it before each wait.
  void take(Work& work);

  /// The loop calls it when `descriptor` was readable.
  void clear();

 private:
  void wake();

  const FileDescriptor event_;
  std::atomic<bool> isAwake_{false};
  std::mutex mutex_;
  Work work_;  // Guarded by `mutex_`.
};

}  // namespace ostrel
