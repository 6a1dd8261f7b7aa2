#include "platform/linux/LoopWaker.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <utility>

namespace ostrel {

LoopWaker::LoopWaker() : event_(::eventfd(/*initval=*/0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

void LoopWaker::needsAttention(ConnectionID connection) {
  {
    const std::lock_guard lock(mutex_);
    work_.connections.push_back(connection);
  }
  wake();
}

void LoopWaker::budgetEased() {
  {
    const std::lock_guard lock(mutex_);
    work_.hasBudgetEased = true;
  }
  wake();
}

void LoopWaker::wake() {
  if (isAwake_.exchange(true)) return;
  const std::uint64_t one = 1;
  [[maybe_unused]] const ssize_t written = ::write(event_.get(), &one, sizeof one);
}

void LoopWaker::take(Work& work) {
  work.connections.clear();
  work.hasBudgetEased = false;
  const std::lock_guard lock(mutex_);
  std::swap(work, work_);
}

void LoopWaker::clear() {
  std::uint64_t count;
  [[maybe_unused]] const ssize_t got = ::read(event_.get(), &count, sizeof count);
  isAwake_ = false;
}

}  // namespace ostrel
