#include <gtest/gtest.h>

#include <chrono>

#include "Statistics/Service/SessionTestFixture.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using Events = std::vector<std::string>;

constexpr std::uint16_t kGeneric = 0;
constexpr std::uint16_t kTelephony = 2;
constexpr std::uint16_t kLongFormAudio = 7;
constexpr const char* kID = "OstrelReportingService 42";

// Codes of the fake's device and interface.
constexpr std::int32_t kDeviceNormal = 1;
constexpr std::int32_t kDeviceLeftUp = 3;
constexpr std::int32_t kInterface90 = 11;

class OstrelReportingSessionOrientation : public SessionTest {
 protected:
  OstrelReportingSessionOrientation() { makeInternalBuild(); }

  FakeOrientationService& orientation() { return *fakes.orientationService; }
};

TEST_F(OstrelReportingSessionOrientation, RegistersBothObserversAtTheEndOfAStart) {
  const auto session = makeSession(42);
  session->setServiceType(ServiceType{kTelephony});
  fakes.runUntilIdle();
  forgetRecords();

  session->start();
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x2104282c", "backend.makeHierarchyToken",
                    "backend.createSession 1", "backend.startConfiguration 1",
                    "orientation.registerDevice OstrelReportingService 42",
                    "orientation.registerInterface OstrelReportingService 42"}));
}

TEST_F(OstrelReportingSessionOrientation, RegistersForLongFormAudio) {
  makeStarted(kLongFormAudio);

  EXPECT_EQ(orientation().deviceObservers(), Events{kID});
  EXPECT_EQ(orientation().interfaceObservers(), Events{kID});
}

TEST_F(OstrelReportingSessionOrientation, RegistersWhenDetachedToo) {
  makeDetached(kTelephony);

  EXPECT_EQ(orientation().deviceObservers(), Events{kID});
  EXPECT_EQ(orientation().interfaceObservers(), Events{kID});
}

TEST_F(OstrelReportingSessionOrientation, RegistersNothingForAGenericSession) {
  const auto session = makeStarted(kGeneric);

  orientation().turnDevice(kDeviceLeftUp);

  EXPECT_EQ(orientation().deviceObservers(), Events{});
  EXPECT_EQ(entriesOf(*session), Events{});
}

TEST_F(OstrelReportingSessionOrientation,
       DoesNotRegisterAgainForAStartOfAStartedSession) {
  const auto session = makeStarted(kTelephony);

  session->start();
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(), Events{});
}

TEST_F(OstrelReportingSessionOrientation, RecordsADeviceChangeWithItsTime) {
  const auto session = makeStarted(kTelephony);
  fakes.clock->advance(milliseconds(1500));

  orientation().turnDevice(kDeviceLeftUp);

  EXPECT_EQ(entriesOf(*session),
            Events{"{device_orientation: left-up, device_orientation_time: 1.5}"});
}

TEST_F(OstrelReportingSessionOrientation, RecordsAnInterfaceChangeWithItsTime) {
  const auto session = makeStarted(kTelephony);
  fakes.clock->advance(milliseconds(2250));

  orientation().turnInterface(kInterface90);

  EXPECT_EQ(entriesOf(*session),
            Events{"{ui_orientation: 90, ui_orientation_time: 2.25}"});
}

TEST_F(OstrelReportingSessionOrientation, KeepsTwoElementEntriesOfOrientation) {
  const auto session = makeStarted(kTelephony);
  orientation().turnDevice(kDeviceNormal);
  orientation().turnInterface(kInterface90);

  const auto list = session->aggregatedPayloadData();
  list->lock()->snapshot().forEach(
      [](ValueView entry) { EXPECT_EQ(entry.dictionary()->size(), 2u); });
  EXPECT_EQ(list->lock()->size(), 2u);
}

TEST_F(OstrelReportingSessionOrientation, SendsNothingToTheBackend) {
  makeStarted(kTelephony);

  orientation().turnDevice(kDeviceLeftUp);
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(), Events{});
}

TEST_F(OstrelReportingSessionOrientation, LogsEachChangeAtDebugLevel) {
  const auto session = makeStarted(kTelephony);
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "App"}});
  fakes.clock->advance(milliseconds(1500));

  orientation().turnDevice(kDeviceLeftUp);
  orientation().turnInterface(kInterface90);

  EXPECT_EQ(takeLines(),
            (LogLines{debugLine("osrr",
                                "Orientation handler callback mode=device "
                                "orientation=\"left-up\" app=\"App\", time=1.500000, "
                                "id=\"OstrelReportingService 42\""),
                      debugLine("osrr",
                                "Orientation handler callback mode=ui orientation=\"90\" "
                                "app=\"App\", time=1.500000, "
                                "id=\"OstrelReportingService 42\"")}));
}

TEST_F(OstrelReportingSessionOrientation, LogsAMissingApplicationAsNull) {
  makeStarted(kTelephony);

  orientation().turnDevice(kDeviceLeftUp);

  ASSERT_EQ(fakes.log->texts(LogLevel::kDebug).size(), 1u);
  EXPECT_NE(fakes.log->texts(LogLevel::kDebug)[0].find(" app=\"(null)\","),
            std::string::npos);
}

TEST_F(OstrelReportingSessionOrientation, LogsNothingUnlessVerbose) {
  const auto session = makeStarted(kTelephony);
  fakes.log->setVerbosity("reporting_rtc_verbose", /*verbosity=*/0);

  orientation().turnDevice(kDeviceLeftUp);

  EXPECT_EQ(takeLines(), LogLines{});
  EXPECT_EQ(entriesOf(*session).size(), 1u);
}

TEST_F(OstrelReportingSessionOrientation, UnregistersBothBeforeTheSummary) {
  const auto session = makeStarted(kTelephony);
  orientation().turnDevice(kDeviceLeftUp);

  stop(*session);

  const Events events = takeEvents();
  ASSERT_GE(events.size(), 3u);
  EXPECT_EQ(events[0], "orientation.unregisterDevice OstrelReportingService 42");
  EXPECT_EQ(events[1], "orientation.unregisterInterface OstrelReportingService 42");
  EXPECT_EQ(events[2], "trace 0x21042830");
  EXPECT_EQ(orientation().deviceObservers(), Events{});
}

TEST_F(OstrelReportingSessionOrientation, SummaryJoinsNamesAndTimes) {
  const auto session = makeStarted(kTelephony);
  fakes.clock->advance(milliseconds(500));
  orientation().turnDevice(kDeviceLeftUp);
  fakes.clock->advance(milliseconds(1000));
  orientation().turnInterface(kInterface90);
  orientation().turnDevice(kDeviceNormal);

  stop(*session);

  const auto messages = fakes.telemetryBackend->session(1)->messages();
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_EQ(messages[0].payload, (Dictionary{{"Ostrel_Session_Summary_Event", "2"},
                                             {"device_orientation", "left-up,normal"},
                                             {"device_orientation_time", "0.5,1.5"},
                                             {"ui_orientation", "90"},
                                             {"ui_orientation_time", "1.5"}}));
}

TEST_F(OstrelReportingSessionOrientation, UnregistersWhetherStartedOrNot) {
  const auto session = makeStarted(kTelephony);
  stop(*session);
  forgetRecords();

  stop(*session);

  EXPECT_EQ(takeEvents(),
            (Events{"orientation.unregisterDevice OstrelReportingService 42",
                    "orientation.unregisterInterface OstrelReportingService 42"}));
}

TEST_F(OstrelReportingSessionOrientation, TestsAfreshAtTheStop) {
  const auto session = makeStarted(kTelephony);
  fakes.deviceInfo->setDeviceClass(6);

  stop(*session);

  EXPECT_EQ(orientation().deviceObservers(), Events{kID});
  EXPECT_EQ(orientation().interfaceObservers(), Events{kID});
}

TEST_F(OstrelReportingSessionOrientation, MovesWithTheTypeOfAStartedSession) {
  const auto session = makeStarted(kTelephony);

  session->setServiceType(ServiceType{kGeneric});
  fakes.runUntilIdle();
  EXPECT_EQ(orientation().deviceObservers(), Events{});
  session->setServiceType(ServiceType{kLongFormAudio});
  fakes.runUntilIdle();

  EXPECT_EQ(orientation().deviceObservers(), Events{kID});
}

TEST_F(OstrelReportingSessionOrientation, LateCallbackAppendsToNoList) {
  const auto session = makeStarted(kTelephony);
  const auto device = orientation().deviceCallback(kID);
  const auto interface = orientation().interfaceCallback(kID);
  stop(*session);

  device(kDeviceLeftUp);
  interface(kInterface90);

  EXPECT_EQ(entriesOf(*session), Events{"none"});
}

TEST_F(OstrelReportingSessionOrientation, LateCallbackAppendsToTheListOfTheNextStart) {
  const auto session = makeStarted(kTelephony);
  const auto device = orientation().deviceCallback(kID);
  stop(*session);
  fakes.clock->advance(seconds(10));
  session->start();
  fakes.runUntilIdle();
  fakes.clock->advance(seconds(1));

  device(kDeviceLeftUp);

  EXPECT_EQ(entriesOf(*session),
            Events{"{device_orientation: left-up, device_orientation_time: 1}"});
}

TEST_F(OstrelReportingSessionOrientation, ObserversKeepTheSessionUntilUnregistered) {
  auto session = makeStarted(kTelephony);
  fakes.telemetryBackend->releaseCallbacks();  // The backend's own reference.
  forgetRecords();
  OstrelReportingSession* const observed = session.get();

  session.reset();
  EXPECT_EQ(fakes.events->count("trace 0x21042834"), 0u);
  stop(*observed);

  EXPECT_EQ(fakes.events->count("trace 0x21042834"), 1u);
}

}  // namespace
}  // namespace ostrel
