#include "platform/linux/HeapKeeper.h"

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

HeapKeeper::HeapKeeper(std::shared_ptr<TimerThread> timers)
    : HeapKeeper(
          {[timers = std::move(timers)](std::chrono::milliseconds delay, Task action) {
             timers->scheduleAfter(delay, std::move(action));
           },
           [] { ::malloc_trim(0); }}) {
  ::mallopt(M_TRIM_THRESHOLD, kKeptBytes);
  ::mallopt(M_MMAP_THRESHOLD, kOwnPagesBytes);
}

HeapKeeper::HeapKeeper(Calls calls) : calls_(std::move(calls)) {}

void HeapKeeper::watch() {
  calls_.scheduleAfter(kQuiet, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (!self) return;
    if (self->hasWorked_.exchange(false, std::memory_order_relaxed)) {
      self->watch();
      return;
    }
    self->isWatching_.store(false, std::memory_order_relaxed);
    self->calls_.giveBack();
  });
}

}  // namespace ostrel
