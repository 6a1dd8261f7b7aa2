// Each thread keeps a few steps' memory for itself. A thread that has more ends than
// beginnings gives a batch to the stock, one that has less takes one from there; so
// the stock's lock is taken once a batch, and the allocator is asked only while more
// steps wait than ever did.
#include "platform/linux/QueuedSteps.h"

#include <cstddef>
#include <mutex>

#include "platform/SmallMutex.h"

namespace ostrel {
namespace {

constexpr std::size_t kBatch = 64;
constexpr std::size_t kMostBatches = QueuedStep::kMostKept / kBatch;

QueuedStep* popFrom(QueuedStep*& list) { return std::exchange(list, list->next); }

void freeAll(QueuedStep* list) noexcept {
  while (list != nullptr) delete popFrom(list);
}

/// What no thread keeps. Never destroyed: threads may end after `main`.
struct Stock {
  SmallMutex mutex;
  QueuedStep* batches[kMostBatches];
  std::size_t count = 0;
};

Stock& stock() {
  static Stock& instance = *new Stock;
  return instance;
}

/// One thread's.
struct Kept {
  QueuedStep* steps = nullptr;
  std::size_t count = 0;
  QueuedStep* full = nullptr;  // A whole batch beside `steps`, so that a thread that
                               // goes up and down does not go to the stock each time.
  ~Kept();
};

thread_local Kept kept;
// Whether the thread's has ended. Not in there: compilers leave out what a destructor
// writes to its own object.
thread_local bool hasEnded = false;

Kept::~Kept() {
  hasEnded = true;
  freeAll(steps);
  freeAll(full);
}

QueuedStep* takeBatch() {
  Stock& from = stock();
  const std::lock_guard lock(from.mutex);
  return from.count > 0 ? from.batches[--from.count] : nullptr;
}

void giveBatch(QueuedStep* batch) noexcept {
  {
    Stock& to = stock();
    const std::lock_guard lock(to.mutex);
    if (to.count < kMostBatches) {
      to.batches[to.count++] = batch;
      return;
    }
  }
  freeAll(batch);
}

QueuedStep* takeMemory() {
  if (hasEnded) return new QueuedStep;
  Kept& mine = kept;
  if (mine.steps == nullptr) {
    mine.steps = mine.full != nullptr ? std::exchange(mine.full, nullptr) : takeBatch();
    if (mine.steps == nullptr) return new QueuedStep;
    mine.count = kBatch;
  }
  --mine.count;
  QueuedStep* const step = popFrom(mine.steps);
  if (mine.steps != nullptr) mine.steps->fetchAhead();
  return step;
}

}  // namespace

QueuedStep* QueuedStep::make(Task&& task) {
  QueuedStep* const step = takeMemory();
  step->task = std::move(task);
  if (Burden::current() != nullptr) step->burden = BurdenShare::current();
  return step;
}

void QueuedStep::takeBack(QueuedStep* step) noexcept {
  if (hasEnded) {
    delete step;
    return;
  }
  Kept& mine = kept;
  if (mine.count == kBatch) {
    if (mine.full != nullptr) giveBatch(mine.full);
    mine.full = std::exchange(mine.steps, nullptr);
    mine.count = 0;
  }
  step->next = mine.steps;
  mine.steps = step;
  ++mine.count;
}

}  // namespace ostrel
