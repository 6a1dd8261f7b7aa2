#include <gtest/gtest.h>

#include <optional>

#include "Statistics/Service/OstrelReportingSessionSummary.h"
#include "Statistics/Service/SessionTestFixture.h"

namespace ostrel {
namespace {

using Events = std::vector<std::string>;

constexpr std::uint16_t kHaptics = 3;
constexpr std::uint16_t kTest = 11;

class OstrelReportingSessionDelivery : public SessionTest {
 protected:
  /// What each call of a reply made by `reply` got.
  std::vector<std::optional<ErrorObject>> replies;

  ErrorReply reply() {
    return [this](const std::optional<ErrorObject>& error) { replies.push_back(error); };
  }

  void sendForReply(OstrelReportingSession& session, const Dictionary& message,
                    std::uint32_t category, std::uint16_t type) {
    session.sendMessage(message, MessageCategory{category}, MessageType{type}, reply());
    fakes.runUntilIdle();
  }

  std::vector<FakeTelemetryMessage> sent() {
    return fakes.telemetryBackend->lastSession()->messages();
  }
};

using Replies = std::vector<std::optional<ErrorObject>>;

const ErrorObject kTrouble{"store", /*code=*/7, "the store is away"};

TEST_F(OstrelReportingSessionDelivery, DeliversInItsOrder) {
  const auto session = makeStarted(kHaptics);
  fakes.log->recordInto(fakes.events);

  session->sendMessage({{"EngineOnTime", 1}, {"ostrelreporting_timestamp", 5}},
                       MessageCategory{0x40000007}, MessageType{1}, reply());
  EXPECT_EQ(takeEvents(),
            (Events{"log debug osrr sending message for session owned by 42"}));
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(),
            (Events{"analytics com.orbisk.ostrel.Routing_RouteChange.Start",
                    "wattlog 28 Mediora_Haptics", "trace 0x21042838",
                    "backend.sendMessage 1 7 1",
                    "log debug osrr TelvarAgent fake session 1 : message "
                    "{EngineOnTime: 1, ostrelreporting_timestamp: 5} : category "
                    "1073741831 : type 1"}));
  EXPECT_EQ(replies, Replies{std::nullopt});
}

TEST_F(OstrelReportingSessionDelivery, GoesOnWithoutTheEntryThatIsRefused) {
  const auto session = makeStarted(kHaptics);
  fakes.entryStorage->setMostBytesOfList(0);

  sendForReply(*session, {{"a", 1}}, 1, 0);
  sendForReply(*session, {{"b", 2}}, 1, 0);

  EXPECT_EQ(sent().size(), 2u);
  EXPECT_EQ(fakes.analyticsSink->names().size(), 2u);
  EXPECT_EQ(replies, (Replies{std::nullopt, std::nullopt}));
  EXPECT_EQ(entriesOf(*session), Events{});
  EXPECT_EQ(fakes.log->texts(LogLevel::kError).size(), 1u);
  EXPECT_EQ(session->createSummaryEventForSession(), std::nullopt);
}

TEST_F(OstrelReportingSessionDelivery, MirrorsBeforeItAggregates) {
  const auto session = makeStarted(kHaptics);
  fakes.telemetryBackend->setOnSend([&](const FakeTelemetryMessage&) {
    fakes.events->add("entries " + std::to_string(entriesOf(*session).size()));
  });

  send(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(takeEvents(),
            (Events{"analytics com.orbisk.ostrel.Generic.Generic", "trace 0x21042838",
                    "backend.sendMessage 1 1 0", "entries 1"}));
}

TEST_F(OstrelReportingSessionDelivery, SendsAndAggregatesKeysWithoutBlanks) {
  const auto session = makeStarted(kHaptics);

  send(*session, {{"device name", "x y"}, {"a b c", 2}, {"d", 3}}, 1, 0);

  const Dictionary sanitised{{"device_name", "x y"}, {"a_b_c", 2}, {"d", 3}};
  ASSERT_EQ(sent().size(), 1u);
  EXPECT_EQ(sent()[0].payload, sanitised);
  EXPECT_EQ(entriesOf(*session),
            Events{"{Generic_Generic_1: " + description(sanitised) + "}"});
}

TEST_F(OstrelReportingSessionDelivery, ShowsTheBridgesTheKeysAsReceived) {
  const auto session = makeStarted(kHaptics);
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "App"}});

  send(*session,
       {{"device name", 1}, {"EngineOnTime", 2}, {"ostrelreporting_timestamp", 3}}, 1, 0);

  EXPECT_EQ(fakes.analyticsSink->payload(0),
            (Dictionary{{"device name", 1},
                        {"EngineOnTime", 2},
                        {"ostrelreporting_timestamp", 3},
                        {"HostApplicationDisplayID", "App"}}));
  EXPECT_EQ(fakes.wattlogSink->logged()[0].event, (Dictionary{{"EngineOnDuration", 2},
                                                              {"ApplicationName", "App"},
                                                              {"TimestampEnd", 3}}));
}

TEST_F(OstrelReportingSessionDelivery, GivesTheBridgesTheFullCategory) {
  const auto session = makeStarted(kHaptics);

  send(*session, {{"a", 1}}, 0x80000008, 4);

  EXPECT_EQ(fakes.analyticsSink->names(),
            Events{"com.orbisk.ostrel.Toolbox_Error.Error"});
}

TEST_F(OstrelReportingSessionDelivery, MirrorsInEveryState) {
  const auto session = makeSession(42);
  send(*session, {{"a", 1}}, 1, 0);
  EXPECT_EQ(fakes.analyticsSink->names().size(), 1u);
  session->setServiceType(ServiceType{kTest});
  session->start();

  send(*session, {{"a", 1}}, 1, 0);
  EXPECT_EQ(fakes.analyticsSink->names().size(), 2u);
  stop(*session);

  EXPECT_EQ(fakes.analyticsSink->names().back(),
            "com.orbisk.ostrel.Undefined.Unknown");  // The summary as well.
}

TEST_F(OstrelReportingSessionDelivery, KeepsOneElementEntriesOfMessages) {
  const auto session = makeStarted(kHaptics);

  send(*session, {{"a", 1}, {"b", 2}}, 1, 0);
  send(*session, {{"c", 3}}, 0x40000007, 1);

  EXPECT_EQ(entriesOf(*session), (Events{"{Generic_Generic_1: {a: 1, b: 2}}",
                                         "{Routing_RouteChange_Start_1: {c: 3}}"}));
}

TEST_F(OstrelReportingSessionDelivery, KeepsFullCategoryInLogAndLow16BitsOnTheWire) {
  const auto session = makeStarted(kHaptics);

  send(*session, {{"a", 1}}, 65538, 0xABCD);
  send(*session, {{"a", 1}}, 0xFFFFFFFF, 0xFFFF);

  ASSERT_EQ(sent().size(), 2u);
  EXPECT_EQ(sent()[0].category, 2);
  EXPECT_EQ(sent()[0].type, 0xABCD);
  EXPECT_EQ(sent()[1].category, 0xFFFF);
  EXPECT_EQ(sent()[1].type, 0xFFFF);
  EXPECT_EQ(fakes.log->count("TelvarAgent fake session 1 : message {a: 1} : category "
                             "65538 : type 43981"),
            1u);
  EXPECT_EQ(fakes.log->count("TelvarAgent fake session 1 : message {a: 1} : category "
                             "4294967295 : type 65535"),
            1u);
}

// The rows of outcomes.

TEST_F(OstrelReportingSessionDelivery, AnswersATestSessionWithoutSending) {
  const auto session = makeStarted(kTest);

  sendForReply(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(takeLines(),
            (LogLines{debugLine("osrr", "sending message for session owned by 42"),
                      infoLine("osrr", "transactions aren't allowed on this platform")}));
  EXPECT_EQ(takeEvents(),
            (Events{"analytics com.orbisk.ostrel.Generic.Generic", "trace 0x21042838"}));
  EXPECT_EQ(replies, Replies{std::nullopt});
  EXPECT_EQ(entriesOf(*session), Events{"{Generic_Generic_1: {a: 1}}"});
}

TEST_F(OstrelReportingSessionDelivery, AnswersADetachedSessionWithAnError) {
  const auto session = makeDetached(kHaptics);

  sendForReply(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(takeLines(),
            (LogLines{debugLine("osrr", "sending message for session owned by 42"),
                      errorLine("osrr", "No valid TelvarSession")}));
  EXPECT_EQ(takeEvents(),
            (Events{"analytics com.orbisk.ostrel.Generic.Generic", "trace 0x21042838"}));
  EXPECT_EQ(replies, Replies{(ErrorObject{std::string(kGeneralErrorDomain), /*code=*/-1,
                                          "No valid TelvarSession"})});
  EXPECT_EQ(entriesOf(*session), Events{"{Generic_Generic_1: {a: 1}}"});
}

TEST_F(OstrelReportingSessionDelivery, RepliesNoErrorOnceSent) {
  const auto session = makeStarted(kHaptics);

  sendForReply(*session, {{"a b", 1}}, 1, 0);

  EXPECT_EQ(
      takeLines(),
      (LogLines{debugLine("osrr", "sending message for session owned by 42"),
                debugLine("osrr",
                          "TelvarAgent fake session 1 : message {a b: 1} : category 1 : "
                          "type 0")}));
  EXPECT_EQ(replies, Replies{std::nullopt});
}

TEST_F(OstrelReportingSessionDelivery, LogsAndRepliesTheBackendsError) {
  const auto session = makeStarted(kHaptics);
  fakes.telemetryBackend->scriptSend({false, kTrouble});

  sendForReply(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(takeLines(),
            (LogLines{debugLine("osrr", "sending message for session owned by 42"),
                      errorLine("osrr", "error sending message the store is away")}));
  EXPECT_EQ(replies, Replies{kTrouble});
  EXPECT_EQ(entriesOf(*session).size(), 1u);
}

TEST_F(OstrelReportingSessionDelivery, SaysNothingOfAFailureWithoutAnError) {
  const auto session = makeStarted(kHaptics);
  fakes.telemetryBackend->scriptSend({false, std::nullopt});

  sendForReply(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(takeLines(),
            LogLines{debugLine("osrr", "sending message for session owned by 42")});
  EXPECT_EQ(replies, Replies{std::nullopt});
}

TEST_F(OstrelReportingSessionDelivery, SendsASingleMessageWhenNotStarted) {
  const auto session = makeSession(42);
  session->setServiceType(ServiceType{kHaptics});
  fakes.runUntilIdle();
  forgetRecords();

  sendForReply(*session, {{"a b", 1}}, 65538, 6);

  EXPECT_EQ(
      takeLines(),
      (LogLines{debugLine("osrr", "sending message for session owned by 42"),
                debugLine("osrr", "session not started, will send as a single message"),
                debugLine("osrr", "sending single message after delta 0 for service 3"),
                debugLine("osrr", "sending single message"),
                debugLine("osrr", "message {a_b: 1} : category 65538 : type 6")}));
  const auto single = fakes.telemetryBackend->singleMessages();
  ASSERT_EQ(single.size(), 1u);
  EXPECT_EQ(single[0].category, 2);
  EXPECT_EQ(single[0].type, 6);
  EXPECT_EQ(single[0].payload, (Dictionary{{"a_b", 1}}));
  EXPECT_EQ(single[0].userInfo.get(kTelvarUserInfoServiceName), Value("haptics"));
  EXPECT_EQ(replies, Replies{std::nullopt});
}

TEST_F(OstrelReportingSessionDelivery, AggregatesBeforeTheFirstStart) {
  const auto session = makeSession(42);

  send(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(entriesOf(*session), Events{"{Generic_Generic_1: {a: 1}}"});
}

TEST_F(OstrelReportingSessionDelivery, DoesNotAggregateOnceStopped) {
  const auto session = makeStarted(kHaptics);
  stop(*session);
  forgetRecords();

  sendForReply(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(entriesOf(*session), Events{"none"});
  EXPECT_EQ(takeEvents(),
            (Events{"analytics com.orbisk.ostrel.Generic.Generic", "trace 0x21042838",
                    "trace 0x21042838", "backend.sendOneMessage 1 0"}));
  EXPECT_EQ(replies, Replies{std::nullopt});
}

TEST_F(OstrelReportingSessionDelivery, NeverCallsAnAbsentReply) {
  auto session = makeStarted(kHaptics);
  fakes.telemetryBackend->scriptSend({false, kTrouble});
  send(*session, {{"a", 1}}, 1, 0);
  stop(*session);
  send(*session, {{"a", 1}}, 1, 0);
  session = makeDetached(kHaptics);
  send(*session, {{"a", 1}}, 1, 0);

  EXPECT_EQ(fakes.log->count("No valid TelvarSession"), 1u);
}

TEST_F(OstrelReportingSessionDelivery, DecidesByTheStateWhenTheStepRuns) {
  const auto session = makeSession(42);

  session->start();
  session->sendMessage({{"a", 1}}, MessageCategory{1}, MessageType{0}, reply());
  session->stop();
  session->sendMessage({{"b", 1}}, MessageCategory{1}, MessageType{0}, reply());
  fakes.runUntilIdle();

  EXPECT_EQ(fakes.telemetryBackend->session(1)->messages().size(), 2u);  // And summary.
  EXPECT_EQ(fakes.telemetryBackend->singleMessages().size(), 1u);
  EXPECT_EQ(replies.size(), 2u);
}

TEST_F(OstrelReportingSessionDelivery, DeliversInTheOrderOfTheCalls) {
  const auto session = makeStarted(kHaptics);

  for (int i = 0; i < 100; ++i) {
    session->sendMessage({{"i", i}}, MessageCategory{1}, MessageType{0},
                         /*reply=*/nullptr);
  }
  fakes.runUntilIdle();

  ASSERT_EQ(sent().size(), 100u);
  for (int i = 0; i < 100; ++i) EXPECT_EQ(sent()[i].payload, (Dictionary{{"i", i}}));
}

TEST_F(OstrelReportingSessionDelivery, DeliversAtOnceOnItsQueueWhenSync) {
  const auto session = makeStarted(kHaptics);

  onQueueOf(*session, [&] {
    session->sendMessage({{"a", 1}}, MessageCategory{1}, MessageType{0}, /*sync=*/true,
                         reply());
    EXPECT_EQ(replies.size(), 1u);
  });

  EXPECT_EQ(sent().size(), 1u);
}

// Message identifiers.

class OstrelReportingSessionMessageId : public SessionTest {
 protected:
  std::string nextId(OstrelReportingSession& session, std::uint32_t category,
                     std::uint16_t type) OSTREL_NO_THREAD_SAFETY_ANALYSIS {
    return session.messageIdForCategory(MessageCategory{category}, MessageType{type});
  }
};

TEST_F(OstrelReportingSessionMessageId, CountsEachNameFromOne) {
  const auto session = makeSession(42);

  EXPECT_EQ(nextId(*session, 0x40000007, 1), "Routing_RouteChange_Start_1");
  EXPECT_EQ(nextId(*session, 0x40000007, 1), "Routing_RouteChange_Start_2");
  EXPECT_EQ(nextId(*session, 0x40000007, 2), "Routing_RouteChange_Stop_1");
  EXPECT_EQ(nextId(*session, 0x40000007, 1), "Routing_RouteChange_Start_3");
}

TEST_F(OstrelReportingSessionMessageId, KeepsSharedCounterForEqualNames) {
  const auto session = makeSession(42);

  EXPECT_EQ(nextId(*session, 12, 0), "Undefined_Generic_1");
  EXPECT_EQ(nextId(*session, 13, 0), "Undefined_Generic_2");
  EXPECT_EQ(nextId(*session, 0xFFFFFFFF, 0), "Undefined_Generic_3");
  EXPECT_EQ(nextId(*session, 0x00010000, 6), "_Undefined_Undefined_1");
  EXPECT_EQ(nextId(*session, 0x00030000, 7), "_Undefined_Undefined_2");
}

TEST_F(OstrelReportingSessionMessageId, CountsForEachSessionByItself) {
  const auto first = makeSession(1);
  const auto second = makeSession(2);

  EXPECT_EQ(nextId(*first, 1, 0), "Generic_Generic_1");
  EXPECT_EQ(nextId(*second, 1, 0), "Generic_Generic_1");
}

// The payload without blanks.

TEST(SanitisedPayload, ReplacesEachBlankOfATextKey) {
  EXPECT_EQ(SanitisedPayload({{" a  b ", 1}}), (Dictionary{{"_a__b_", 1}}));
}

TEST(SanitisedPayload, LeavesOtherKeysAndAllValuesAsTheyAre) {
  DictionaryBuilder message;
  message.set(Value(7), Value("x y"));
  message.set("a b", Dictionary{{"c d", 1}});
  message.set("tab\tnew\nline", 1);

  const Dictionary sanitised = SanitisedPayload(message.build());

  DictionaryBuilder expected;
  expected.set(Value(7), Value("x y"));
  expected.set("a_b", Dictionary{{"c d", 1}});
  expected.set("tab\tnew\nline", 1);
  EXPECT_EQ(sanitised, expected.build());
}

TEST(SanitisedPayload, LetsTheLaterOfTwoEqualKeysWin) {
  EXPECT_EQ(SanitisedPayload({{"a b", 1}, {"a_b", 2}}), (Dictionary{{"a_b", 2}}));
  EXPECT_EQ(SanitisedPayload({{"a_b", 2}, {"a b", 1}}), (Dictionary{{"a_b", 1}}));
}

TEST(SanitisedPayload, IsTheMessageItselfWithoutBlanks) {
  const Dictionary message{{"a", "x y"}};

  const Dictionary sanitised = SanitisedPayload(message);

  EXPECT_EQ(sanitised.value().bytes().data(), message.value().bytes().data());
}

TEST(SanitisedPayload, NeverChangesTheMessage) {
  const Dictionary message{{"a b", 1}};

  SanitisedPayload(message);

  EXPECT_EQ(message, (Dictionary{{"a b", 1}}));
}

}  // namespace
}  // namespace ostrel
