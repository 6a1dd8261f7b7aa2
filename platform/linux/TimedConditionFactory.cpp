#include "platform/linux/TimedConditionFactory.h"

#include <mutex>
#include <utility>

#include "platform/linux/Burden.h"

namespace ostrel {
namespace {

class TimedCondition final : public Condition,
                             public std::enable_shared_from_this<TimedCondition> {
 public:
  explicit TimedCondition(std::shared_ptr<TimerThread> timers)
      : timers_(std::move(timers)) {}

  void lock() OSTREL_ACQUIRE() OSTREL_NO_THREAD_SAFETY_ANALYSIS override {
    mutex_.lock();
  }
  void unlock() OSTREL_RELEASE() OSTREL_NO_THREAD_SAFETY_ANALYSIS override {
    mutex_.unlock();
  }

  void wait(std::chrono::nanoseconds timeout, Waiter waiter)
      OSTREL_REQUIRES(this) override {
    waiter_ = std::move(waiter);
    // The timer keeps the condition: a waiter is called even when nobody else
    // holds it any more.
    timer_ = timers_->scheduleAfter(
        timeout, [self = shared_from_this(), wait = ++waits_] { self->timeOut(wait); });
  }

  void signal() OSTREL_REQUIRES(this) override {
    const Waiter waiter = std::exchange(waiter_, nullptr);
    if (!waiter) return;
    timers_->cancel(timer_);
    waiter(Wake::kSignalled);
  }

 private:
  void timeOut(std::uint64_t wait) {
    Waiter waiter;
    {
      const std::lock_guard guard(mutex_);
      // A signal came first, and there may be a new waiter already.
      if (wait != waits_) return;
      waiter.swap(waiter_);
    }
    if (waiter) waiter(Wake::kTimedOut);
  }

  const std::shared_ptr<TimerThread> timers_;
  // Of who waits: what they hold meanwhile is theirs.
  const BurdenShare burden_ = BurdenShare::current();
  std::mutex mutex_;  // What `lock` and `unlock` mean; of all that follows.
  std::uint64_t waits_ = 0;
  Waiter waiter_;
  TimerThread::TimerID timer_;
};

}  // namespace

TimedConditionFactory::TimedConditionFactory(std::shared_ptr<TimerThread> timers)
    : timers_(std::move(timers)) {}

std::shared_ptr<Condition> TimedConditionFactory::makeCondition() {
  return std::make_shared<TimedCondition>(timers_);
}

}  // namespace ostrel
