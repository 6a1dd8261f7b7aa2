#include <gtest/gtest.h>

#include <chrono>

#include "Statistics/Service/SessionTestFixture.h"
#include "platform/fake/CountingAccount.h"

namespace ostrel {
namespace {

using std::chrono::nanoseconds;
using std::chrono::seconds;
using Events = std::vector<std::string>;

constexpr std::uint16_t kAlarms = 4;
constexpr std::uint16_t kStandalone = 5;

class OstrelReportingSingleMessage : public SessionTest {
 protected:
  OstrelReportingSingleMessage() {
    makeSession(1);  // Registers the sessions' log scope.
    forgetRecords();
  }

  void sendSingle(const Dictionary& message, std::uint32_t category, std::uint16_t type,
                  std::uint16_t serviceType) {
    OstrelReportingSession::sendSingleMessage(
        platform, message, MessageCategory{category}, MessageType{type},
        ServiceType{serviceType}, /*userInfo=*/std::nullopt,
        [this](const std::optional<ErrorObject>& error) { replies.push_back(error); });
  }

  std::vector<FakeTelemetryBackend::SingleMessage> sent() {
    return fakes.telemetryBackend->singleMessages();
  }

  std::vector<std::optional<ErrorObject>> replies;
};

using Replies = std::vector<std::optional<ErrorObject>>;

TEST_F(OstrelReportingSingleMessage, SendsOnTheBackgroundQueueNeverInline) {
  fakes.log->recordInto(fakes.events);

  sendSingle({{"a", 1}}, 1, 2, kStandalone);
  EXPECT_EQ(takeEvents(), (Events{"log debug osrr sending single message after delta 0 "
                                  "for service 5"}));
  fakes.runUntilIdle();

  EXPECT_EQ(takeEvents(),
            (Events{"trace 0x21042838", "log debug osrr sending single message",
                    "backend.sendOneMessage 1 2",
                    "log debug osrr message {a: 1} : category 1 : type 2"}));
  EXPECT_EQ(replies, Replies{std::nullopt});
}

TEST_F(OstrelReportingSingleMessage, HoldsOnlyItselfInMemoryWhileItWaits) {
  constexpr std::size_t kInputBytes = 64 * 1024;
  const auto account = std::make_shared<CountingAccount>();
  const Dictionary plain{{"a", 1}};
  const auto send = [&] {
    std::string input(kInputBytes, '\0');
    const auto own = plain.value().bytes();
    std::copy(own.begin(), own.end(), input.begin());
    const ValueBuffer buffer = ValueBuffer::copyOf(
        {reinterpret_cast<const std::uint8_t*>(input.data()), input.size()}, account);
    sendSingle(Dictionary(buffer, buffer.data()), 1, 2, kAlarms);
  };
  fakes.random->script({30, 0});

  send();
  EXPECT_LT(account->bytes(), 1000u);
  EXPECT_GT(account->bytes(), 0u);
  send();
  EXPECT_GT(account->bytes(), kInputBytes) << "what does not wait is not copied";
  fakes.advance(seconds(60));

  ASSERT_EQ(sent().size(), 2u);
  EXPECT_EQ(sent()[1].payload, plain);
}

TEST_F(OstrelReportingSingleMessage, GivesTheBackendThreeEntriesOfSessionInfo) {
  sendSingle({{"a", 1}}, 1, 2, kStandalone);
  fakes.runUntilIdle();

  ASSERT_EQ(sent().size(), 1u);
  EXPECT_EQ(sent()[0].sessionInfo, (Dictionary{{"kTelvarSessionInfoClientType", 19},
                                               {"kTelvarSessionInfoClientVersion", 1.0},
                                               {"kTelvarSessionInfoSessionID", -1}}));
}

TEST_F(OstrelReportingSingleMessage, NamesTheServiceWithoutMore) {
  const std::vector<std::pair<std::uint16_t, std::string>> names = {{0, "generic"},
                                                                    {5, "standalone"},
                                                                    {11, "test"},
                                                                    {65535, "unknown"},
                                                                    {99, "unknown"}};
  for (const auto& [type, name] : names) sendSingle({{"a", 1}}, 1, 2, type);
  fakes.runUntilIdle();

  ASSERT_EQ(sent().size(), names.size());
  for (std::size_t i = 0; i < names.size(); ++i) {
    EXPECT_EQ(sent()[i].userInfo,
              (Dictionary{{"kTelvarUserInfoClientName", "com.orbisk.ostrel"},
                          {"kTelvarUserInfoServiceName", names[i].second}}));
  }
}

TEST_F(OstrelReportingSingleMessage, KeepsIgnoringUserInfoOfSingleMessages) {
  OstrelReportingSession::sendSingleMessage(
      platform, {{"a", 1}}, MessageCategory{1}, MessageType{2}, ServiceType{kStandalone},
      Dictionary{{"device_name", "x"}, {"kTelvarUserInfoServiceName", "mine"}},
      /*reply=*/nullptr);
  fakes.runUntilIdle();

  ASSERT_EQ(sent().size(), 1u);
  EXPECT_EQ(sent()[0].userInfo,
            (Dictionary{{"kTelvarUserInfoClientName", "com.orbisk.ostrel"},
                        {"kTelvarUserInfoServiceName", "standalone"}}));
}

TEST_F(OstrelReportingSingleMessage, CutsTheCategoryForTheBackendButNotInTheLog) {
  sendSingle({{"a", 1}}, 0x10000002, 3, kStandalone);
  fakes.runUntilIdle();

  ASSERT_EQ(sent().size(), 1u);
  EXPECT_EQ(sent()[0].category, 2);
  EXPECT_EQ(sent()[0].type, 3);
  EXPECT_EQ(fakes.log->count("message {a: 1} : category 268435458 : type 3"), 1u);
}

TEST_F(OstrelReportingSingleMessage, SendsKeysWithoutBlanksAndLogsThemAsGiven) {
  sendSingle({{"device name", 1}}, 1, 0, kStandalone);
  fakes.runUntilIdle();

  ASSERT_EQ(sent().size(), 1u);
  EXPECT_EQ(sent()[0].payload, (Dictionary{{"device_name", 1}}));
  EXPECT_EQ(fakes.log->count("message {device name: 1} : category 1 : type 0"), 1u);
}

TEST_F(OstrelReportingSingleMessage, LogsAndRepliesTheBackendsError) {
  const ErrorObject trouble{"store", /*code=*/7, "the store is away"};
  fakes.telemetryBackend->scriptSendOne({false, trouble});

  sendSingle({{"a", 1}}, 1, 0, kStandalone);
  fakes.runUntilIdle();

  EXPECT_EQ(
      takeLines(),
      (LogLines{debugLine("osrr", "sending single message after delta 0 for service 5"),
                debugLine("osrr", "sending single message"),
                errorLine("osrr", "sendOneMessageWithSessionInfo the store is away")}));
  EXPECT_EQ(replies, Replies{trouble});
}

TEST_F(OstrelReportingSingleMessage, SaysNothingOfAFailureWithoutAnError) {
  fakes.telemetryBackend->scriptSendOne({false, std::nullopt});

  sendSingle({{"a", 1}}, 1, 0, kStandalone);
  fakes.runUntilIdle();

  EXPECT_EQ(
      takeLines(),
      (LogLines{debugLine("osrr", "sending single message after delta 0 for service 5"),
                debugLine("osrr", "sending single message")}));
  EXPECT_EQ(replies, Replies{std::nullopt});
}

TEST_F(OstrelReportingSingleMessage, LogsAFailureWithoutAReply) {
  fakes.telemetryBackend->scriptSendOne(
      {false, ErrorObject{"store", /*code=*/7, "the store is away"}});

  OstrelReportingSession::sendSingleMessage(platform, {{"a", 1}}, MessageCategory{1},
                                            MessageType{0}, ServiceType{kStandalone},
                                            /*userInfo=*/std::nullopt, /*reply=*/nullptr);
  fakes.runUntilIdle();

  EXPECT_EQ(fakes.log->count("sendOneMessageWithSessionInfo the store is away"), 1u);
}

TEST_F(OstrelReportingSingleMessage, DrawsTheDelayOfAlarmsFromSixtySeconds) {
  fakes.random->script({0, 1, 59});
  for (int i = 0; i < 3; ++i) sendSingle({{"i", i}}, 1, 0, kAlarms);

  EXPECT_EQ(fakes.random->bounds(), (std::vector<std::uint32_t>{60, 60, 60}));
  EXPECT_EQ(fakes.workQueues->backgroundDelays(),
            (std::vector<nanoseconds>{seconds(0), seconds(1), seconds(59)}));
  EXPECT_EQ(
      takeLines(),
      (LogLines{
          debugLine("osrr", "sending single message after delta 0 for service 4"),
          debugLine("osrr", "sending single message after delta 1 for service 4"),
          debugLine("osrr", "sending single message after delta 59 for service 4")}));
}

TEST_F(OstrelReportingSingleMessage, SendsAlarmsAfterTheirDelayInAnyOrder) {
  fakes.random->script({30, 10});
  sendSingle({{"first", 1}}, 1, 0, kAlarms);
  sendSingle({{"second", 1}}, 1, 0, kAlarms);

  fakes.advance(seconds(10) - nanoseconds(1));
  EXPECT_EQ(sent().size(), 0u);
  fakes.advance(nanoseconds(1));
  ASSERT_EQ(sent().size(), 1u);
  EXPECT_EQ(sent()[0].payload, (Dictionary{{"second", 1}}));
  fakes.advance(seconds(20));

  ASSERT_EQ(sent().size(), 2u);
  EXPECT_EQ(sent()[1].payload, (Dictionary{{"first", 1}}));
}

TEST_F(OstrelReportingSingleMessage, DelaysNoOtherService) {
  fakes.random->script({59});
  for (std::uint16_t type = 0; type <= 12; ++type) {
    if (type != kAlarms) sendSingle({{"a", 1}}, 1, 0, type);
  }
  sendSingle({{"a", 1}}, 1, 0, 65535);

  EXPECT_TRUE(fakes.random->bounds().empty());
  EXPECT_EQ(fakes.workQueues->backgroundDelays(),
            std::vector<nanoseconds>(13, nanoseconds(0)));
}

TEST_F(OstrelReportingSingleMessage, IsSentThoughItsSessionIsGone) {
  fakes.random->script({59});
  auto session = makeSession(42);
  session->setServiceType(ServiceType{kAlarms});
  send(*session, {{"a", 1}}, 1, 0);
  session.reset();
  EXPECT_TRUE(fakes.events->indexOf("trace 0x21042834"));

  fakes.advance(seconds(59));

  EXPECT_EQ(sent().size(), 1u);
}

TEST_F(OstrelReportingSingleMessage, BuildsNothingThatMessagesShare) {
  sendSingle({{"a", 1}}, 1, 0, 0);
  sendSingle({{"b", 2}}, 2, 1, 1);
  fakes.runUntilIdle();

  ASSERT_EQ(sent().size(), 2u);
  EXPECT_NE(sent()[0].sessionInfo.value().bytes().data(),
            sent()[1].sessionInfo.value().bytes().data());
  EXPECT_EQ(sent()[1].payload, (Dictionary{{"b", 2}}));
}

}  // namespace
}  // namespace ostrel
