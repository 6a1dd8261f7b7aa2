#pragma once

#include <memory>

#include "platform/Condition.h"
#include "platform/linux/TimerThread.h"

namespace ostrel {

/// Makes conditions whose timeouts come from a timer thread, on the monotonic
/// clock. A waiter runs inside `signal` or on the timer thread, so it only
/// hands work on.
class TimedConditionFactory final : public ConditionFactory {
 public:
  explicit TimedConditionFactory(std::shared_ptr<TimerThread> timers);

  std::shared_ptr<Condition> makeCondition() override;

 private:
  const std::shared_ptr<TimerThread> timers_;
};

}  // namespace ostrel
