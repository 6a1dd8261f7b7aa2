// For tests with real threads.
#pragma once

#include <memory>

#include "platform/OstrelReportingPlatform.h"
#include "platform/linux/SystemClock.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "platform/linux/TimedConditionFactory.h"
#include "platform/linux/TimerThread.h"

namespace ostrel::testing_support {

/// Gives the platform the queues, waits and clock of the service, and returns the queues.
inline std::shared_ptr<ThreadPoolWorkQueues> putOnRealQueues(
    OstrelReportingPlatform& platform) {
  const auto timers = std::make_shared<TimerThread>();
  auto queues = std::make_shared<ThreadPoolWorkQueues>(timers);
  platform.workQueues = queues;
  platform.conditions = std::make_shared<TimedConditionFactory>(timers);
  platform.clock = std::make_shared<SystemClock>();
  return queues;
}

}  // namespace ostrel::testing_support
