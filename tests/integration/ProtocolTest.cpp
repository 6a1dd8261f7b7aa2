// The eleven operations as clients see them over the socket, and what they leave in the
// store.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>

#include "tests/integration/ServiceUnderTest.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;
using std::chrono::steady_clock;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::StartsWith;
using testing::UnorderedElementsAre;
using testing_support::ChildProcess;

constexpr ReporterID kReporter{7};
constexpr ReporterID kUnknown{999};
constexpr MessageCategory kRouteChange{0x40000007};
constexpr MessageType kStart{1};

constexpr const char* kMessages =
    "SELECT s.reporter_id, m.category, m.type, m.payload FROM telemetry_messages AS m "
    "LEFT JOIN telemetry_sessions AS s ON s.id = m.telemetry_session_id "
    "WHERE m.category <> 65535 ORDER BY m.id";

class Protocol : public testing::Test {
 protected:
  Protocol() { service.start(); }

  RecordingClient connect() { return RecordingClient(service.socketPath()); }

  /// A session, created and started, its starting at an end. The reply to the start is
  /// recorded as "start".
  void createStarted(RecordingClient& client, ReporterID id) {
    client->createReportingSession(id, /*reply=*/{});
    client->startReportingSessionForID(id, client.boolean("start"));
    waitUntilStarted(client, id);
  }
  /// A message goes through the session, behind the start.
  void waitUntilStarted(RecordingClient& client, ReporterID id) {
    const std::string probe = "SELECT id FROM telemetry_messages WHERE category = 0";
    const std::size_t before = service.rows(probe).size();
    client->sendMessage({{"is", "started"}}, MessageCategory{0}, MessageType{0}, {{id}},
                        /*reply=*/{});
    ASSERT_TRUE(service.waitForRows(probe, before + 1));
  }
  void send(RecordingClient& client, const char* text, std::optional<ReporterIDs> ids) {
    client->sendMessage({{"text", text}}, kRouteChange, kStart, std::move(ids),
                        client.error("send"));
  }
  /// Writes the defaults and waits until they are in force.
  void switchReporting(RecordingClient& client, bool on) {
    ASSERT_EQ(service.ostrelctl(
                  {"defaults", "write", "disable_reporting", on ? "false" : "true"}),
              0);
    ASSERT_EQ(service.ostrelctl({"notify"}), 0);
    const std::string expected =
        on ? "send no error" : "send com.orbisk.audio.reporting 1";
    ASSERT_TRUE(eventually([&] {
      send(client, "switched?", ReporterIDs{});
      return client.takeReplies().back() == expected;
    }));
  }
  /// The type is set on the session's own queue, a moment after the reply.
  void setServiceType(RecordingClient& client, ReporterID id, int type) {
    client->setServiceType(static_cast<ServiceType>(type), id, /*reply=*/{});
    ASSERT_TRUE(eventually([&] {
      client->getServiceNameForReporterID(id, client.serviceType("type"));
      return client.takeReplies().back() == "type " + std::to_string(type);
    }));
  }

  ServiceUnderTest service;
};

TEST_F(Protocol, AnswersAboutIDZeroTwiceOnceOrNever) {
  RecordingClient client = connect();

  client->setServiceType(ServiceType{2}, kNoReporter, client.boolean("set type"));
  client->getServiceNameForReporterID(kNoReporter, client.serviceType("type"));
  client->setConfiguration({{{"a", 1}}}, kNoReporter, client.boolean("configure"));
  client->startReportingSessionForID(kNoReporter, client.boolean("start"));
  send(client, "nobody's", ReporterIDs{kNoReporter});
  client->stopReportingSessionForID(kNoReporter, client.boolean("stop"));
  client->destroyReportingSession(kNoReporter, client.boolean("destroy"));
  client->reporterIDValid(kNoReporter, client.dictionary("valid"));
  client->createReportingSession(kNoReporter, client.boolean("create"));
  client->getAllReporters(client.reporterIDs("all"));
  client->startReportingSessionForID(kNoReporter, client.boolean("start"));

  EXPECT_THAT(
      client.takeReplies(),
      ElementsAre("type 65535", "type 65535", "configure true", "send no error",
                  "valid reporterID=0 serviceType=65535", "create true", "all 0"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows(kMessages), IsEmpty());
  EXPECT_THAT(service.rows("SELECT id FROM telemetry_sessions"), IsEmpty());
}

TEST_F(Protocol, AnswersAboutUnknownIDs) {
  RecordingClient client = connect();

  client->setServiceType(ServiceType{2}, kUnknown, client.boolean("set type"));
  client->getServiceNameForReporterID(kUnknown, client.serviceType("type"));
  client->setConfiguration({{{"a", 1}}}, kUnknown, client.boolean("configure"));
  client->setConfiguration(std::nullopt, kUnknown, client.boolean("configure"));
  client->startReportingSessionForID(kUnknown, client.boolean("start"));
  send(client, "nobody's", ReporterIDs{kUnknown});
  client->stopReportingSessionForID(kUnknown, client.boolean("stop"));
  client->destroyReportingSession(kUnknown, client.boolean("destroy"));
  client->reporterIDValid(kUnknown, client.dictionary("valid"));
  client->getAllReporters(client.reporterIDs("all"));

  EXPECT_THAT(client.takeReplies(),
              ElementsAre("set type true", "type 65535", "configure true",
                          "configure true", "start false", "send no error", "stop true",
                          "destroy true", "valid reporterID=0 serviceType=65535", "all"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows(kMessages), IsEmpty());
}

TEST_F(Protocol, KnowsIDsOverTheWholeRange) {
  RecordingClient client = connect();

  client->createReportingSession(ReporterID{INT64_MIN}, client.boolean("create"));
  client->createReportingSession(ReporterID{INT64_MAX}, client.boolean("create"));
  client->createReportingSession(ReporterID{-1}, client.boolean("create"));
  client->getAllReporters(client.reporterIDs("all"));

  const auto replies = client.takeReplies();
  ASSERT_EQ(replies.size(), 4u);
  EXPECT_THAT(replies[3], HasSubstr(" -9223372036854775808"));
  EXPECT_THAT(replies[3], HasSubstr(" 9223372036854775807"));
  EXPECT_THAT(replies[3], HasSubstr(" -1"));
}

TEST_F(Protocol, FindsTheSessionOfTheClientThatCameFirst) {
  RecordingClient first = connect();
  first->createReportingSession(kReporter, /*reply=*/{});
  first.takeReplies();
  RecordingClient second = connect();
  second->createReportingSession(kReporter, second.boolean("create"));
  setServiceType(first, kReporter, 2);
  // A client sets the type of its own session only.
  second->setServiceType(ServiceType{3}, kReporter, second.boolean("set type"));
  second->getAllReporters(second.reporterIDs("all"));
  second->reporterIDValid(kReporter, second.dictionary("valid"));
  EXPECT_THAT(second.takeReplies(), ElementsAre("create true", "set type true", "all 7 7",
                                                "valid reporterID=7 serviceType=2"));

  createStarted(first, ReporterID{8});
  second->startReportingSessionForID(kReporter, second.boolean("start"));
  send(second, "for the first", ReporterIDs{kReporter});
  // Destroys its own, which is not started.
  second->destroyReportingSession(kReporter, second.boolean("destroy"));
  second->stopReportingSessionForID(kReporter, second.boolean("stop"));
  second.wait(4);
  EXPECT_THAT(second.takeReplies(), UnorderedElementsAre("start true", "send no error",
                                                         "destroy true", "stop true"));
  first->getAllReporters(first.reporterIDs("all"));
  EXPECT_THAT(first.takeReplies().back(), testing::AnyOf("all 7 8", "all 8 7"));

  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(
      service.rows(std::string("SELECT * FROM (") + kMessages + ") WHERE category = 7"),
      ElementsAre("7|7|1|{\"text\":\"for the first\"}"));
  EXPECT_THAT(service.rows("SELECT json_extract(user_info, "
                           "'$.kTelvarUserInfoServiceName') FROM telemetry_sessions "
                           "WHERE reporter_id = 7"),
              ElementsAre("telephony_session"));
}

TEST_F(Protocol, FindsTheLaterClientsSessionOnceTheFirstIsGone) {
  RecordingClient first = connect();
  first->createReportingSession(kReporter, /*reply=*/{});
  first.takeReplies();
  RecordingClient second = connect();
  second->createReportingSession(kReporter, /*reply=*/{});
  setServiceType(first, kReporter, 2);
  second->setServiceType(ServiceType{3}, kReporter, /*reply=*/{});

  first->abort();

  EXPECT_TRUE(eventually([&] {
    second->getServiceNameForReporterID(kReporter, second.serviceType("type"));
    return second.takeReplies().back() == "type 3";
  }));
}

TEST_F(Protocol, PutsASecondSessionInPlaceOfTheFirstWithoutStoppingIt) {
  RecordingClient client = connect();
  client->createReportingSession(kReporter, client.boolean("create"));
  client->setConfiguration({{{"which", "first"}}}, kReporter, /*reply=*/{});
  client->startReportingSessionForID(kReporter, client.boolean("start"));
  waitUntilStarted(client, kReporter);

  client->createReportingSession(kReporter, client.boolean("create"));
  client->getAllReporters(client.reporterIDs("all"));
  client->startReportingSessionForID(kReporter, client.boolean("start"));
  send(client, "to the second", ReporterIDs{kReporter});
  client->stopReportingSessionForID(kReporter, client.boolean("stop"));

  client.wait(6);
  EXPECT_THAT(client.takeReplies(),
              UnorderedElementsAre("create true", "create true", "all 7", "send no error",
                                   "stop true", "start true"));
  // Both handles go while the service lives.
  EXPECT_TRUE(service.waitForRows(
      "SELECT id FROM telemetry_sessions WHERE ended_at IS NOT NULL", 2));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(
      service.rows("SELECT json_extract(user_info, '$.which'), flushed_at IS NOT NULL, "
                   "ended_at IS NOT NULL, (SELECT count(*) FROM telemetry_messages AS m "
                   "WHERE m.telemetry_session_id = s.id AND m.category = 65535) "
                   "FROM telemetry_sessions AS s ORDER BY id"),
      ElementsAre("first|0|1|0", "NULL|1|1|1"));
}

TEST_F(Protocol, IsSilentAboutAStartOfAStartedSession) {
  RecordingClient client = connect();
  createStarted(client, kReporter);

  client->startReportingSessionForID(kReporter, client.boolean("second start"));
  EXPECT_THAT(client.takeReplies(), IsEmpty());
  client->stopReportingSessionForID(kReporter, client.boolean("stop"));
  client.wait(2);

  EXPECT_THAT(client.takeReplies(), UnorderedElementsAre("stop true", "start true"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows("SELECT reporter_id FROM telemetry_sessions"),
              ElementsAre("7"));
}

TEST_F(Protocol, AnswersAStartAtEachStopAlsoThatOfAChangeOfType) {
  RecordingClient client = connect();
  createStarted(client, kReporter);

  client->setServiceType(ServiceType{3}, kReporter, client.boolean("set type"));
  EXPECT_THAT(client.wait(2), UnorderedElementsAre("set type true", "start true"));
  client->stopReportingSessionForID(kReporter, client.boolean("stop"));
  client.wait(4);

  EXPECT_THAT(client.takeReplies(), UnorderedElementsAre("set type true", "start true",
                                                         "stop true", "start true"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows("SELECT json_extract(user_info, "
                           "'$.kTelvarUserInfoServiceName'), flushed_at IS NOT NULL "
                           "FROM telemetry_sessions ORDER BY id"),
              ElementsAre("unknown_session|1", "haptics_session|1"));
}

TEST_F(Protocol, SendsToEveryStartedSessionWithoutAList) {
  RecordingClient one = connect();
  createStarted(one, ReporterID{1});
  one->createReportingSession(ReporterID{2}, /*reply=*/{});
  RecordingClient two = connect();
  createStarted(two, ReporterID{3});

  send(one, "to all", std::nullopt);

  EXPECT_THAT(one.takeReplies(), ElementsAre("send no error"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(
      service.rows(std::string("SELECT * FROM (") + kMessages + ") WHERE category = 7"),
      UnorderedElementsAre("1|7|1|{\"text\":\"to all\"}", "3|7|1|{\"text\":\"to all\"}"));
}

TEST_F(Protocol, SendsAMessageOutByItselfWithoutAListAndAStartedSession) {
  RecordingClient client = connect();
  client->createReportingSession(kReporter, /*reply=*/{});

  client->sendMessage({{"a b", 1}}, MessageCategory{0x10000002}, MessageType{5},
                      std::nullopt, client.error("send"));

  EXPECT_THAT(client.takeReplies(), ElementsAre("send no error"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(
      service.rows("SELECT telemetry_session_id, category, type, payload, session_info, "
                   "user_info FROM telemetry_messages"),
      ElementsAre("NULL|2|5|{\"a_b\":1}|"
                  "{\"kTelvarSessionInfoClientType\":19,"
                  "\"kTelvarSessionInfoClientVersion\":1.0,"
                  "\"kTelvarSessionInfoSessionID\":-1}|"
                  "{\"kTelvarUserInfoClientName\":\"com.orbisk.ostrel\","
                  "\"kTelvarUserInfoServiceName\":\"standalone\"}"));
}

TEST_F(Protocol, SendsNothingForAListThatIsEmpty) {
  RecordingClient client = connect();
  createStarted(client, kReporter);

  send(client, "to nobody", ReporterIDs{});

  EXPECT_THAT(client.takeReplies(), ElementsAre("send no error"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows("SELECT id FROM telemetry_messages WHERE category = 7"),
              IsEmpty());
}

TEST_F(Protocol, SendsToAnIDAsOftenAsItIsNamed) {
  RecordingClient client = connect();
  createStarted(client, kReporter);

  send(client, "twice", ReporterIDs{kReporter, kNoReporter, kUnknown, kReporter});

  EXPECT_THAT(client.takeReplies(), ElementsAre("send no error"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows("SELECT payload FROM telemetry_messages WHERE category = 7"),
              ElementsAre("{\"text\":\"twice\"}", "{\"text\":\"twice\"}"));
}

TEST_F(Protocol, SendsAMessageOfASessionThatIsNotStartedByItself) {
  RecordingClient client = connect();
  client->createReportingSession(kReporter, /*reply=*/{});
  client->setConfiguration({{{"not", "sent"}}}, kReporter, /*reply=*/{});
  setServiceType(client, kReporter, 2);

  send(client, "alone", ReporterIDs{kReporter});

  client.takeReplies();
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows("SELECT telemetry_session_id, category, type, payload, "
                           "user_info FROM telemetry_messages"),
              ElementsAre("NULL|7|1|{\"text\":\"alone\"}|"
                          "{\"kTelvarUserInfoClientName\":\"com.orbisk.ostrel\","
                          "\"kTelvarUserInfoServiceName\":\"telephony\"}"));
}

TEST_F(Protocol, RefusesMessagesWhileReportingIsSwitchedOff) {
  RecordingClient client = connect();
  client->createReportingSession(kReporter, /*reply=*/{});
  setServiceType(client, kReporter, 2);

  switchReporting(client, /*on=*/false);
  send(client, "refused", std::nullopt);
  client->startReportingSessionForID(kReporter, client.boolean("start"));
  client->reporterIDValid(kReporter, client.dictionary("valid"));
  client->getServiceNameForReporterID(kReporter, client.serviceType("type"));
  client->setConfiguration({{{"a", 1}}}, kReporter, client.boolean("configure"));
  client->stopReportingSessionForID(kReporter, client.boolean("stop"));
  client->createReportingSession(ReporterID{8}, client.boolean("create"));
  client->setServiceType(ServiceType{3}, kReporter, client.boolean("set type"));
  client->getAllReporters(client.reporterIDs("all"));
  client->destroyReportingSession(ReporterID{8}, client.boolean("destroy"));

  auto replies = client.takeReplies();
  EXPECT_THAT(replies,
              ElementsAre("send com.orbisk.audio.reporting 1", "start false",
                          "valid reporterID=0 serviceType=65535", "type 65535",
                          "configure true", "stop true", "create true", "set type true",
                          testing::AnyOf("all 7 8", "all 8 7"), "destroy true"));

  switchReporting(client, /*on=*/true);
  send(client, "accepted", std::nullopt);
  client->reporterIDValid(kReporter, client.dictionary("valid"));
  EXPECT_THAT(client.takeReplies(),
              ElementsAre("send no error", "valid reporterID=7 serviceType=3"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows(kMessages), ElementsAre("NULL|7|1|{\"text\":\"accepted\"}"));
}

TEST_F(Protocol, SendsNothingAfterARestartOfWhatIsSwitchedOff) {
  {
    RecordingClient client = connect();
    switchReporting(client, /*on=*/false);
    client->killService(/*reply=*/nullptr);
  }
  EXPECT_EQ(service.process().wait(), 2);
  service.start();
  RecordingClient client = connect();

  // As the service manager does when the service is ready.
  ASSERT_EQ(service.ostrelctl({"notify"}), 0);
  ASSERT_TRUE(eventually([&] {
    send(client, "switched?", ReporterIDs{});
    return client.takeReplies().back() == "send com.orbisk.audio.reporting 1";
  }));
  client->createReportingSession(kReporter, client.boolean("create"));
  client->startReportingSessionForID(kReporter, client.boolean("start"));
  send(client, "to all", std::nullopt);
  send(client, "to one", ReporterIDs{kReporter});

  EXPECT_THAT(client.takeReplies(), ElementsAre("create true", "start false",
                                                "send com.orbisk.audio.reporting 1",
                                                "send com.orbisk.audio.reporting 1"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows("SELECT id FROM telemetry_messages"), IsEmpty());
  EXPECT_THAT(service.rows("SELECT id FROM telemetry_sessions"), IsEmpty());
}

TEST_F(Protocol, GoesOnWithAStartedSessionOnceReportingIsOnAgain) {
  RecordingClient client = connect();
  createStarted(client, kReporter);
  switchReporting(client, /*on=*/false);
  client->stopReportingSessionForID(kReporter, client.boolean("stop"));
  EXPECT_THAT(client.takeReplies(), ElementsAre("stop true"));

  switchReporting(client, /*on=*/true);
  send(client, "still there", ReporterIDs{kReporter});
  client->stopReportingSessionForID(kReporter, client.boolean("stop"));
  client.wait(3);

  EXPECT_THAT(client.takeReplies(),
              UnorderedElementsAre("send no error", "stop true", "start true"));
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_THAT(service.rows("SELECT s.id, m.payload FROM telemetry_messages AS m JOIN "
                           "telemetry_sessions AS s ON s.id = m.telemetry_session_id "
                           "WHERE m.category = 7"),
              ElementsAre("1|{\"text\":\"still there\"}"));
}

TEST_F(Protocol, GivesChangedDefaultsToTheSessionsThatThereAre) {
  ASSERT_TRUE(std::filesystem::create_directories(service / "state/defaults") ||
              std::filesystem::exists(service / "state/defaults"));
  service.write("state/defaults/com.orbisk.ostrel.json",
                R"({"device_name": "Phone", "unread": 1})");
  RecordingClient client = connect();
  client->createReportingSession(ReporterID{1}, /*reply=*/{});
  client.takeReplies();

  // Any touch of the file of that name posts the notification.
  service.write("run/notify/com.orbisk.ostrel.reporting", "");
  ASSERT_TRUE(eventually(
      [&] { return service.read("log.txt").find("re-reading") != std::string::npos; }));
  client.takeReplies();
  client->createReportingSession(ReporterID{2}, /*reply=*/{});
  for (const int id : {1, 2}) {
    client->startReportingSessionForID(ReporterID{id}, /*reply=*/{});
  }
  waitUntilStarted(client, ReporterID{1});
  waitUntilStarted(client, ReporterID{2});

  EXPECT_THAT(
      service.rows("SELECT reporter_id, user_info FROM telemetry_sessions ORDER BY 1"),
      ElementsAre("1|{\"kTelvarUserInfoClientName\":\"com.orbisk.ostrel\","
                  "\"kTelvarUserInfoServiceName\":\"unknown_session\","
                  "\"device_name\":\"Phone\",\"disable_reporting\":0}",
                  "2|{\"kTelvarUserInfoClientName\":\"com.orbisk.ostrel\","
                  "\"kTelvarUserInfoServiceName\":\"unknown_session\"}"));
}

TEST_F(Protocol, RecordsHowLongAClientWasThere) {
  const std::string uptimes =
      "SELECT name, json_extract(payload, '$.processName'), "
      "json_type(payload, '$.seconds'), "
      "json_extract(payload, '$.seconds') BETWEEN 0 AND 60 FROM analytics_events";
  const std::string expected =
      "com.orbisk.ostrel.ostrelreportingclientuptime|integration_tes|real|1";
  RecordingClient well = connect();
  RecordingClient badly = connect();
  well.takeReplies();
  badly.takeReplies();

  well->close();
  ASSERT_TRUE(service.waitForRows(uptimes, 1));
  badly->abort();
  ASSERT_TRUE(service.waitForRows(uptimes, 2));

  EXPECT_THAT(service.rows(uptimes), ElementsAre(expected, expected));
}

TEST_F(Protocol, EndsWithStatus2OnRequestAndKeepsWhatIsDurable) {
  RecordingClient owner = connect();
  createStarted(owner, kReporter);
  RecordingClient killer = connect();

  killer->killService(killer.boolean("kill"));

  EXPECT_EQ(service.process().wait(), 2);
  EXPECT_THAT(killer.wait(1), ElementsAre("closed"));
  EXPECT_THAT(owner.wait(1), ElementsAre("closed"));
  EXPECT_THAT(service.rows(kMessages), ElementsAre("7|0|0|{\"is\":\"started\"}"));
}

TEST_F(Protocol, HasEveryAcceptedMessageInTheStoreAfterAnOrderlyEnd) {
  constexpr int kClients = 4;
  constexpr int kMessagesPerClient = 2000;
  std::vector<std::unique_ptr<RecordingClient>> clients;
  std::atomic<int> accepted{0};
  for (int i = 1; i <= kClients; ++i) {
    clients.push_back(std::make_unique<RecordingClient>(service.socketPath()));
    (*clients.back())->createReportingSession(ReporterID{i}, /*reply=*/{});
    (*clients.back())->startReportingSessionForID(ReporterID{i}, /*reply=*/{});
  }
  for (int n = 0; n < kMessagesPerClient; ++n) {
    for (int i = 1; i <= kClients; ++i) {
      (*clients[i - 1])
          ->sendMessage({{"client", i}, {"n", n}}, kRouteChange, kStart,
                        {{ReporterID{i}}}, [&](const std::optional<ErrorObject>& error) {
                          if (!error) ++accepted;
                        });
    }
  }
  ASSERT_TRUE(eventually([&] { return accepted == kClients * kMessagesPerClient; }));

  const auto begin = steady_clock::now();
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_LT(steady_clock::now() - begin, 2s);

  EXPECT_THAT(
      service.rows("SELECT count(*), count(DISTINCT json_extract(m.payload, '$.n')), "
                   "min(s.reporter_id = json_extract(m.payload, '$.client')) "
                   "FROM telemetry_messages AS m JOIN telemetry_sessions AS s "
                   "ON s.id = m.telemetry_session_id WHERE m.category = 7 "
                   "GROUP BY s.reporter_id"),
      ElementsAre("2000|2000|1", "2000|2000|1", "2000|2000|1", "2000|2000|1"));
}

TEST_F(Protocol, HasTheMessagesOfASessionThatStillWaitedForTheStoreAtTheEnd) {
  RecordingClient client = connect();
  client->createReportingSession(kReporter, /*reply=*/{});
  client->startReportingSessionForID(kReporter, /*reply=*/{});
  send(client, "early", ReporterIDs{kReporter});
  // The store is hardly made by now.
  EXPECT_THAT(client.takeReplies(), ElementsAre("send no error"));

  EXPECT_EQ(service.terminate(), 0);

  EXPECT_THAT(service.rows(kMessages), ElementsAre("7|7|1|{\"text\":\"early\"}"));
}

TEST_F(Protocol, HasTheMessagesOfAnInterruptedStreamInOrderWithoutAGap) {
  RecordingClient client = connect();
  client->createReportingSession(kReporter, /*reply=*/{});
  client->startReportingSessionForID(kReporter, /*reply=*/{});
  std::atomic<int> accepted{0};
  std::atomic<bool> isDone{false};
  std::thread sender([&] {
    for (int n = 0; !isDone && n < 200'000; ++n) {
      client->sendMessage({{"n", n}}, kRouteChange, kStart, {{kReporter}},
                          [&](const std::optional<ErrorObject>& error) {
                            if (!error) ++accepted;
                          });
      if (n % 100 == 0) std::this_thread::sleep_for(1ms);
    }
  });
  ASSERT_TRUE(eventually([&] { return accepted > 1000; }));

  const auto begin = steady_clock::now();
  EXPECT_EQ(service.terminate(), 0);
  EXPECT_LT(steady_clock::now() - begin, 2s);
  isDone = true;
  sender.join();
  client.wait(1);

  const auto rows =
      service.rows("SELECT count(*) >= " + std::to_string(accepted) +
                   ", count(*) = 1 + max(json_extract(payload, '$.n')) FROM "
                   "telemetry_messages WHERE category = 7");
  EXPECT_THAT(rows, ElementsAre("1|1")) << accepted << " accepted";
}

TEST_F(Protocol, GoesOnWhenASecondServiceWantsItsSocket) {
  RecordingClient client = connect();
  createStarted(client, kReporter);

  ChildProcess second({programBeside("ostrelreportingd")}, service / "second.txt",
                      service.environment());
  EXPECT_EQ(second.wait(), 1);

  EXPECT_THAT(service.read("second.txt"), HasSubstr("ostrelreportingd: "));
  EXPECT_THAT(service.read("second.txt"), HasSubstr(service.socketPath()));
  send(client, "still there", ReporterIDs{kReporter});
  EXPECT_THAT(client.takeReplies(), ElementsAre("send no error"));
  RecordingClient later = connect();
  later->getAllReporters(later.reporterIDs("all"));
  EXPECT_THAT(later.takeReplies(), ElementsAre("all 7"));
}

TEST_F(Protocol, HasAMessageInTheStoreAQuarterSecondAfterItDespiteAKill) {
  RecordingClient client = connect();
  createStarted(client, kReporter);

  send(client, "durable", ReporterIDs{kReporter});
  EXPECT_THAT(client.takeReplies(), ElementsAre("send no error"));
  std::this_thread::sleep_for(300ms);
  service.kill();

  EXPECT_THAT(service.rows("SELECT payload FROM telemetry_messages WHERE category = 7"),
              ElementsAre("{\"text\":\"durable\"}"));
}

TEST_F(Protocol, HasAStoppedSessionInTheStoreAtOnceDespiteAKill) {
  RecordingClient client = connect();
  createStarted(client, kReporter);
  client->stopReportingSessionForID(kReporter, client.boolean("stop"));

  ASSERT_TRUE(service.waitForRows(
      "SELECT id FROM telemetry_sessions WHERE flushed_at IS NOT NULL", 1));
  service.kill();
  service.start();
  RecordingClient again = connect();
  again.takeReplies();

  EXPECT_THAT(service.rows("SELECT category, payload FROM telemetry_messages "
                           "WHERE category = 65535"),
              ElementsAre("65535|{\"Ostrel_Session_Summary_Event\":\"65535\","
                          "\"Undefined_Generic_1\":\"{is: started}\"}"));
}

TEST(ProtocolOfAnActivatedService, IsServedOnTheSocketThatIsHandedOver) {
  ServiceUnderTest service;
  const std::string socket = service / "activated.sock";
  std::vector<std::string> command{"systemd-socket-activate", "--listen=" + socket};
  for (const std::string& variable : service.environment()) {
    if (variable.find('=') != std::string::npos) command.push_back("-E" + variable);
  }
  command.push_back(programBeside("ostrelreportingd"));
  ChildProcess activated(command, service / "log.txt", service.environment());

  {
    RecordingClient client(socket);
    client->createReportingSession(kReporter, client.boolean("create"));
    client->sendMessage({{"a", 1}}, kRouteChange, kStart, std::nullopt,
                        client.error("send"));
    EXPECT_THAT(client.takeReplies(), ElementsAre("create true", "send no error"));
    EXPECT_FALSE(std::filesystem::exists(service.socketPath()));
  }

  ::kill(activated.pid(), SIGTERM);
  EXPECT_EQ(activated.wait(), 0) << service.read("log.txt");
  EXPECT_TRUE(std::filesystem::exists(socket)) << "The socket is not the service's own.";
  EXPECT_THAT(service.rows(kMessages), ElementsAre("NULL|7|1|{\"a\":1}"));
}

}  // namespace
}  // namespace ostrel
