#include "platform/linux/HeapKeeper.h"

#include <fcntl.h>
#include <malloc.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <utility>

#include "platform/linux/FileDescriptor.h"

namespace ostrel {
namespace {

constexpr int kHeaps = 2;

// Of each heap. Two batches of requests for each of the threads that free them.
constexpr int kKeptBytes = 2 * 1024 * 1024;

// Pieces from this size on have pages of their own, and give them back. Said
// anew, since it would move when `kKeptBytes` is set.
constexpr int kOwnPagesBytes = 256 * 1024;

// 0 where the system does not say.
std::size_t residentBytes() {
  static const auto pageBytes = static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
  const FileDescriptor file(::open("/proc/self/statm", O_RDONLY | O_CLOEXEC));
  char text[128];
  const ssize_t size = ::read(file.get(), text, sizeof text);
  const char* const end = text + std::max<ssize_t>(size, 0);
  const char* const second = std::find(static_cast<const char*>(text), end, ' ');
  std::size_t pages = 0;
  if (second != end) std::from_chars(second + 1, end, pages);
  return pages * pageBytes;
}

}  // namespace

void shareHeaps() { ::mallopt(M_ARENA_MAX, kHeaps); }

HeapKeeper::HeapKeeper(std::shared_ptr<TimerThread> timers)
    : HeapKeeper(
          {[timers = std::move(timers)](std::chrono::milliseconds delay, Task action) {
             timers->scheduleAfter(delay, std::move(action));
           },
           [] { ::malloc_trim(0); }, residentBytes}) {
  ::mallopt(M_TRIM_THRESHOLD, kKeptBytes);
  ::mallopt(M_MMAP_THRESHOLD, kOwnPagesBytes);
}

HeapKeeper::HeapKeeper(Calls calls) : calls_(std::move(calls)) {}

// Free memory lies between what is used, in the heap of each thread that took some once:
// a flood of all kinds of requests left as much again as it used.
void HeapKeeper::lookAtSize(Clock::time_point now) {
  nextLook_ = now + kBetweenLooks;
  const std::size_t resident = calls_.residentBytes();
  if (resident > mostResident_) {
    calls_.giveBack();
    mostResident_ = std::max(kMostResident, calls_.residentBytes() + kGrowth);
  } else {
    mostResident_ = std::min(mostResident_, std::max(kMostResident, resident + kGrowth));
  }
}

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
