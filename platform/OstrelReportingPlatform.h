#pragma once

#include <memory>

namespace ostrel {

class AnalyticsSink;
class ChangeNotification;
class ChannelReportingService;
class Clock;
class ConditionFactory;
class DeviceInfo;
class EntryStorage;
class FileSystem;
class JSONSerialization;
class KernelTrace;
class OrientationService;
class ProcessInfo;
class Random;
class TelemetryBackend;
class UserDefaults;
class WattlogSink;
class WorkQueueFactory;

/// Every service of the platform, one reference a role: made once in `main` (or
/// by a test, of in-memory twins) and handed down by reference. No role is
/// none. The roles outlive everything that was given this object.
///
/// The log is not here: it is the one process-wide replaceable object
/// (`platform/Logging.h`).
struct OstrelReportingPlatform {
  std::shared_ptr<WorkQueueFactory> workQueues;
  std::shared_ptr<ConditionFactory> conditions;
  std::shared_ptr<Clock> clock;
  std::shared_ptr<Random> random;
  std::shared_ptr<FileSystem> fileSystem;
  std::shared_ptr<EntryStorage> entryStorage;
  std::shared_ptr<JSONSerialization> json;
  std::shared_ptr<ChangeNotification> notifications;
  std::shared_ptr<UserDefaults> userDefaults;
  std::shared_ptr<ProcessInfo> processInfo;
  std::shared_ptr<DeviceInfo> deviceInfo;
  std::shared_ptr<TelemetryBackend> telemetryBackend;
  std::shared_ptr<AnalyticsSink> analyticsSink;
  std::shared_ptr<WattlogSink> wattlogSink;
  std::shared_ptr<ChannelReportingService> channelReportingService;
  std::shared_ptr<OrientationService> orientationService;
  std::shared_ptr<KernelTrace> kernelTrace;
};

}  // namespace ostrel
