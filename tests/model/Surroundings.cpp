#include "tests/model/Surroundings.h"

namespace ostrel {

Surroundings::Surroundings()
    : events(std::make_shared<EventLog>()),
      clock(std::make_shared<ManualClock>()),
      random(std::make_shared<FakeRandom>()),
      fileSystem(std::make_shared<FakeFileSystem>(events)),
      json(std::make_shared<FakeJSONSerialization>(events)),
      userDefaults(std::make_shared<FakeUserDefaults>(events)),
      processInfo(std::make_shared<FakeProcessInfo>(events)),
      deviceInfo(std::make_shared<FakeDeviceInfo>(events)),
      telemetryBackend(std::make_shared<FakeTelemetryBackend>(events)),
      analyticsSink(std::make_shared<RecordingAnalyticsSink>(events)),
      wattlogSink(std::make_shared<RecordingWattlogSink>(events)),
      channels(std::make_shared<FakeChannelReportingService>(events)),
      orientation(std::make_shared<FakeOrientationService>(events)),
      kernelTrace(std::make_shared<RecordingKernelTrace>(events)),
      listener(std::make_shared<FakeIPCListener>(events)) {}

Surroundings::Surroundings(const FakePlatform& platform)
    : events(platform.events),
      clock(platform.clock),
      random(platform.random),
      fileSystem(platform.fileSystem),
      json(platform.json),
      userDefaults(platform.userDefaults),
      processInfo(platform.processInfo),
      deviceInfo(platform.deviceInfo),
      telemetryBackend(platform.telemetryBackend),
      analyticsSink(platform.analyticsSink),
      wattlogSink(platform.wattlogSink),
      channels(platform.channelReportingService),
      orientation(platform.orientationService),
      kernelTrace(platform.kernelTrace),
      listener(platform.listener) {}

}  // namespace ostrel
