#pragma once

#include <chrono>
#include <memory>

#include "platform/OstrelReportingPlatform.h"
#include "platform/fake/EventLog.h"
#include "platform/fake/FakeChangeNotification.h"
#include "platform/fake/FakeChannelReportingService.h"
#include "platform/fake/FakeDeviceInfo.h"
#include "platform/fake/FakeEntryStorage.h"
#include "platform/fake/FakeFileSystem.h"
#include "platform/fake/FakeIPCListener.h"
#include "platform/fake/FakeJSONSerialization.h"
#include "platform/fake/FakeOrientationService.h"
#include "platform/fake/FakeProcessInfo.h"
#include "platform/fake/FakeRandom.h"
#include "platform/fake/FakeTelemetryBackend.h"
#include "platform/fake/FakeUserDefaults.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualCondition.h"
#include "platform/fake/ManualWorkQueue.h"
#include "platform/fake/RecordingKernelTrace.h"
#include "platform/fake/RecordingLog.h"
#include "platform/fake/RecordingSinks.h"

namespace ostrel {

/// A whole platform in memory, on manual time, with one list of events. Its log
/// is the process's log while it lives, so there is one at a time.
///
/// Declare it before what uses it. Its end drops every callback and step that a
/// fake still holds, so that nothing keeps itself alive in a circle.
class FakePlatform {
 public:
  FakePlatform();
  ~FakePlatform();
  FakePlatform(const FakePlatform&) = delete;
  FakePlatform& operator=(const FakePlatform&) = delete;

  /// What the service is handed. The log is not in it and is in force already.
  OstrelReportingPlatform platform() const;

  /// Runs every step that can run, on the calling thread.
  void runUntilIdle() { workQueues->runUntilIdle(); }

  /// Runs until idle, then moves time on: at each delay or timeout on the way
  /// the clock stands still, what is due fires, and all steps run until idle.
  void advance(std::chrono::nanoseconds duration);

  const SharedEventLog events = std::make_shared<EventLog>();
  const std::shared_ptr<RecordingLog> log = RecordingLog::install();
  const std::shared_ptr<ManualClock> clock = std::make_shared<ManualClock>();
  const std::shared_ptr<ManualWorkQueueFactory> workQueues =
      std::make_shared<ManualWorkQueueFactory>(clock);
  const std::shared_ptr<ManualConditionFactory> conditions =
      std::make_shared<ManualConditionFactory>(clock);
  const std::shared_ptr<FakeRandom> random = std::make_shared<FakeRandom>();
  const std::shared_ptr<FakeFileSystem> fileSystem =
      std::make_shared<FakeFileSystem>(events);
  const std::shared_ptr<FakeEntryStorage> entryStorage =
      std::make_shared<FakeEntryStorage>();
  const std::shared_ptr<FakeJSONSerialization> json =
      std::make_shared<FakeJSONSerialization>(events);
  const std::shared_ptr<FakeChangeNotification> notifications =
      std::make_shared<FakeChangeNotification>(events);
  const std::shared_ptr<FakeUserDefaults> userDefaults =
      std::make_shared<FakeUserDefaults>(events);
  const std::shared_ptr<FakeProcessInfo> processInfo =
      std::make_shared<FakeProcessInfo>(events);
  const std::shared_ptr<FakeDeviceInfo> deviceInfo =
      std::make_shared<FakeDeviceInfo>(events);
  const std::shared_ptr<FakeTelemetryBackend> telemetryBackend =
      std::make_shared<FakeTelemetryBackend>(events);
  const std::shared_ptr<RecordingAnalyticsSink> analyticsSink =
      std::make_shared<RecordingAnalyticsSink>(events);
  const std::shared_ptr<RecordingWattlogSink> wattlogSink =
      std::make_shared<RecordingWattlogSink>(events);
  const std::shared_ptr<FakeChannelReportingService> channelReportingService =
      std::make_shared<FakeChannelReportingService>(events);
  const std::shared_ptr<FakeOrientationService> orientationService =
      std::make_shared<FakeOrientationService>(events);
  const std::shared_ptr<RecordingKernelTrace> kernelTrace =
      std::make_shared<RecordingKernelTrace>(events);
  /// Not a part of `platform()`: the entry is handed its listener by itself.
  const std::shared_ptr<FakeIPCListener> listener =
      std::make_shared<FakeIPCListener>(events);
};

}  // namespace ostrel
