#include "platform/linux/Heap.h"

#include <malloc.h>

#include <utility>

namespace ostrel {
namespace {

// Of each arena. Two batches of requests for each of the threads that free them.
constexpr int kKeptBytes = 2 * 1024 * 1024;

// Pieces from this size on have pages of their own, and give them back. Said
// anew, since it would move when `kKeptBytes` is set.
constexpr int kOwnPagesBytes = 256 * 1024;

}  // namespace

HeapKeeper::HeapKeeper(std::shared_ptr<TimerThread> timers) : timers_(std::move(timers)) {
  ::mallopt(M_TRIM_THRESHOLD, kKeptBytes);
  ::mallopt(M_MMAP_THRESHOLD, kOwnPagesBytes);
}

void HeapKeeper::watch() {
  timers_->scheduleAfter(kQuiet, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (!self) return;
    if (self->hasWorked_.exchange(false, std::memory_order_relaxed)) {
      self->watch();
      return;
    }
    self->isWatching_.store(false, std::memory_order_relaxed);
    ::malloc_trim(0);
  });
}

}  // namespace ostrel
