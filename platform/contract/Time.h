// The two kinds of time that the contract suites run on: manual and real.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <thread>

#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualCondition.h"
#include "platform/fake/ManualWorkQueue.h"
#include "platform/linux/SystemClock.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "platform/linux/TimedConditionFactory.h"

namespace ostrel {

/// Queues, conditions and a clock that belong together.
class ManualTime {
 public:
  WorkQueueFactory& queues() { return queues_; }
  ConditionFactory& conditions() { return conditions_; }
  Clock& clock() { return *clock_; }

  /// Lets the queues run until all are idle; false when they do not get there.
  bool settle() {
    queues_.runUntilIdle();
    return true;
  }

  /// Lets time pass until `isSo`; false when that does not come.
  bool reaches(const std::function<bool()>& isSo) {
    queues_.runUntilIdle();
    while (!isSo()) {
      const auto due = clock_->nextDue();
      if (!due) return false;
      clock_->advance(*due - clock_->monotonicNow());
      queues_.runUntilIdle();
    }
    return true;
  }

 private:
  const std::shared_ptr<ManualClock> clock_ = std::make_shared<ManualClock>();
  ManualWorkQueueFactory queues_{clock_};
  ManualConditionFactory conditions_{clock_};
};

class RealTime {
 public:
  WorkQueueFactory& queues() { return queues_; }
  ConditionFactory& conditions() { return conditions_; }
  Clock& clock() { return clock_; }

  bool settle() { return queues_.drain(std::chrono::steady_clock::now() + kPatience); }

  bool reaches(const std::function<bool()>& isSo) {
    const auto end = std::chrono::steady_clock::now() + kPatience;
    while (!isSo()) {
      if (std::chrono::steady_clock::now() > end) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
  }

 private:
  // Only a failing test waits so long.
  static constexpr std::chrono::seconds kPatience{30};

  const std::shared_ptr<TimerThread> timers_ = std::make_shared<TimerThread>();
  SystemClock clock_;
  TimedConditionFactory conditions_{timers_};
  ThreadPoolWorkQueues queues_{timers_};
};

}  // namespace ostrel
