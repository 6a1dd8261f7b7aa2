#pragma once

#include <memory>
#include <string>

#include "platform/fake/FakePlatform.h"

namespace ostrel {

/// What surrounds one service under test: the twins that it calls and that the test
/// steers. The core and the reference each have their own, handled alike.
struct Surroundings {
  /// Twins that belong to no platform.
  Surroundings();
  explicit Surroundings(const FakePlatform& platform);

  SharedEventLog events;
  std::shared_ptr<ManualClock> clock;
  std::shared_ptr<FakeRandom> random;
  std::shared_ptr<FakeFileSystem> fileSystem;
  std::shared_ptr<FakeJSONSerialization> json;
  std::shared_ptr<FakeUserDefaults> userDefaults;
  std::shared_ptr<FakeProcessInfo> processInfo;
  std::shared_ptr<FakeDeviceInfo> deviceInfo;
  std::shared_ptr<FakeTelemetryBackend> telemetryBackend;
  std::shared_ptr<RecordingAnalyticsSink> analyticsSink;
  std::shared_ptr<RecordingWattlogSink> wattlogSink;
  std::shared_ptr<FakeChannelReportingService> channels;
  std::shared_ptr<FakeOrientationService> orientation;
  std::shared_ptr<RecordingKernelTrace> kernelTrace;
  std::shared_ptr<FakeIPCListener> listener;
};

}  // namespace ostrel
