#include <gtest/gtest.h>

#include <chrono>

#include "Statistics/Service/SessionTestFixture.h"

namespace ostrel {
namespace {

using std::chrono::nanoseconds;
using std::chrono::seconds;
using Events = std::vector<std::string>;

constexpr std::uint16_t kHaptics = 3;
constexpr std::uint16_t kAlarms = 4;
constexpr std::uint16_t kTest = 11;

class OstrelReportingSessionLifecycle : public SessionTest {
 protected:
  /// Counts the calls of the session's completion in `completions`.
  void countCompletions(OstrelReportingSession& session) {
    session.setTransactionCompleteBlock(
        [this](bool complete) { completions.push_back(complete); });
  }

  std::vector<bool> completions;
};

// Creation.

TEST_F(OstrelReportingSessionLifecycle, BeginsWithItsInitialValues) {
  const auto session = OstrelReportingSession::initWithID(
      ReporterID{42}, /*processIdentifiers=*/{12, 13}, platform);

  EXPECT_EQ(session->reporterID(), ReporterID{42});
  EXPECT_EQ(session->processIdentifiers(), (std::vector<ProcessID>{12, 13}));
  EXPECT_FALSE(session->started());
  EXPECT_EQ(session->serviceType(), ServiceType{65535});
  EXPECT_EQ(session->serviceName(), "unknown");
  EXPECT_EQ(session->userInfo(), Dictionary());
  EXPECT_EQ(entriesOf(*session), std::vector<std::string>{});
  EXPECT_EQ(session->driverSnapShot(), nullptr);
  EXPECT_FALSE(session->transactionCompleteBlock());
  EXPECT_EQ(session->orientationCallbackID(), std::nullopt);
  EXPECT_EQ(session->startDate(), std::nullopt);
  EXPECT_EQ(session->reportingSession(), nullptr);
  EXPECT_EQ(session->reportingAgentToken(), std::nullopt);
}

TEST_F(OstrelReportingSessionLifecycle, LogsItsCreationThenTracesIt) {
  fakes.log->recordInto(fakes.events);

  const auto session = makeSession(-9223372036854775807 - 1);

  EXPECT_EQ(takeEvents(), (Events{"log info osrr created reporting session for ID: "
                                  "-9223372036854775808",
                                  "trace 0x21042828"}));
}

TEST_F(OstrelReportingSessionLifecycle, HasASerialUtilityQueueOfItsOwn) {
  const auto first = makeSession(1);
  const auto second = makeSession(2);

  const auto queues = fakes.workQueues->queues();
  ASSERT_EQ(queues.size(), 2u);
  for (const auto& queue : queues) {
    EXPECT_EQ(queue->label(), "com.orbisk.ostrel.reporting.session");
    EXPECT_EQ(queue->qualityOfService(), QualityOfService::kUtility);
    EXPECT_EQ(queue->relativePriority(), 0);
  }
  EXPECT_NE(first->sessionReportingQueue(), second->sessionReportingQueue());
}

TEST_F(OstrelReportingSessionLifecycle, NamesTheSourceOfItsLines) {
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::held());
  const auto session = makeSession(42);
  session->start();
  fakes.runUntilIdle();

  const std::vector<std::string> texts = fakes.log->fullTexts();
  ASSERT_EQ(texts.size(), 3u);
  EXPECT_EQ(texts[0].find("OstrelReportingSession.cpp:"), 0u) << texts[0];
  EXPECT_NE(texts[0].find(":ostrel::OstrelReportingSession::initWithID: created "),
            std::string::npos)
      << texts[0];
  EXPECT_EQ(texts[2].find("OstrelReportingUtility.cpp:"), 0u) << texts[2];
  EXPECT_NE(texts[2].find(":ostrel::OstrelReportingUtilityWait: waiting "),
            std::string::npos)
      << texts[2];
}

// Properties.

TEST_F(OstrelReportingSessionLifecycle, SettersDoNoMoreThanAssign) {
  const auto session = makeSession(42);
  forgetRecords();
  const auto snapShot = std::make_shared<const DriverSnapShot>();

  session->setStarted(true);
  session->setDriverSnapShot(snapShot);
  session->setOrientationCallbackID("id");
  session->setStartDate(Date{5});
  session->setAggregatedPayloadData(nullptr);
  fakes.runUntilIdle();

  EXPECT_TRUE(session->started());
  EXPECT_EQ(session->driverSnapShot(), snapShot);
  EXPECT_EQ(session->orientationCallbackID(), "id");
  EXPECT_EQ(session->startDate(), Date{5});
  EXPECT_EQ(session->aggregatedPayloadData(), nullptr);
  EXPECT_EQ(takeLines(), LogLines{});
  EXPECT_EQ(takeEvents(), Events{});
}

// Configuration and defaults.

TEST_F(OstrelReportingSessionLifecycle, MergesAConfigurationAtOnce) {
  const auto session = makeSession(42);

  session->setConfiguration(Dictionary{{"a", 1}, {"b", 1}});
  session->setConfiguration(Dictionary{{"b", 2}, {"c", 2}});

  EXPECT_EQ(session->userInfo(), (Dictionary{{"a", 1}, {"b", 2}, {"c", 2}}));
}

TEST_F(OstrelReportingSessionLifecycle, IgnoresAnAbsentConfiguration) {
  const auto session = makeSession(42);
  session->setConfiguration(Dictionary{{"a", 1}});

  session->setConfiguration(std::nullopt);

  EXPECT_EQ(session->userInfo(), (Dictionary{{"a", 1}}));
}

TEST_F(OstrelReportingSessionLifecycle, LeavesALiveTelemetrySessionAlone) {
  const auto session = makeStarted(kHaptics);

  session->setConfiguration(Dictionary{{"a", 1}});
  fakes.runUntilIdle();

  EXPECT_EQ(fakes.telemetryBackend->sessionCount(), 1u);
  EXPECT_FALSE(fakes.telemetryBackend->session(1)->userInfo().contains("a"));
  EXPECT_EQ(takeEvents(), Events{});
}

TEST_F(OstrelReportingSessionLifecycle, MergesDefaultsOnItsQueue) {
  const auto session = makeSession(42);
  session->setConfiguration(Dictionary{{"device_name", "old"}, {"a", 1}});

  session->updateDefaults(Dictionary{{"device_name", "new"}, {"disable_reporting", 0}});
  EXPECT_EQ(session->userInfo(), (Dictionary{{"device_name", "old"}, {"a", 1}}));
  fakes.runUntilIdle();

  EXPECT_EQ(session->userInfo(),
            (Dictionary{{"device_name", "new"}, {"a", 1}, {"disable_reporting", 0}}));
}

TEST_F(OstrelReportingSessionLifecycle, IgnoresAbsentDefaults) {
  const auto session = makeSession(42);
  session->setConfiguration(Dictionary{{"a", 1}});

  session->updateDefaults(std::nullopt);
  fakes.runUntilIdle();

  EXPECT_EQ(session->userInfo(), (Dictionary{{"a", 1}}));
}

TEST_F(OstrelReportingSessionLifecycle, KeepsDefaultsMergeNeverRemoving) {
  const auto session = makeSession(42);
  session->updateDefaults(Dictionary{{"device_name", "x"}, {"disable_reporting", 0}});

  session->updateDefaults(Dictionary{{"disable_reporting", 0}});
  fakes.runUntilIdle();

  EXPECT_EQ(session->userInfo(),
            (Dictionary{{"device_name", "x"}, {"disable_reporting", 0}}));
}

// Service type.

TEST_F(OstrelReportingSessionLifecycle, SetsTypeAndNameOnItsQueue) {
  const auto session = makeSession(42);
  forgetRecords();

  session->setServiceType(ServiceType{kAlarms});
  EXPECT_EQ(session->serviceType(), ServiceType{65535});
  fakes.runUntilIdle();

  EXPECT_EQ(session->serviceType(), ServiceType{kAlarms});
  EXPECT_EQ(session->serviceName(), "alarms");
  EXPECT_EQ(takeLines(), LogLines{infoLine("osrr", "setting service type alarms")});
  EXPECT_EQ(takeEvents(), Events{});
}

TEST_F(OstrelReportingSessionLifecycle, SetsAnEqualTypeAgainUnlessStarted) {
  const auto session = makeSession(42);
  session->setServiceType(ServiceType{kAlarms});
  fakes.runUntilIdle();
  forgetRecords();

  session->setServiceType(ServiceType{kAlarms});
  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(), LogLines{infoLine("osrr", "setting service type alarms")});
}

TEST_F(OstrelReportingSessionLifecycle, IgnoresAnEqualTypeOnceStarted) {
  const auto session = makeStarted(kHaptics);
  countCompletions(*session);

  session->setServiceType(ServiceType{kHaptics});
  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(), LogLines{});
  EXPECT_EQ(takeEvents(), Events{});
  EXPECT_TRUE(completions.empty());
}

TEST_F(OstrelReportingSessionLifecycle, RestartsForAnotherType) {
  const auto session = makeStarted(kHaptics);
  countCompletions(*session);
  send(*session, {{"a", 1}}, 1, 0);
  fakes.clock->advance(seconds(5));
  forgetRecords();
  fakes.log->recordInto(fakes.events);

  session->setServiceType(ServiceType{kAlarms});
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(),
            (Events{"log debug osrr ending session 42",
                    "log debug osrr ending session 42", "trace 0x21042830",
                    "log default osrr sending summary event for reporter 42",
                    "log debug osrr sending message for session owned by 42",
                    "analytics com.orbisk.ostrel.Undefined.Unknown", "trace 0x21042838",
                    "backend.sendMessage 1 65535 65535",
                    "log debug osrr TelvarAgent fake session 1 : message "
                    "{Ostrel_Session_Summary_Event: 3, Generic_Generic_1: {a: 1}} : "
                    "category 4294967295 : type 65535",
                    "backend.flush 1", "backend.release 1",
                    "log info osrr setting service type alarms",
                    "log debug osrr starting session owned by 42", "trace 0x2104282c",
                    "backend.makeHierarchyToken", "backend.createSession 2",
                    "backend.startConfiguration 2",
                    "log default osrr List of backends [embedded]"}));
  EXPECT_EQ(completions, std::vector<bool>{true});
  EXPECT_TRUE(session->started());
  EXPECT_EQ(session->reportingAgentToken(), "token-2");
  EXPECT_EQ(session->startDate(), Date{ManualClock::kStart.secondsSince1970 + 5});
  EXPECT_EQ(entriesOf(*session), std::vector<std::string>{});
  EXPECT_EQ(
      fakes.telemetryBackend->session(2)->userInfo().get(kTelvarUserInfoServiceName),
      Value("alarms_session"));
}

TEST_F(OstrelReportingSessionLifecycle, KeepsComparisonWithTheTypeAtTheCall) {
  const auto session = makeStarted(kHaptics);

  session->setServiceType(ServiceType{kAlarms});
  session->setServiceType(ServiceType{kHaptics});  // Equal still: nothing follows.
  fakes.runUntilIdle();

  EXPECT_EQ(session->serviceType(), ServiceType{kAlarms});
  EXPECT_EQ(fakes.telemetryBackend->sessionCount(), 2u);
}

TEST_F(OstrelReportingSessionLifecycle, RestartsForEachOfTwoCallsThatSawAnOlderType) {
  const auto session = makeStarted(kHaptics);

  session->setServiceType(ServiceType{kAlarms});
  session->setServiceType(ServiceType{kAlarms});
  fakes.runUntilIdle();

  EXPECT_EQ(session->serviceType(), ServiceType{kAlarms});
  EXPECT_EQ(fakes.telemetryBackend->sessionCount(), 3u);
}

// Start.

TEST_F(OstrelReportingSessionLifecycle, StartsInItsOrder) {
  const auto session = makeSession(42);
  session->setServiceType(ServiceType{kHaptics});
  fakes.runUntilIdle();
  forgetRecords();
  fakes.log->recordInto(fakes.events);

  session->start();
  EXPECT_EQ(takeEvents(), (Events{"log debug osrr starting session owned by 42"}));
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x2104282c", "backend.makeHierarchyToken",
                    "backend.createSession 1", "backend.startConfiguration 1",
                    "log default osrr List of backends [embedded]"}));
  EXPECT_TRUE(session->started());
  EXPECT_NE(session->reportingSession(), nullptr);
  EXPECT_EQ(session->reportingAgentToken(), "token-1");
  EXPECT_EQ(session->startDate(), ManualClock::kStart);
  EXPECT_EQ(session->orientationCallbackID(), "OstrelReportingService 42");
}

TEST_F(OstrelReportingSessionLifecycle, SaysNothingOfDebugLevelUnlessAsked) {
  fakes.log->setVerbosity("reporting_rtc_verbose", /*verbosity=*/4);
  const auto session = makeSession(42);
  session->start();
  fakes.runUntilIdle();
  send(*session, {{"a", 1}}, 1, 0);
  stop(*session);
  send(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(fakes.log->texts(LogLevel::kDebug), Events{});
}

TEST_F(OstrelReportingSessionLifecycle, GivesTheBackendFiveEntriesOfSessionInfo) {
  const auto session = makeSession(-7);
  session->start();
  fakes.runUntilIdle();

  EXPECT_EQ(fakes.telemetryBackend->session(1)->sessionInfo(),
            (Dictionary{{"kTelvarSessionInfoClientType", 19},
                        {"kTelvarSessionInfoClientVersion", 1.0},
                        {"kTelvarSessionInfoSessionID", -7},
                        {"kTelvarSessionInfoBatchEvent", true},
                        {"kTelvarSessionInfoHierarchyToken", "token-1"}}));
  EXPECT_TRUE(fakes.telemetryBackend->session(1)->frameworksToCheck().empty());
}

TEST_F(OstrelReportingSessionLifecycle, GivesTheBackendTheServiceNameOfASession) {
  makeStarted(kHaptics);

  EXPECT_EQ(fakes.telemetryBackend->session(1)->userInfo(),
            (Dictionary{{"kTelvarUserInfoClientName", "com.orbisk.ostrel"},
                        {"kTelvarUserInfoServiceName", "haptics_session"}}));
}

TEST_F(OstrelReportingSessionLifecycle, NamesTheServiceUnknownWithoutAType) {
  const auto session = makeSession(42);
  session->start();
  fakes.runUntilIdle();

  EXPECT_EQ(
      fakes.telemetryBackend->session(1)->userInfo().get(kTelvarUserInfoServiceName),
      Value("unknown_session"));
}

TEST_F(OstrelReportingSessionLifecycle, LetsTheConfigurationReplaceTheNames) {
  const auto session = makeSession(42);
  session->setConfiguration(Dictionary{{"kTelvarUserInfoServiceName", "mine"},
                                       {"HostApplicationDisplayID", "App"}});
  session->start();
  fakes.runUntilIdle();

  EXPECT_EQ(fakes.telemetryBackend->session(1)->userInfo(),
            (Dictionary{{"kTelvarUserInfoClientName", "com.orbisk.ostrel"},
                        {"kTelvarUserInfoServiceName", "mine"},
                        {"HostApplicationDisplayID", "App"}}));
}

TEST_F(OstrelReportingSessionLifecycle, OnlyLogsAStartOfAStartedSession) {
  const auto session = makeStarted(kHaptics);
  send(*session, {{"a", 1}}, 1, 0);
  fakes.clock->advance(seconds(5));
  forgetRecords();

  session->start();
  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(), (LogLines{debugLine("osrr", "starting session owned by 42"),
                                   infoLine("osrr", "42 is already started")}));
  EXPECT_EQ(takeEvents(), Events{});
  EXPECT_EQ(session->startDate(), ManualClock::kStart);
  EXPECT_EQ(entriesOf(*session).size(), 1u);
}

TEST_F(OstrelReportingSessionLifecycle, StartsASessionOfTheTestTypeWithoutTheBackend) {
  makeInternalBuild();
  const auto session = makeSession(42);
  session->setServiceType(ServiceType{kTest});
  fakes.runUntilIdle();
  forgetRecords();

  session->start();
  fakes.runUntilIdle();

  EXPECT_TRUE(session->started());
  EXPECT_EQ(session->reportingSession(), nullptr);
  EXPECT_EQ(session->reportingAgentToken(), std::nullopt);
  EXPECT_EQ(session->startDate(), ManualClock::kStart);
  EXPECT_EQ(session->orientationCallbackID(), "OstrelReportingService 42");
  EXPECT_EQ(takeEvents(), (Events{"trace 0x2104282c"}));
}

TEST_F(OstrelReportingSessionLifecycle, DropsTheEntriesOfAnEarlierTime) {
  const auto session = makeSession(42);
  send(*session, {{"before", 1}}, 1, 0);
  EXPECT_EQ(entriesOf(*session).size(), 1u);

  session->start();
  fakes.runUntilIdle();

  EXPECT_EQ(entriesOf(*session), Events{});
}

TEST_F(OstrelReportingSessionLifecycle, StartsAtOnceOnItsQueueWhenSync) {
  const auto session = makeSession(42);

  onQueueOf(*session, [&] { session->startSync(/*sync=*/true); });

  EXPECT_TRUE(session->started());
}

TEST_F(OstrelReportingSessionLifecycle, EndsTheProcessOnASyncStartOffItsQueue) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const auto session = makeSession(42);

  EXPECT_DEATH(session->startSync(/*sync=*/true), "off its queue");
  EXPECT_DEATH(session->stopSync(/*sync=*/true), "off its queue");
}

// The wait for backends.

class OstrelReportingSessionWait : public OstrelReportingSessionLifecycle {
 protected:
  /// Started up to its wait.
  std::shared_ptr<OstrelReportingSession> makeWaiting(std::int64_t reporterID) {
    fakes.telemetryBackend->setDiscovery(FakeDiscovery::held());
    auto session = makeSession(reporterID);
    session->setServiceType(ServiceType{kHaptics});
    session->start();
    fakes.runUntilIdle();
    EXPECT_EQ(fakes.log->count("waiting for telvard to find backends"), 1u);
    forgetRecords();
    return session;
  }

  FakeTelemetrySession& telemetry() { return *fakes.telemetryBackend->lastSession(); }
};

TEST_F(OstrelReportingSessionWait, WaitsWithoutHoldingTheThread) {
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::held());
  const auto session = makeSession(42);
  session->start();
  forgetRecords();

  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(),
            LogLines{defaultLine("osrr", "waiting for telvard to find backends")});
  EXPECT_FALSE(session->started());
  EXPECT_TRUE(
      fakes.workQueues->queue("com.orbisk.ostrel.reporting.session")->isSuspended());
}

TEST_F(OstrelReportingSessionWait, IsStartedOnceBackendsAreFound) {
  const auto session = makeWaiting(42);

  telemetry().answerDiscovery(ArrayBuilder().append("one").append("two").build());
  EXPECT_TRUE(session->started());
  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(), (LogLines{defaultLine("osrr", "List of backends [one, two]"),
                                   defaultLine("osrr", "continuing")}));
  EXPECT_NE(session->reportingSession(), nullptr);
}

TEST_F(OstrelReportingSessionWait, CountsAnEmptyListAsFound) {
  const auto session = makeWaiting(42);

  telemetry().answerDiscovery(Array());
  fakes.runUntilIdle();

  EXPECT_TRUE(session->started());
  EXPECT_NE(session->reportingSession(), nullptr);
  EXPECT_EQ(takeLines(), (LogLines{defaultLine("osrr", "List of backends []"),
                                   defaultLine("osrr", "continuing")}));
}

TEST_F(OstrelReportingSessionWait, DoesNotWaitWhenBackendsAreFoundAtOnce) {
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::emptyList());
  const auto session = makeSession(42);
  session->start();
  forgetRecords();

  fakes.runUntilIdle();

  EXPECT_TRUE(session->started());
  EXPECT_EQ(takeLines(), LogLines{defaultLine("osrr", "List of backends []")});
}

TEST_F(OstrelReportingSessionWait, IsDetachedAfterNineSecondsWithoutAnAnswer) {
  const auto session = makeWaiting(42);

  fakes.advance(seconds(9) - nanoseconds(1));
  EXPECT_FALSE(session->started());
  EXPECT_EQ(takeLines(), LogLines{});
  fakes.advance(nanoseconds(1));

  EXPECT_TRUE(session->started());
  EXPECT_EQ(session->reportingSession(), nullptr);
  EXPECT_TRUE(telemetry().isReleased());
  EXPECT_EQ(takeLines(), LogLines{errorLine("osrr", "failed to find backend")});
}

TEST_F(OstrelReportingSessionWait, WaitsTheFullTimeWhenThereAreNoBackends) {
  const auto session = makeWaiting(42);

  telemetry().answerDiscovery(std::nullopt);
  fakes.advance(seconds(9) - nanoseconds(1));
  EXPECT_FALSE(session->started());
  EXPECT_EQ(takeLines(),
            LogLines{errorLine(
                "osrr", "No backends found, this session won't get sent to the server")});
  fakes.advance(nanoseconds(1));

  EXPECT_TRUE(session->started());
  EXPECT_EQ(session->reportingSession(), nullptr);
  EXPECT_EQ(takeLines(), LogLines{errorLine("osrr", "failed to find backend")});
}

TEST_F(OstrelReportingSessionWait, WaitsTheFullTimeWhenNoBackendsAreReportedAtOnce) {
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::none());
  const auto session = makeSession(42);
  session->start();
  forgetRecords();

  fakes.advance(seconds(9));

  EXPECT_TRUE(session->started());
  EXPECT_EQ(
      takeLines(),
      (LogLines{errorLine("osrr",
                          "No backends found, this session won't get sent to the server"),
                defaultLine("osrr", "waiting for telvard to find backends"),
                errorLine("osrr", "failed to find backend")}));
}

TEST_F(OstrelReportingSessionWait, WaitsAnotherNineSecondsAfterASpuriousWake) {
  const auto session = makeWaiting(42);
  fakes.advance(seconds(5));

  EXPECT_EQ(fakes.conditions->wakeAllSpuriously(), 1u);
  fakes.runUntilIdle();
  EXPECT_EQ(takeLines(),
            (LogLines{defaultLine("osrr", "continuing"),
                      defaultLine("osrr", "waiting for telvard to find backends")}));
  fakes.advance(seconds(9) - nanoseconds(1));
  EXPECT_FALSE(session->started());
  fakes.advance(nanoseconds(1));

  EXPECT_TRUE(session->started());
  EXPECT_EQ(takeLines(), LogLines{errorLine("osrr", "failed to find backend")});
}

TEST_F(OstrelReportingSessionWait, TakesASecondAnswerForNothingNew) {
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::foundTwice());
  const auto session = makeSession(42);

  session->start();
  fakes.runUntilIdle();

  EXPECT_TRUE(session->started());
  EXPECT_EQ(fakes.log->count("List of backends [embedded]"), 2u);
}

TEST_F(OstrelReportingSessionWait, HoldsBackWhatIsQueuedMeanwhile) {
  const auto session = makeWaiting(42);

  session->sendMessage({{"a", 1}}, MessageCategory{1}, MessageType{0},
                       /*reply=*/nullptr);
  fakes.runUntilIdle();
  EXPECT_EQ(takeEvents(), Events{});
  telemetry().answerDiscovery(Array());
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(), (Events{"analytics com.orbisk.ostrel.Generic.Generic",
                                  "trace 0x21042838", "backend.sendMessage 1 1 0"}));
}

TEST_F(OstrelReportingSessionWait, LetsOtherSessionsGoOn) {
  const auto waiting = makeWaiting(42);
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::found());
  const auto other = makeSession(43);

  other->start();
  fakes.runUntilIdle();

  EXPECT_TRUE(other->started());
  EXPECT_FALSE(waiting->started());
}

TEST_F(OstrelReportingSessionWait, RestartForAnotherTypeWaitsToo) {
  const auto session = makeStarted(kHaptics);
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::held());
  session->setServiceType(ServiceType{kAlarms});
  session->sendMessage({{"a", 1}}, MessageCategory{1}, MessageType{0},
                       /*reply=*/nullptr);

  fakes.runUntilIdle();
  EXPECT_FALSE(session->started());
  EXPECT_TRUE(telemetry().messages().empty());
  telemetry().answerDiscovery(Array());
  fakes.runUntilIdle();

  EXPECT_TRUE(session->started());
  EXPECT_EQ(telemetry().messages().size(), 1u);
}

TEST_F(OstrelReportingSessionWait, SaysThatItIsStartedAlreadyAfterTwoStarts) {
  const auto session = makeWaiting(42);
  session->start();
  forgetRecords();

  telemetry().answerDiscovery(Array());
  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(), (LogLines{defaultLine("osrr", "List of backends []"),
                                   defaultLine("osrr", "continuing"),
                                   infoLine("osrr", "42 is already started")}));
}

// Stop.

TEST_F(OstrelReportingSessionLifecycle, StopsInItsOrder) {
  const auto session = makeStarted(kHaptics);
  send(*session, {{"a", 1}}, 0x40000007, 1);
  session->setTransactionCompleteBlock(
      [this, weak = std::weak_ptr(session)](bool complete) {
        EXPECT_FALSE(weak.lock()->started());
        fakes.events->add(complete ? "complete" : "?");
      });
  forgetRecords();
  fakes.log->recordInto(fakes.events);

  session->stop();
  EXPECT_EQ(takeEvents(), (Events{"log debug osrr ending session 42"}));
  fakes.runUntilIdle();

  EXPECT_EQ(
      takeEvents(),
      (Events{"log debug osrr ending session 42", "trace 0x21042830",
              "log default osrr sending summary event for reporter 42",
              "log debug osrr sending message for session owned by 42",
              "analytics com.orbisk.ostrel.Undefined.Unknown", "trace 0x21042838",
              "backend.sendMessage 1 65535 65535",
              "log debug osrr TelvarAgent fake session 1 : message "
              "{Ostrel_Session_Summary_Event: 3, Routing_RouteChange_Start_1: {a: 1}} : "
              "category 4294967295 : type 65535",
              "backend.flush 1", "backend.release 1", "complete"}));
  EXPECT_FALSE(session->started());
  EXPECT_EQ(session->reportingSession(), nullptr);
  EXPECT_EQ(entriesOf(*session), Events{"none"});
}

TEST_F(OstrelReportingSessionLifecycle, KeepsDoubledLineOfAStop) {
  const auto session = makeStarted(kHaptics);

  stop(*session);

  EXPECT_EQ(fakes.log->count("ending session 42"), 2u);
}

TEST_F(OstrelReportingSessionLifecycle, SendsNoSummaryWhenNothingWasDelivered) {
  const auto session = makeStarted(kHaptics);

  stop(*session);

  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x21042830", "backend.flush 1", "backend.release 1"}));
  EXPECT_EQ(fakes.log->count("sending summary event for reporter 42"), 0u);
}

TEST_F(OstrelReportingSessionLifecycle, StopOfANeverStartedSessionDoesNothing) {
  const auto session = makeSession(42);
  countCompletions(*session);
  send(*session, {{"a", 1}}, 1, 0);
  forgetRecords();

  stop(*session);

  EXPECT_EQ(takeLines(), LogLines{debugLine("osrr", "ending session 42")});
  EXPECT_EQ(takeEvents(), Events{});
  EXPECT_TRUE(completions.empty());
  EXPECT_EQ(entriesOf(*session).size(), 1u);
}

TEST_F(OstrelReportingSessionLifecycle, StopsWithoutACompletion) {
  const auto session = makeStarted(kHaptics);

  stop(*session);

  EXPECT_FALSE(session->started());
}

TEST_F(OstrelReportingSessionLifecycle, KeepsStartReplyAtEveryStop) {
  const auto session = makeStarted(kHaptics);
  countCompletions(*session);
  EXPECT_TRUE(completions.empty());

  stop(*session);
  EXPECT_EQ(completions.size(), 1u);
  stop(*session);
  EXPECT_EQ(completions.size(), 1u);
  session->start();
  stop(*session);

  EXPECT_EQ(completions, (std::vector<bool>{true, true}));
}

TEST_F(OstrelReportingSessionLifecycle,
       LeavesTokenDateAndOrientationIDInPlaceAfterAStop) {
  const auto session = makeStarted(kHaptics);

  stop(*session);

  EXPECT_EQ(session->reportingAgentToken(), "token-1");
  EXPECT_EQ(session->startDate(), ManualClock::kStart);
  EXPECT_EQ(session->orientationCallbackID(), "OstrelReportingService 42");
}

TEST_F(OstrelReportingSessionLifecycle, DoesNotWaitForTheFlush) {
  fakes.telemetryBackend->setFlush({/*isHeld=*/true, /*error=*/std::nullopt});
  const auto session = makeStarted(kHaptics);
  countCompletions(*session);

  stop(*session);
  EXPECT_FALSE(session->started());
  EXPECT_EQ(completions.size(), 1u);
  EXPECT_TRUE(fakes.telemetryBackend->session(1)->isReleased());
  forgetRecords();
  fakes.telemetryBackend->session(1)->answerFlush(
      ErrorObject{"store", /*code=*/5, "disk is full"});

  EXPECT_EQ(takeLines(), LogLines{errorLine("osrr", "flush error disk is full")});
}

TEST_F(OstrelReportingSessionLifecycle, SaysNothingOfAFlushThatWentWell) {
  fakes.telemetryBackend->setFlush({/*isHeld=*/true, /*error=*/std::nullopt});
  const auto session = makeStarted(kHaptics);
  stop(*session);
  forgetRecords();

  fakes.telemetryBackend->session(1)->answerFlush(std::nullopt);

  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingSessionLifecycle, StopsADetachedSessionWithoutAFlush) {
  const auto session = makeDetached(kHaptics);
  countCompletions(*session);
  send(*session, {{"a", 1}}, 1, 0);
  forgetRecords();

  stop(*session);

  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x21042830", "analytics com.orbisk.ostrel.Undefined.Unknown",
                    "trace 0x21042838"}));
  EXPECT_EQ(fakes.log->count("sending summary event for reporter 42"), 1u);
  EXPECT_EQ(fakes.log->count("No valid TelvarSession"), 1u);
  EXPECT_EQ(completions.size(), 1u);
}

TEST_F(OstrelReportingSessionLifecycle, StopsASessionOfTheTestTypeWithItsSummaryOnly) {
  const auto session = makeStarted(kTest);
  countCompletions(*session);
  send(*session, {{"a", 1}}, 1, 0);
  forgetRecords();

  stop(*session);

  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x21042830", "analytics com.orbisk.ostrel.Undefined.Unknown",
                    "trace 0x21042838"}));
  EXPECT_EQ(takeLines(),
            (LogLines{debugLine("osrr", "ending session 42"),
                      debugLine("osrr", "ending session 42"),
                      defaultLine("osrr", "sending summary event for reporter 42"),
                      debugLine("osrr", "sending message for session owned by 42"),
                      infoLine("osrr", "transactions aren't allowed on this platform")}));
  EXPECT_EQ(completions, std::vector<bool>{true});
  EXPECT_FALSE(session->started());
}

TEST_F(OstrelReportingSessionLifecycle, MakesEverythingAnewAtEachStart) {
  const auto session = makeStarted(kHaptics);
  send(*session, {{"a", 1}}, 1, 0);
  stop(*session);
  fakes.clock->advance(seconds(60));

  session->start();
  fakes.runUntilIdle();

  EXPECT_EQ(fakes.telemetryBackend->sessionCount(), 2u);
  EXPECT_EQ(session->reportingAgentToken(), "token-2");
  EXPECT_EQ(session->startDate(), Date{ManualClock::kStart.secondsSince1970 + 60});
  EXPECT_EQ(entriesOf(*session), Events{});
}

TEST_F(OstrelReportingSessionLifecycle, CountsMessagesOnAcrossStops) {
  const auto session = makeStarted(kHaptics);
  send(*session, {{"a", 1}}, 1, 0);
  stop(*session);
  session->start();
  fakes.runUntilIdle();

  send(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(entriesOf(*session), Events{"{Generic_Generic_2: {a: 1}}"});
}

// Teardown.

TEST_F(OstrelReportingSessionLifecycle, TracesItsTeardownThenLogsIt) {
  auto session = makeSession(42);
  forgetRecords();
  fakes.log->recordInto(fakes.events);

  session.reset();

  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x21042834", "log info osrr deallocing this session 42"}));
}

TEST_F(OstrelReportingSessionLifecycle, LosesSummaryAndFlushWhenDroppedStarted) {
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::found());
  auto session = makeStarted(kHaptics);
  countCompletions(*session);
  send(*session, {{"a", 1}}, 1, 0);
  fakes.telemetryBackend->releaseCallbacks();  // The backend's own reference.
  forgetRecords();

  session.reset();
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(), (Events{"trace 0x21042834", "backend.release 1"}));
  EXPECT_TRUE(completions.empty());
}

TEST_F(OstrelReportingSessionLifecycle, LivesUntilItsQueuedStepsHaveRun) {
  auto session = makeSession(42);
  session->sendMessage({{"a", 1}}, MessageCategory{1}, MessageType{0},
                       /*reply=*/nullptr);
  forgetRecords();

  session.reset();
  fakes.runUntilIdle();

  EXPECT_TRUE(fakes.events->inOrder("trace 0x21042838", "trace 0x21042834"));
}

}  // namespace
}  // namespace ostrel
