#include "platform/linux/Heap.h"

#include <malloc.h>

namespace ostrel {
namespace {

// Of each arena. Two batches of requests for each of the threads that free them.
constexpr int kKeptBytes = 2 * 1024 * 1024;

// Pieces from this size on have pages of their own, and give them back. Said
// anew, since it would move when `kKeptBytes` is set.
constexpr int kOwnPagesBytes = 256 * 1024;

}  // namespace

void keepHeapForBursts() {
  ::mallopt(M_TRIM_THRESHOLD, kKeptBytes);
  ::mallopt(M_MMAP_THRESHOLD, kOwnPagesBytes);
}

void giveBackHeap() { ::malloc_trim(0); }

}  // namespace ostrel
