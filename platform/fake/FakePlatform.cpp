#include "platform/fake/FakePlatform.h"

#include <algorithm>

namespace ostrel {

FakePlatform::FakePlatform() = default;

FakePlatform::~FakePlatform() {
  listener->releaseCallbacks();
  orientationService->releaseCallbacks();
  notifications->releaseCallbacks();
  telemetryBackend->releaseCallbacks();
  analyticsSink->releaseCallbacks();
  conditions->releaseCallbacks();
  clock->releaseCallbacks();
  workQueues->releaseCallbacks();
  log->uninstall();
}

OstrelReportingPlatform FakePlatform::platform() const {
  return {.workQueues = workQueues,
          .conditions = conditions,
          .clock = clock,
          .random = random,
          .fileSystem = fileSystem,
          .entryStorage = entryStorage,
          .json = json,
          .notifications = notifications,
          .userDefaults = userDefaults,
          .processInfo = processInfo,
          .deviceInfo = deviceInfo,
          .telemetryBackend = telemetryBackend,
          .analyticsSink = analyticsSink,
          .wattlogSink = wattlogSink,
          .channelReportingService = channelReportingService,
          .orientationService = orientationService,
          .kernelTrace = kernelTrace};
}

void FakePlatform::advance(std::chrono::nanoseconds duration) {
  runUntilIdle();
  const std::chrono::nanoseconds target = clock->monotonicNow() + duration;
  while (const auto due = clock->nextDue()) {
    if (*due > target) break;
    clock->advance(std::max(*due - clock->monotonicNow(), std::chrono::nanoseconds(0)));
    runUntilIdle();
  }
  clock->advance(target - clock->monotonicNow());
  runUntilIdle();
}

}  // namespace ostrel
