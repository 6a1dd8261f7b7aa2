#include "platform/fake/ManualCondition.h"

#include <utility>

#include "platform/fake/FakeUse.h"

namespace ostrel {

ManualCondition::ManualCondition(std::shared_ptr<ManualClock> clock)
    : clock_(std::move(clock)) {}

void ManualCondition::lock() OSTREL_NO_THREAD_SAFETY_ANALYSIS {
  checkFakeUse(!isHeld(), "a condition's lock is not taken twice");
  lock_.lock();
  const std::lock_guard guard(mutex_);
  holder_ = std::this_thread::get_id();
}

void ManualCondition::unlock() OSTREL_NO_THREAD_SAFETY_ANALYSIS {
  checkFakeUse(isHeld(), "only the holder gives a condition's lock back");
  {
    const std::lock_guard guard(mutex_);
    holder_ = {};
  }
  lock_.unlock();
}

void ManualCondition::wait(std::chrono::nanoseconds timeout, Waiter waiter) {
  checkFakeUse(isHeld(), "waiting needs the condition's lock");
  checkFakeUse(!hasWaiter(), "a condition has one waiter at a time");
  // The timer keeps the condition: a waiter is called even when nobody else
  // holds it any more.
  const auto timer =
      clock_->scheduleAt(clock_->monotonicNow() + timeout,
                         [self = shared_from_this()] { self->wake(Wake::kTimedOut); });
  const std::lock_guard guard(mutex_);
  waiter_ = std::move(waiter);
  timer_ = timer;
}

void ManualCondition::signal() {
  checkFakeUse(isHeld(), "signalling needs the condition's lock");
  wake(Wake::kSignalled);
}

bool ManualCondition::hasWaiter() const {
  const std::lock_guard guard(mutex_);
  return waiter_ != nullptr;
}

void ManualCondition::wakeSpuriously() {
  checkFakeUse(hasWaiter(), "there is somebody to wake");
  wake(Wake::kSignalled);
}

void ManualCondition::releaseCallbacks() {
  Waiter dropped;  // Destroyed without the lock.
  const std::lock_guard guard(mutex_);
  dropped.swap(waiter_);
}

bool ManualCondition::isHeld() const {
  const std::lock_guard guard(mutex_);
  return holder_ == std::this_thread::get_id();
}

void ManualCondition::wake(Wake reason) {
  Waiter waiter;
  ManualClock::TimerID timer = 0;
  {
    const std::lock_guard guard(mutex_);
    waiter.swap(waiter_);
    timer = std::exchange(timer_, 0);
  }
  if (!waiter) return;
  clock_->cancel(timer);
  waiter(reason);
}

ManualConditionFactory::ManualConditionFactory(std::shared_ptr<ManualClock> clock)
    : clock_(std::move(clock)) {}

std::shared_ptr<Condition> ManualConditionFactory::makeCondition() {
  auto condition = std::make_shared<ManualCondition>(clock_);
  const std::lock_guard lock(mutex_);
  conditions_.push_back(condition);
  return condition;
}

std::vector<std::shared_ptr<ManualCondition>> ManualConditionFactory::conditions() const {
  std::vector<std::shared_ptr<ManualCondition>> alive;
  const std::lock_guard lock(mutex_);
  for (const auto& weak : conditions_) {
    if (auto condition = weak.lock()) alive.push_back(std::move(condition));
  }
  return alive;
}

std::size_t ManualConditionFactory::waiterCount() const {
  std::size_t count = 0;
  for (const auto& condition : conditions()) count += condition->hasWaiter() ? 1 : 0;
  return count;
}

std::size_t ManualConditionFactory::wakeAllSpuriously() {
  std::size_t count = 0;
  for (const auto& condition : conditions()) {
    if (!condition->hasWaiter()) continue;
    condition->wakeSpuriously();
    ++count;
  }
  return count;
}

void ManualConditionFactory::releaseCallbacks() {
  for (const auto& condition : conditions()) condition->releaseCallbacks();
}

}  // namespace ostrel
