#include "platform/linux/LoopWaker.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <utility>

namespace ostrel {

LoopWaker::LoopWaker() : event_(::eventfd(/*initval=*/0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

void LoopWaker::needsAttention(ConnectionID connection) {
  std::unique_lock lock(mutex_);
  work_.connections.push_back(connection);
  wake(std::move(lock));
}

void LoopWaker::budgetEased() {
  std::unique_lock lock(mutex_);
  work_.hasBudgetEased = true;
  wake(std::move(lock));
}

void LoopWaker::wake(std::unique_lock<std::mutex> lock) {
  if (!std::exchange(isWaiting_, false)) return;
  lock.unlock();
  const std::uint64_t one = 1;
  [[maybe_unused]] const ssize_t written = ::write(event_.get(), &one, sizeof one);
}

void LoopWaker::take(Work& work) {
  work.connections.clear();
  work.hasBudgetEased = false;
  const std::lock_guard lock(mutex_);
  std::swap(work, work_);
}

bool LoopWaker::beginWait() {
  const std::lock_guard lock(mutex_);
  isWaiting_ = work_.connections.empty() && !work_.hasBudgetEased;
  return isWaiting_;
}

void LoopWaker::endWait() {
  const std::lock_guard lock(mutex_);
  isWaiting_ = false;
}

void LoopWaker::clear() {
  std::uint64_t count;
  [[maybe_unused]] const ssize_t got = ::read(event_.get(), &count, sizeof count);
}

}  // namespace ostrel
