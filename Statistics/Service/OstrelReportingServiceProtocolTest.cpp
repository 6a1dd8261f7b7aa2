#include <gtest/gtest.h>

#include "Statistics/Service/ServiceTestFixture.h"

namespace ostrel {
namespace {

using Events = std::vector<std::string>;

constexpr ReporterID kSeven{7};
constexpr ReporterID kEight{8};
constexpr ReporterID kUnknown{99};
constexpr ServiceType kHaptics{3};
const Dictionary kMessage{{"a", 1}};

class OstrelReportingServiceProtocolTest : public ServiceTest {
 protected:
  OstrelReportingServiceProtocolTest() : client(connect(1)) {}

  void send(const std::optional<ReporterIDs>& reportingIDs) {
    client->sendMessage(kMessage, MessageCategory{0x40000007}, MessageType{1},
                        reportingIDs, errorReply());
    fakes.runUntilIdle();
  }

  /// Runs what was asked for and hands out the replies to it.
  Replies takeReplies() {
    fakes.runUntilIdle();
    return std::exchange(replies, {});
  }

  /// Tells the reply of a stop from that of a start.
  BoolReply stopReply() {
    return [this](bool value) { replies.push_back(value ? "stopped" : "?"); };
  }

  std::size_t sessionMessages() {
    std::size_t count = 0;
    for (std::size_t i = 1; i <= fakes.telemetryBackend->sessionCount(); ++i) {
      count += fakes.telemetryBackend->session(i)->messages().size();
    }
    return count;
  }

  void setCounters(FakeChannelReportingService::Counters counters) {
    fakes.channelReportingService->setCounters("Speaker", std::nullopt,
                                               std::move(counters));
  }

  const std::shared_ptr<OstrelReportingServerInstance> client;
};

// The shape of all operations.

TEST_F(OstrelReportingServiceProtocolTest, LogsOnTheCallersThreadAndWorksOnTheQueue) {
  makeVerbose("reporting_server_verbose");

  client->createReportingSession(kSeven, boolReply());
  client->setServiceType(kHaptics, kSeven, boolReply());
  client->getServiceNameForReporterID(kSeven, typeReply());
  client->setConfiguration(Dictionary(), kSeven, boolReply());
  client->startReportingSessionForID(kSeven, boolReply());
  client->sendMessage(kMessage, MessageCategory{1}, MessageType{0},
                      ReporterIDs{kSeven, kEight}, errorReply());
  client->sendMessage(kMessage, MessageCategory{1}, MessageType{0}, std::nullopt,
                      errorReply());
  client->stopReportingSessionForID(kSeven, boolReply());
  client->destroyReportingSession(kSeven, boolReply());
  client->reporterIDValid(kSeven, dictionaryReply());
  client->getAllReporters(idsReply());

  EXPECT_EQ(takeLines(),
            (LogLines{debugLine("osrs", "creating session for reporter 7"),
                      debugLine("osrs", "setting service type 3 for reporter 7"),
                      debugLine("osrs", "fetching seviceType"),
                      debugLine("osrs", "setting configuration"),
                      debugLine("osrs", "starting session for reporter 7"),
                      debugLine("osrs", "sending message for reporter (7, 8)"),
                      debugLine("osrs", "sending message for reporter (null)"),
                      debugLine("osrs", "stopping session for reporter 7"),
                      debugLine("osrs", "destroying session for reporter 7"),
                      debugLine("osrs", "validating reporter 7")}));
  EXPECT_EQ(takeEvents(), Events{});
  EXPECT_EQ(replies, Replies{});
}

TEST_F(OstrelReportingServiceProtocolTest, WritesNoDebugLineBelowVerbosityFive) {
  fakes.log->setVerbosity("reporting_server_verbose", /*verbosity=*/4);

  client->createReportingSession(kSeven, boolReply());
  client->reporterIDValid(kSeven, dictionaryReply());

  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingServiceProtocolTest, TracesFiveOperationsBeforeAnyTestOfTheID) {
  switchReporting(/*on=*/false);
  const std::vector<std::pair<std::function<void()>, Events>> operations = {
      {[&] { client->startReportingSessionForID(kNoReporter, nullptr); },
       {"trace 0x21042818"}},
      {[&] {
         client->sendMessage(kMessage, MessageCategory{1}, MessageType{0},
                             ReporterIDs{kNoReporter}, nullptr);
       },
       {"trace 0x21042824"}},
      {[&] { client->stopReportingSessionForID(kNoReporter, nullptr); },
       {"trace 0x2104281c"}},
      {[&] { client->destroyReportingSession(kNoReporter, nullptr); },
       {"trace 0x21042820"}},
      {[&] { client->createReportingSession(kNoReporter, nullptr); },
       {"trace 0x21042814", "trace 0x21042828"}},
      {[&] { client->setServiceType(kHaptics, kNoReporter, nullptr); }, {}},
      {[&] { client->getServiceNameForReporterID(kNoReporter, nullptr); }, {}},
      {[&] { client->setConfiguration(std::nullopt, kNoReporter, nullptr); }, {}},
      {[&] { client->reporterIDValid(kNoReporter, nullptr); }, {}},
      {[&] { client->getAllReporters(nullptr); }, {}}};

  for (const auto& [operation, trace] : operations) {
    operation();
    fakes.runUntilIdle();
    EXPECT_EQ(takeEvents(), trace);
  }
}

TEST_F(OstrelReportingServiceProtocolTest, BearsAbsentReplies) {
  client->createReportingSession(kSeven, nullptr);
  client->setServiceType(kHaptics, kSeven, nullptr);
  client->getServiceNameForReporterID(kNoReporter, nullptr);
  client->setConfiguration(Dictionary(), kSeven, nullptr);
  client->startReportingSessionForID(kUnknown, nullptr);
  client->startReportingSessionForID(kSeven, nullptr);
  client->sendMessage(kMessage, MessageCategory{1}, MessageType{0}, ReporterIDs{kSeven},
                      nullptr);
  client->stopReportingSessionForID(kSeven, nullptr);
  client->destroyReportingSession(kSeven, nullptr);
  client->reporterIDValid(kSeven, nullptr);
  client->getAllReporters(nullptr);
  fakes.runUntilIdle();

  EXPECT_EQ(sessionMessages(), 2u);  // And the summary.
}

TEST_F(OstrelReportingServiceProtocolTest, AnswersInTheOrderOfTheRequests) {
  client->createReportingSession(kSeven, boolReply());
  client->reporterIDValid(kSeven, dictionaryReply());
  client->startReportingSessionForID(kUnknown, boolReply());
  client->getAllReporters(idsReply());

  EXPECT_EQ(takeReplies(),
            (Replies{"true", "{reporterID: 7, serviceType: 65535}", "false", "(7)"}));
}

// Look-up across clients.

TEST_F(OstrelReportingServiceProtocolTest, LogsEveryLookUp) {
  create(*client, 7);

  client->setConfiguration(std::nullopt, kSeven, boolReply());
  client->setConfiguration(std::nullopt, kUnknown, boolReply());
  client->setConfiguration(std::nullopt, kNoReporter, boolReply());
  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(),
            (LogLines{infoLine("osrs", "found reporting session 7 for client 1"),
                      errorLine("osrs", "failed to find reporting session 99")}));
}

TEST_F(OstrelReportingServiceProtocolTest, FindsNothingSilentlyWhileReportingIsOff) {
  create(*client, 7);
  switchReporting(/*on=*/false);

  client->setConfiguration(std::nullopt, kSeven, boolReply());
  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingServiceProtocolTest, FindsTheSessionOfTheEarlierRegisteredClient) {
  const auto second = connect(2);
  const auto late = create(*second, 7);
  const auto early = create(*client, 7);

  second->setConfiguration(Dictionary{{"x", 1}}, kSeven, boolReply());
  fakes.runUntilIdle();

  EXPECT_TRUE(early->userInfo().contains("x"));
  EXPECT_FALSE(late->userInfo().contains("x"));
  EXPECT_EQ(fakes.log->count("found reporting session 7 for client 1"), 1u);
}

TEST_F(OstrelReportingServiceProtocolTest,
       FindsTheOtherClientsSessionOnceTheFirstIsGone) {
  const auto second = connect(2);
  create(*client, 7);
  const auto other = create(*second, 7);

  client->destroyReportingSession(kSeven, boolReply());
  client->setConfiguration(Dictionary{{"x", 1}}, kSeven, boolReply());
  fakes.runUntilIdle();

  EXPECT_TRUE(other->userInfo().contains("x"));
}

TEST_F(OstrelReportingServiceProtocolTest, FindsExtremeIDs) {
  create(*client, INT64_MIN);
  create(*client, INT64_MAX);
  create(*client, -1);

  client->reporterIDValid(ReporterID{INT64_MIN}, dictionaryReply());
  client->reporterIDValid(ReporterID{INT64_MAX}, dictionaryReply());
  client->reporterIDValid(ReporterID{-1}, dictionaryReply());

  EXPECT_EQ(takeReplies(),
            (Replies{"{reporterID: -9223372036854775808, serviceType: 65535}",
                     "{reporterID: 9223372036854775807, serviceType: 65535}",
                     "{reporterID: -1, serviceType: 65535}"}));
}

// 1: create.

TEST_F(OstrelReportingServiceProtocolTest, CreateMakesASessionOfTheClients) {
  client->createReportingSession(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  const auto session = sessionOf(*client, 7);
  ASSERT_NE(session, nullptr);
  EXPECT_EQ(session->processIdentifiers(), std::vector<ProcessID>{1});
  EXPECT_EQ(takeLines(),
            (LogLines{infoLine("osrr", "created reporting session for ID: 7"),
                      defaultLine("osrs", "session created for reporter 7")}));
  EXPECT_EQ(takeEvents(), (Events{"trace 0x21042814", "trace 0x21042828"}));
}

TEST_F(OstrelReportingServiceProtocolTest, CreateReplacesWithoutStopping) {
  auto first = createStarted(*client, 7);

  client->createReportingSession(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_NE(sessionOf(*client, 7), first);
  EXPECT_TRUE(first->started());
  EXPECT_EQ(fakes.events->count("trace 0x21042830"), 0u);
  client->getAllReporters(idsReply());
  EXPECT_EQ(takeReplies(), Replies{"(7)"});
}

TEST_F(OstrelReportingServiceProtocolTest, CreateOfOneIDByTwoClientsGivesEachItsOwn) {
  const auto second = connect(2);

  client->createReportingSession(kSeven, boolReply());
  second->createReportingSession(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), (Replies{"true", "true"}));

  EXPECT_NE(sessionOf(*client, 7), sessionOf(*second, 7));
  client->getAllReporters(idsReply());
  EXPECT_EQ(takeReplies(), Replies{"(7, 7)"});
}

TEST_F(OstrelReportingServiceProtocolTest, CreateTakesZeroThoughNothingFindsIt) {
  client->createReportingSession(kNoReporter, boolReply());
  client->reporterIDValid(kNoReporter, dictionaryReply());
  client->getAllReporters(idsReply());

  EXPECT_EQ(takeReplies(),
            (Replies{"true", "{reporterID: 0, serviceType: 65535}", "(0)"}));
}

// 2: set service type.

TEST_F(OstrelReportingServiceProtocolTest, SetServiceTypeSetsTheOwnSession) {
  const auto session = create(*client, 7);

  client->setServiceType(kHaptics, kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_EQ(session->serviceType(), kHaptics);
  EXPECT_EQ(takeLines(),
            (LogLines{defaultLine("osrs", "service type 3 set for reporter  7"),
                      infoLine("osrr", "setting service type haptics")}));
}

TEST_F(OstrelReportingServiceProtocolTest, SetServiceTypeLeavesOtherClientsAlone) {
  const auto second = connect(2);
  const auto session = create(*client, 7);

  second->setServiceType(kHaptics, kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_EQ(session->serviceType(), kServiceTypeUnknown);
  EXPECT_EQ(takeLines(), LogLines{});
}

// 3: get service type.

TEST_F(OstrelReportingServiceProtocolTest, GetServiceTypeOfAnyClientsSession) {
  const auto second = connect(2);
  create(*client, 7);
  client->setServiceType(kHaptics, kSeven, nullptr);
  fakes.runUntilIdle();
  forgetRecords();

  second->getServiceNameForReporterID(kSeven, typeReply());
  EXPECT_EQ(takeReplies(), Replies{"3"});

  EXPECT_EQ(takeLines(),
            (LogLines{infoLine("osrs", "found reporting session 7 for client 1"),
                      defaultLine("osrs", "returnning service type 3 for reporter  7")}));
}

TEST_F(OstrelReportingServiceProtocolTest, GetServiceTypeOfAnUnknownReporter) {
  client->getServiceNameForReporterID(kUnknown, typeReply());
  EXPECT_EQ(takeReplies(), Replies{"65535"});

  EXPECT_EQ(
      takeLines(),
      (LogLines{errorLine("osrs", "failed to find reporting session 99"),
                defaultLine("osrs", "returnning service type 65535 for reporter  99")}));
}

TEST_F(OstrelReportingServiceProtocolTest, KeepsDoubleReplyForReporterZero) {
  client->getServiceNameForReporterID(kNoReporter, typeReply());

  EXPECT_EQ(takeReplies(), (Replies{"65535", "65535"}));
  EXPECT_EQ(takeLines(), LogLines{defaultLine(
                             "osrs", "returnning service type 65535 for reporter  0")});
}

TEST_F(OstrelReportingServiceProtocolTest, KeepsMisspeltLogTexts) {
  makeVerbose("reporting_server_verbose");

  client->getServiceNameForReporterID(kUnknown, typeReply());
  fakes.runUntilIdle();

  EXPECT_EQ(fakes.log->count("fetching seviceType"), 1u);
  EXPECT_EQ(fakes.log->count("returnning service type 65535 for reporter  99"), 1u);
}

// 4: set configuration.

TEST_F(OstrelReportingServiceProtocolTest, SetConfigurationReachesAnyClientsSession) {
  const auto second = connect(2);
  const auto session = create(*client, 7);

  second->setConfiguration(Dictionary{{"x", 1}}, kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_EQ(session->userInfo(), (Dictionary{{"x", 1}}));
}

TEST_F(OstrelReportingServiceProtocolTest, SetConfigurationAlwaysRepliesYes) {
  create(*client, 7);

  client->setConfiguration(std::nullopt, kSeven, boolReply());
  client->setConfiguration(Dictionary(), kUnknown, boolReply());
  client->setConfiguration(Dictionary(), kNoReporter, boolReply());

  EXPECT_EQ(takeReplies(), (Replies{"true", "true", "true"}));
}

// 5: start.

TEST_F(OstrelReportingServiceProtocolTest, StartStartsThenSnapsThenHandsTheReplyOver) {
  setCounters({{"underruns", 1}});
  restart();  // Subscribes.
  const auto instance = connect(3);
  const auto session = create(*instance, 7);

  instance->startReportingSessionForID(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{});

  EXPECT_TRUE(session->started());
  ASSERT_NE(session->driverSnapShot(), nullptr);
  EXPECT_EQ(*session->driverSnapShot(),
            (DriverSnapShot{{"Speaker-(null)", {{"underruns", 1}}}}));
  EXPECT_TRUE(session->transactionCompleteBlock());
  const Events events = takeEvents();
  ASSERT_GE(events.size(), 3u);
  EXPECT_EQ(events[0], "trace 0x21042818");
  EXPECT_EQ(events[1], "channels.createSamples Speaker *");
  EXPECT_EQ(events[2], "trace 0x2104282c");
}

TEST_F(OstrelReportingServiceProtocolTest, StartIsAnsweredAtTheStop) {
  create(*client, 7);
  client->startReportingSessionForID(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{});

  client->stopReportingSessionForID(kSeven, stopReply());
  EXPECT_EQ(takeReplies(), (Replies{"stopped", "true"}));
}

TEST_F(OstrelReportingServiceProtocolTest, StartReachesAnyClientsSession) {
  const auto second = connect(2);
  const auto session = create(*client, 7);

  second->startReportingSessionForID(kSeven, boolReply());
  fakes.runUntilIdle();

  EXPECT_TRUE(session->started());
}

TEST_F(OstrelReportingServiceProtocolTest, StartOfAnUnknownReporterRepliesNo) {
  client->startReportingSessionForID(kUnknown, boolReply());

  EXPECT_EQ(takeReplies(), Replies{"false"});
}

TEST_F(OstrelReportingServiceProtocolTest, KeepsSilenceOnStartOfAStartedSession) {
  const auto session = createStarted(*client, 7);
  const auto snapShot = session->driverSnapShot();

  client->startReportingSessionForID(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{});

  EXPECT_EQ(takeEvents(), Events{"trace 0x21042818"});
  EXPECT_EQ(session->driverSnapShot(), snapShot);
  EXPECT_FALSE(session->transactionCompleteBlock());
  client->stopReportingSessionForID(kSeven, nullptr);
  EXPECT_EQ(takeReplies(), Replies{});
}

// 6: send.

TEST_F(OstrelReportingServiceProtocolTest, SendReachesEachSessionNamedInOrder) {
  const auto second = connect(2);
  createStarted(*client, 7);
  createStarted(*second, 8);

  send(ReporterIDs{kEight, kNoReporter, kSeven, kUnknown, kSeven});

  EXPECT_EQ(replies, Replies{"no error"});
  EXPECT_EQ(fakes.events->startingWith("backend.sendMessage"),
            (Events{"backend.sendMessage 2 7 1", "backend.sendMessage 1 7 1",
                    "backend.sendMessage 1 7 1"}));
  EXPECT_EQ(takeHostLines(),
            (LogLines{infoLine("osrs", "found reporting session 8 for client 2"),
                      infoLine("osrs", "found reporting session 7 for client 1"),
                      errorLine("osrs", "failed to find reporting session 99"),
                      infoLine("osrs", "found reporting session 7 for client 1")}));
}

TEST_F(OstrelReportingServiceProtocolTest, SendRepliesBeforeTheSessionsDeliver) {
  createStarted(*client, 7);
  fakes.telemetryBackend->scriptSend({false, ErrorObject{"store", /*code=*/1, "full"}});

  send(ReporterIDs{kSeven});

  EXPECT_EQ(replies, Replies{"no error"});
}

TEST_F(OstrelReportingServiceProtocolTest, SendToASessionNotStartedGoesOutByItself) {
  create(*client, 7);

  send(ReporterIDs{kSeven});

  ASSERT_EQ(fakes.telemetryBackend->singleMessages().size(), 1u);
  EXPECT_EQ(fakes.telemetryBackend->singleMessages()[0].userInfo.get(
                kTelvarUserInfoServiceName),
            Value("unknown"));
  EXPECT_EQ(replies, Replies{"no error"});
}

TEST_F(OstrelReportingServiceProtocolTest, SendWithAnEmptyListSendsNothing) {
  createStarted(*client, 7);

  send(ReporterIDs{});

  EXPECT_EQ(replies, Replies{"no error"});
  EXPECT_EQ(takeEvents(), Events{"trace 0x21042824"});
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingServiceProtocolTest, SendToUnknownReportersSendsNothing) {
  send(ReporterIDs{kUnknown, kNoReporter});

  EXPECT_EQ(replies, Replies{"no error"});
  EXPECT_EQ(takeEvents(), Events{"trace 0x21042824"});
}

TEST_F(OstrelReportingServiceProtocolTest, SendWithoutAListReachesEveryStartedSession) {
  const auto second = connect(2);
  createStarted(*second, 3);
  createStarted(*client, 9);
  create(*client, 8);
  createStarted(*client, 7);

  send(std::nullopt);

  EXPECT_EQ(replies, Replies{"no error"});
  EXPECT_EQ(takeHostLines(),
            (LogLines{defaultLine("osrs",
                                  "sessions for client 1 : (<OstrelReportingSession: 7>, "
                                  "<OstrelReportingSession: 8>, "
                                  "<OstrelReportingSession: 9>)"),
                      defaultLine("osrs",
                                  "sessions for client 2 : (<OstrelReportingSession: "
                                  "3>)"),
                      defaultLine("osrs",
                                  "active reporting sessions 3 : "
                                  "(<OstrelReportingSession: 7>, "
                                  "<OstrelReportingSession: 9>, "
                                  "<OstrelReportingSession: 3>)")}));
  EXPECT_EQ(fakes.events->startingWith("backend.send"),
            (Events{"backend.sendMessage 3 7 1", "backend.sendMessage 2 7 1",
                    "backend.sendMessage 1 7 1"}));
}

TEST_F(OstrelReportingServiceProtocolTest,
       SendWithoutAListAndStartedSessionGoesOutAlone) {
  create(*client, 7);

  send(std::nullopt);

  EXPECT_EQ(replies, Replies{"no error"});
  EXPECT_EQ(
      takeHostLines(),
      (LogLines{
          defaultLine("osrs", "sessions for client 1 : (<OstrelReportingSession: 7>)"),
          defaultLine("osrs", "active reporting sessions 0 : ()"),
          defaultLine("osrs",
                      "no active reporting sessions found, sending as standalone")}));
  const auto single = fakes.telemetryBackend->singleMessages();
  ASSERT_EQ(single.size(), 1u);
  EXPECT_EQ(single[0].payload, kMessage);
  EXPECT_EQ(single[0].category, 7);
  EXPECT_EQ(single[0].type, 1);
  EXPECT_EQ(single[0].userInfo.get(kTelvarUserInfoServiceName), Value("standalone"));
  EXPECT_TRUE(fakes.analyticsSink->names().empty());
}

TEST_F(OstrelReportingServiceProtocolTest, SendOfAStandaloneMessageUsesNoDefaults) {
  fakes.userDefaults->setSuite("com.orbisk.ostrel", {{"device_name", "Kitchen"}});
  postDefaultsChange();

  send(std::nullopt);

  ASSERT_EQ(fakes.telemetryBackend->singleMessages().size(), 1u);
  EXPECT_FALSE(
      fakes.telemetryBackend->singleMessages()[0].userInfo.contains("device_name"));
}

TEST_F(OstrelReportingServiceProtocolTest, SendIsRefusedWhileReportingIsOff) {
  createStarted(*client, 7);
  switchReporting(/*on=*/false);

  send(ReporterIDs{kSeven});
  send(std::nullopt);
  send(ReporterIDs{});

  EXPECT_EQ(replies,
            (Replies{"com.orbisk.audio.reporting 1", "com.orbisk.audio.reporting 1",
                     "com.orbisk.audio.reporting 1"}));
  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x21042824", "trace 0x21042824", "trace 0x21042824"}));
  EXPECT_EQ(takeLines(), LogLines{});
}

// 7: stop.

TEST_F(OstrelReportingServiceProtocolTest, StopSendsTheDriverStatisticsFirst) {
  setCounters({{"underruns", 1}});
  restart();  // Subscribes.
  const auto instance = connect(3);
  const auto session = createStarted(*instance, 7);
  setCounters({{"underruns", 6}});

  instance->stopReportingSessionForID(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  const auto messages = fakes.telemetryBackend->session(1)->messages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[0].category, 9);
  EXPECT_EQ(messages[0].type, 0);
  EXPECT_EQ(messages[0].payload, (Dictionary{{"underruns", 5}}));
  EXPECT_EQ(messages[1].payload.get("Chanreporting_Generic_1"), Value("{underruns: 5}"));
  EXPECT_EQ(takeHostLines(),
            (LogLines{infoLine("osrs", "found reporting session 7 for client 3"),
                      defaultLine("osrs", "fetching driver logs {underruns: 5}"),
                      defaultLine("osrs", "stopping 7")}));
  EXPECT_EQ(session->driverSnapShot(), nullptr);
  EXPECT_FALSE(session->started());
}

TEST_F(OstrelReportingServiceProtocolTest, StopWithQuietDriversSendsNoStatistics) {
  const auto session = createStarted(*client, 7);

  client->stopReportingSessionForID(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_EQ(sessionMessages(), 0u);
  EXPECT_EQ(
      takeHostLines(),
      (LogLines{infoLine("osrs", "found reporting session 7 for client 1"),
                defaultLine("osrs", "nothing interesting to fetch from the drivers"),
                defaultLine("osrs", "stopping 7")}));
  EXPECT_FALSE(session->started());
}

TEST_F(OstrelReportingServiceProtocolTest, StopReachesAnyClientsSession) {
  const auto second = connect(2);
  const auto session = createStarted(*client, 7);

  second->stopReportingSessionForID(kSeven, boolReply());
  fakes.runUntilIdle();

  EXPECT_FALSE(session->started());
}

TEST_F(OstrelReportingServiceProtocolTest,
       StopOfAnUnknownReporterStillAsksForStatistics) {
  setCounters({{"underruns", 6}});
  restart();  // Subscribes.
  const auto instance = connect(3);

  instance->stopReportingSessionForID(kUnknown, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_EQ(takeEvents(), (Events{"trace 0x2104281c", "channels.createSamples Speaker *",
                                  "channels.iterate"}));
  EXPECT_EQ(takeHostLines(),
            (LogLines{errorLine("osrs", "failed to find reporting session 99"),
                      defaultLine("osrs", "fetching driver logs {underruns: 6}"),
                      defaultLine("osrs", "stopping 99")}));
}

TEST_F(OstrelReportingServiceProtocolTest, StopOfASessionNotStartedRepliesYes) {
  create(*client, 7);

  client->stopReportingSessionForID(kSeven, boolReply());

  EXPECT_EQ(takeReplies(), Replies{"true"});
  EXPECT_EQ(fakes.events->count("trace 0x21042830"), 0u);
}

// 8: destroy.

TEST_F(OstrelReportingServiceProtocolTest, DestroyStopsAndDropsTheOwnSession) {
  createStarted(*client, 7);
  fakes.telemetryBackend->releaseCallbacks();  // The backend's own reference.

  client->destroyReportingSession(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_EQ(sessionOf(*client, 7), nullptr);
  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x21042820", "trace 0x21042830", "backend.flush 1",
                    "backend.release 1", "trace 0x21042834"}));
  EXPECT_EQ(takeHostLines(), LogLines{defaultLine("osrs", "destroying 7")});
}

TEST_F(OstrelReportingServiceProtocolTest, DestroyDoesNotStopASessionNotStarted) {
  create(*client, 7);

  client->destroyReportingSession(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_EQ(takeEvents(), (Events{"trace 0x21042820", "trace 0x21042834"}));
}

TEST_F(OstrelReportingServiceProtocolTest, DestroyAnswersAWaitingStart) {
  create(*client, 7);
  client->startReportingSessionForID(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{});

  client->destroyReportingSession(kSeven, stopReply());

  EXPECT_EQ(takeReplies(), (Replies{"stopped", "true"}));
}

TEST_F(OstrelReportingServiceProtocolTest, DestroyLeavesOtherClientsAlone) {
  const auto second = connect(2);
  const auto session = createStarted(*client, 7);

  second->destroyReportingSession(kSeven, boolReply());
  EXPECT_EQ(takeReplies(), Replies{"true"});

  EXPECT_TRUE(session->started());
  EXPECT_EQ(sessionOf(*client, 7), session);
  EXPECT_EQ(takeHostLines(), LogLines{defaultLine("osrs", "destroying 7")});
}

// 2, 5, 7 and 8 with ID 0.

TEST_F(OstrelReportingServiceProtocolTest,
       KeepsSilenceForReporterZeroOnStartStopDestroySetType) {
  client->createReportingSession(kNoReporter, nullptr);
  fakes.runUntilIdle();
  forgetRecords();

  client->setServiceType(kHaptics, kNoReporter, boolReply());
  client->startReportingSessionForID(kNoReporter, boolReply());
  client->stopReportingSessionForID(kNoReporter, boolReply());
  client->destroyReportingSession(kNoReporter, boolReply());

  EXPECT_EQ(takeReplies(), Replies{});
  EXPECT_EQ(takeLines(), LogLines{});
  EXPECT_NE(sessionOf(*client, 0), nullptr);
}

// 9: validate.

TEST_F(OstrelReportingServiceProtocolTest, ValidateTellsIDAndTypeOfAnyClientsSession) {
  const auto second = connect(2);
  create(*client, 7);
  client->setServiceType(kHaptics, kSeven, nullptr);
  fakes.runUntilIdle();
  forgetRecords();

  second->reporterIDValid(kSeven, dictionaryReply());

  EXPECT_EQ(takeReplies(), Replies{"{reporterID: 7, serviceType: 3}"});
  EXPECT_EQ(takeLines(),
            (LogLines{infoLine("osrs", "found reporting session 7 for client 1"),
                      defaultLine("osrs", "validating reporter 7")}));
}

TEST_F(OstrelReportingServiceProtocolTest, ValidateOfNoSessionTellsZeroAndUnknown) {
  client->reporterIDValid(kUnknown, dictionaryReply());
  client->reporterIDValid(kNoReporter, dictionaryReply());

  EXPECT_EQ(takeReplies(), (Replies{"{reporterID: 0, serviceType: 65535}",
                                    "{reporterID: 0, serviceType: 65535}"}));
  EXPECT_EQ(takeLines(),
            (LogLines{errorLine("osrs", "failed to find reporting session 99"),
                      defaultLine("osrs", "validating reporter 99"),
                      defaultLine("osrs", "validating reporter 0")}));
}

// 10: all reporters.

TEST_F(OstrelReportingServiceProtocolTest, AllReportersAreThoseOfEveryClientInOrder) {
  const auto second = connect(2);
  create(*second, 1);
  create(*client, 9);
  create(*client, 8);

  second->getAllReporters(idsReply());

  EXPECT_EQ(takeReplies(), Replies{"(8, 9, 1)"});
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingServiceProtocolTest, AllReportersOfNoSessionsAreNone) {
  client->getAllReporters(idsReply());

  EXPECT_EQ(takeReplies(), Replies{"()"});
}

// Reporting switched off.

TEST_F(OstrelReportingServiceProtocolTest, HidesSessionsButStopsNoneWhileReportingIsOff) {
  const auto session = createStarted(*client, 7);
  switchReporting(/*on=*/false);

  client->startReportingSessionForID(kSeven, boolReply());
  client->stopReportingSessionForID(kSeven, boolReply());
  client->setConfiguration(Dictionary{{"x", 1}}, kSeven, boolReply());
  client->reporterIDValid(kSeven, dictionaryReply());
  client->getServiceNameForReporterID(kSeven, typeReply());

  EXPECT_EQ(takeReplies(), (Replies{"false", "true", "true",
                                    "{reporterID: 0, serviceType: 65535}", "65535"}));
  EXPECT_TRUE(session->started());
  EXPECT_FALSE(session->userInfo().contains("x"));
  EXPECT_TRUE(fakes.log->texts(LogLevel::kError).empty());
}

TEST_F(OstrelReportingServiceProtocolTest, ServesTheOwnMapWhileReportingIsOff) {
  switchReporting(/*on=*/false);

  client->createReportingSession(kSeven, boolReply());
  client->setServiceType(kHaptics, kSeven, boolReply());
  client->getAllReporters(idsReply());
  EXPECT_EQ(takeReplies(), (Replies{"true", "true", "(7)"}));
  EXPECT_EQ(sessionOf(*client, 7)->serviceType(), kHaptics);
  client->destroyReportingSession(kSeven, boolReply());

  EXPECT_EQ(takeReplies(), Replies{"true"});
  EXPECT_EQ(sessionOf(*client, 7), nullptr);
}

TEST_F(OstrelReportingServiceProtocolTest, FindsSessionsAgainOnceReportingIsOn) {
  createStarted(*client, 7);
  switchReporting(/*on=*/false);
  switchReporting(/*on=*/true);

  send(ReporterIDs{kSeven});

  EXPECT_EQ(replies, Replies{"no error"});
  EXPECT_EQ(sessionMessages(), 1u);
}

}  // namespace
}  // namespace ostrel
