#include "ostrelctl/Tool.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <fstream>
#include <sstream>

#include "ostrelctl/FakeServiceConnection.h"
#include "ostrelctl/ManualToolClock.h"
#include "ostrelctl/TestStore.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;
using namespace std::chrono_literals;

class ToolTest : public ::testing::Test {
 protected:
  int run(std::vector<std::string> arguments) {
    std::vector<const char*> argv = {"ostrelctl"};
    for (const std::string& argument : arguments) argv.push_back(argument.c_str());
    return runTool(tool_, static_cast<int>(argv.size()), argv.data());
  }
  std::string takeOutput() {
    const std::string text = out_.str();
    out_.str("");
    return text;
  }
  std::string fileText(const std::string& path) {
    std::ifstream file(path);
    std::ostringstream text;
    text << file.rdbuf();
    return text.str();
  }

  const testing_support::TemporaryDirectory directory_;
  std::istringstream in_;
  std::ostringstream out_;
  std::ostringstream err_;
  ManualToolClock clock_;
  std::shared_ptr<FakeServiceConnection> service_ =
      std::make_shared<FakeServiceConnection>();
  bool serviceIsThere_ = true;
  Tool tool_{in_,
             out_,
             err_,
             clock_,
             [this]() -> Outcome<std::shared_ptr<ServiceConnection>> {
               if (serviceIsThere_) return {service_, {}};
               return {{}, ErrorObject{"test", 1, "no service at /run/test.sock"}};
             },
             "/run/test.sock",
             directory_ / "state/reports.db",
             directory_ / "state/defaults/suite.json",
             directory_ / "run/notify/name",
             directory_ / "run/channels",
             /*colours=*/false};
};

TEST_F(ToolTest, PrintsHelpForEveryCommand) {
  const std::vector<std::vector<std::string>> commands = {{},
                                                          {"script"},
                                                          {"status"},
                                                          {"send"},
                                                          {"sessions"},
                                                          {"show"},
                                                          {"tail"},
                                                          {"query"},
                                                          {"defaults"},
                                                          {"notify"},
                                                          {"defaults", "read"},
                                                          {"defaults", "write"},
                                                          {"defaults", "delete"},
                                                          {"channels"},
                                                          {"channels", "list"},
                                                          {"channels", "publish"}};
  for (auto command : commands) {
    command.push_back("--help");
    EXPECT_EQ(run(command), 0) << ::testing::PrintToString(command);
    EXPECT_THAT(takeOutput(), HasSubstr("--help"));
  }
}

TEST_F(ToolTest, EndsWithStatusTwoOnWrongUsage) {
  EXPECT_EQ(run({}), 2);
  EXPECT_EQ(run({"dance"}), 2);
  EXPECT_EQ(run({"show"}), 2);
  EXPECT_EQ(run({"status", "--loud"}), 2);
  EXPECT_EQ(run({"query"}), 2);
  EXPECT_EQ(run({"defaults"}), 2);
  EXPECT_EQ(run({"defaults", "write", "key"}), 2);
  EXPECT_EQ(run({"send", "--type", "1"}), 2);
  EXPECT_EQ(run({"sessions", "-n", "many"}), 2);
  EXPECT_EQ(out_.str(), "");
  EXPECT_NE(err_.str(), "");
}

TEST_F(ToolTest, SaysWhichCommandThereIsNot) {
  EXPECT_EQ(run({"dance", "--json"}), 2);
  EXPECT_THAT(err_.str(), HasSubstr("there is no command \"dance\"; see"));
  EXPECT_EQ(run({"channels", "close"}), 2);
  EXPECT_THAT(err_.str(), HasSubstr("there is no command \"close\"; see"));
}

TEST_F(ToolTest, PrintsItsVersion) {
  EXPECT_EQ(run({"--version"}), 0);
  EXPECT_THAT(out_.str(), ::testing::StartsWith("ostrelctl "));
}

// script

TEST_F(ToolTest, PlaysAScriptFromItsInput) {
  in_.str("{\"op\":\"killService\"}\n");
  EXPECT_EQ(run({"script"}), 0);
  EXPECT_THAT(out_.str(), HasSubstr("\"noReply\":true"));
}

TEST_F(ToolTest, PlaysAScriptFromAFile) {
  std::ofstream(directory_ / "a.jsonl") << "{\"op\":\"killService\"}\n{]\n";
  EXPECT_EQ(run({"script", directory_ / "a.jsonl"}), 2);
  EXPECT_THAT(err_.str(), HasSubstr("line 2"));
}

TEST_F(ToolTest, FailsWhenTheScriptCannotBeRead) {
  EXPECT_EQ(run({"script", directory_ / "missing.jsonl"}), 1);
  EXPECT_THAT(err_.str(), HasSubstr("missing.jsonl"));
}

// status

TEST_F(ToolTest, ShowsTheSessionsAndTheirTypes) {
  service_->onRequest = [this] {
    if (service_->reporterIDsReplies.size() == 1 &&
        service_->serviceTypeReplies.empty()) {
      service_->reporterIDsReplies[0]({ReporterID{42}, ReporterID{-7}});
    } else if (!service_->serviceTypeReplies.empty()) {
      service_->serviceTypeReplies.back()(ServiceType{2});
    }
  };
  EXPECT_EQ(run({"status"}), 0);
  const std::string page = takeOutput();
  EXPECT_THAT(page, HasSubstr("/run/test.sock"));
  EXPECT_THAT(page, HasSubstr("42        telephony (2)"));
  EXPECT_THAT(page, HasSubstr("-7        telephony (2)"));
  EXPECT_EQ(service_->calls.back(), "close");
}

TEST_F(ToolTest, TakesTheSecondReplyForIDZeroAsNoOtherSessionsReply) {
  service_->onRequest = [this] {
    if (service_->serviceTypeReplies.empty()) {
      service_->reporterIDsReplies[0]({ReporterID{0}, ReporterID{7}});
    } else if (service_->serviceTypeReplies.size() == 2) {
      service_->serviceTypeReplies[0](ServiceType{65535});
      service_->serviceTypeReplies[0](ServiceType{65535});
      service_->serviceTypeReplies[1](ServiceType{2});
    }
  };
  EXPECT_EQ(run({"status"}), 0);
  EXPECT_THAT(takeOutput(), HasSubstr("7         telephony (2)"));
}

TEST_F(ToolTest, WritesTheStatusAsJSON) {
  service_->onRequest = [this] { service_->reporterIDsReplies.at(0)({}); };
  EXPECT_EQ(run({"status", "--json"}), 0);
  EXPECT_EQ(out_.str(),
            "{\"running\":true,\"socket\":\"/run/test.sock\",\"sessions\":[],"
            "\"counters\":{}}\n");
}

TEST_F(ToolTest, FailsWithoutAService) {
  serviceIsThere_ = false;
  EXPECT_EQ(run({"status"}), 1);
  EXPECT_EQ(run({"send", "--category", "1", "--type", "0"}), 1);
  EXPECT_EQ(err_.str(),
            "ostrelctl: no service at /run/test.sock\n"
            "ostrelctl: no service at /run/test.sock\n");
}

TEST_F(ToolTest, FailsWhenTheServiceDoesNotAnswer) {
  EXPECT_EQ(run({"status"}), 1);
  EXPECT_EQ(err_.str(), "ostrelctl: the service does not answer\n");
  EXPECT_EQ(clock_.fullWaits, (std::vector<std::chrono::nanoseconds>{5s}));
}

TEST_F(ToolTest, FailsWhenTheServiceGoesAway) {
  clock_.meanwhile = [this] { service_->closedHandler("it ended"); };
  EXPECT_EQ(run({"status"}), 1);
  EXPECT_EQ(err_.str(), "ostrelctl: the service closed the connection: it ended\n");
}

// send

TEST_F(ToolTest, SendsOneMessage) {
  service_->onRequest = [this] { service_->errorReplies.at(0)(std::nullopt); };
  EXPECT_EQ(run({"send", "--category", "0x40000007", "--type", "1", "--reporter", "5",
                 "--reporter", "-6", "route=speaker", "volume=0.5", "list=[1,\"a\"]"}),
            0);
  EXPECT_EQ(
      service_->calls.at(0),
      "sendMessage {route: speaker, volume: 0.5, list: [1, a]} 1073741831 1 [5,-6,]");
  EXPECT_EQ(out_.str(), "The service accepted the message.\n");
}

TEST_F(ToolTest, SendsAPayloadOfJSONWithoutAList) {
  service_->onRequest = [this] { service_->errorReplies.at(0)(std::nullopt); };
  EXPECT_EQ(run({"send", "--category", "1", "--type", "0", "--json", "--payload",
                 "{\"a\":{\"$date\":\"2026-01-31T12:00:00Z\"}}", "b=1"}),
            0);
  EXPECT_EQ(service_->calls.at(0), "sendMessage {a: 2026-01-31T12:00:00.000Z, b: 1} 1 0");
  EXPECT_EQ(out_.str(), "{\"accepted\":true}\n");
}

TEST_F(ToolTest, SaysThatTheMessageWasRefused) {
  service_->onRequest = [this] {
    service_->errorReplies.at(0)(ErrorObject{"domain", 1, "reporting is off"});
  };
  EXPECT_EQ(run({"send", "--category", "1", "--type", "0"}), 1);
  EXPECT_EQ(err_.str(),
            "ostrelctl: the service refused the message: reporting is off (domain 1)\n");
}

TEST_F(ToolTest, RefusesMessagesThatAreNone) {
  const auto send = [this](std::vector<std::string> rest) {
    std::vector<std::string> arguments = {"send", "--type", "1", "--category"};
    arguments.insert(arguments.end(), rest.begin(), rest.end());
    return run(arguments);
  };
  EXPECT_EQ(send({"0x100000000"}), 2);
  EXPECT_EQ(send({"1", "novalue"}), 2);
  EXPECT_EQ(send({"1", "a=1", "a=2"}), 2);
  EXPECT_EQ(send({"1", "a=null"}), 2);
  EXPECT_EQ(send({"1", "--payload", "[]"}), 2);
  EXPECT_EQ(send({"1", "--payload", "{"}), 2);
  EXPECT_EQ(run({"send", "--type", "65536", "--category", "1"}), 2);
  EXPECT_TRUE(service_->calls.empty());
}

// defaults, notify

TEST_F(ToolTest, ReadsBackADefaultThatItWrote) {
  EXPECT_EQ(run({"defaults", "write", "device_name", "left speaker"}), 0);
  EXPECT_EQ(run({"defaults", "write", "disable_reporting", "true"}), 0);
  EXPECT_EQ(run({"defaults", "write", "big", "18446744073709551615"}), 0);
  EXPECT_EQ(run({"defaults", "write", "small", "-5"}), 0);
  EXPECT_EQ(fileText(directory_ / "state/defaults/suite.json"),
            "{\n  \"device_name\": \"left speaker\",\n  \"disable_reporting\": true,\n"
            "  \"big\": 18446744073709551615,\n  \"small\": -5\n}\n");
  EXPECT_EQ(run({"defaults", "read", "device_name"}), 0);
  EXPECT_EQ(takeOutput(), "left speaker\n");
  EXPECT_EQ(run({"defaults", "read", "device_name", "--json"}), 0);
  EXPECT_EQ(takeOutput(), "\"left speaker\"\n");
  EXPECT_EQ(run({"defaults", "read", "disable_reporting"}), 0);
  EXPECT_EQ(takeOutput(), "true\n");
}

TEST_F(ToolTest, ReplacesADefaultInItsPlace) {
  run({"defaults", "write", "a", "1"});
  run({"defaults", "write", "b", "2"});
  run({"defaults", "write", "a", "{\"x\":[]}"});
  EXPECT_EQ(run({"defaults", "read", "--json"}), 0);
  EXPECT_EQ(out_.str(), "{\"a\":{\"x\":[]},\"b\":2}\n");
}

TEST_F(ToolTest, DeletesADefault) {
  run({"defaults", "write", "a", "1"});
  EXPECT_EQ(run({"defaults", "delete", "a"}), 0);
  EXPECT_EQ(run({"defaults", "read", "a"}), 1);
  EXPECT_EQ(run({"defaults", "delete", "a"}), 1);
  EXPECT_EQ(
      err_.str(),
      "ostrelctl: there is no default \"a\"\nostrelctl: there is no default \"a\"\n");
}

TEST_F(ToolTest, ReadsAnEmptySuiteWhereThereIsNoFile) {
  EXPECT_EQ(run({"defaults", "read"}), 0);
  EXPECT_EQ(out_.str(), "{}\n");
}

TEST_F(ToolTest, LeavesASuiteAloneThatItCannotRead) {
  std::filesystem::create_directories(directory_ / "state/defaults");
  std::ofstream(directory_ / "state/defaults/suite.json") << "[1]";
  EXPECT_EQ(run({"defaults", "write", "a", "1"}), 1);
  EXPECT_EQ(fileText(directory_ / "state/defaults/suite.json"), "[1]");
  EXPECT_THAT(err_.str(), HasSubstr("not a JSON object"));
}

TEST_F(ToolTest, KeepsTheModeOfTheSuiteAndLeavesNoOtherFile) {
  run({"defaults", "write", "a", "1"});
  const std::string path = directory_ / "state/defaults/suite.json";
  std::filesystem::permissions(path, std::filesystem::perms{0640});
  run({"defaults", "write", "a", "2"});
  EXPECT_EQ(std::filesystem::status(path).permissions(), std::filesystem::perms{0640});
  int files = 0;
  for (const auto& entry :
       std::filesystem::directory_iterator(directory_ / "state/defaults")) {
    (void)entry;
    ++files;
  }
  EXPECT_EQ(files, 1);
}

TEST_F(ToolTest, MakesWhatTheServiceCanReadWhateverTheUmask) {
  const mode_t old = ::umask(0077);
  EXPECT_EQ(run({"defaults", "write", "a", "1"}), 0);
  ::umask(old);
  const auto modeOf = [this](const std::string& name) {
    return std::filesystem::status(directory_ / name).permissions();
  };
  EXPECT_EQ(modeOf("state/defaults"), std::filesystem::perms{0755});
  EXPECT_EQ(modeOf("state/defaults/suite.json"), std::filesystem::perms{0644});
}

TEST_F(ToolTest, RefusesNullAsADefault) {
  EXPECT_EQ(run({"defaults", "write", "a", "null"}), 2);
}

TEST_F(ToolTest, PostsTheNotification) {
  EXPECT_EQ(run({"notify"}), 0);
  EXPECT_TRUE(std::filesystem::exists(directory_ / "run/notify/name"));
  EXPECT_EQ(run({"notify"}), 0);
}

TEST_F(ToolTest, FailsWhenTheNotificationCannotBePosted) {
  std::ofstream(directory_ / "run") << "a file";
  EXPECT_EQ(run({"notify"}), 1);
  EXPECT_THAT(err_.str(), HasSubstr("cannot be made"));
}

// channels

TEST_F(ToolTest, ListsCountersThatItPublished) {
  EXPECT_EQ(run({"channels", "publish", "--group", "Speaker", "underruns=5", "low=-7"}),
            0);
  EXPECT_EQ(run({"channels", "list"}), 0);
  EXPECT_EQ(takeOutput(), "Speaker -\n  underruns 5\n  low -7\n");
  EXPECT_EQ(run({"channels", "list", "--group", "Haptics", "--json"}), 0);
  EXPECT_EQ(takeOutput(), "[]\n");
  EXPECT_EQ(run({"channels", "publish"}), 2);
}

// The store

class ToolStoreTest : public ToolTest {
 protected:
  ToolStoreTest() {
    ::setenv("TZ", "UTC", /*overwrite=*/1);
    std::filesystem::create_directories(directory_ / "state");
    store_ = std::make_unique<TestStore>(tool_.storePath);
  }
  void addSession() {
    store_->run(
        "INSERT INTO telemetry_sessions VALUES (1, 42, '00-ab', '{\"k\":19}',"
        " '{\"kTelvarUserInfoServiceName\":\"telephony_session\"}',"
        " 1000000, 3000000, 3500000)");
  }

  std::unique_ptr<TestStore> store_;
};

TEST_F(ToolStoreTest, ShowsWhatTheServiceCounts) {
  store_->run(
      "CREATE TABLE service_status (key TEXT PRIMARY KEY, value);"
      "INSERT INTO service_status VALUES ('store_id', 'ab'), ('analytics_dropped', 3)");
  service_->onRequest = [this] { service_->reporterIDsReplies.at(0)({}); };
  EXPECT_EQ(run({"status", "--json"}), 0);
  EXPECT_THAT(takeOutput(), HasSubstr("\"counters\":{\"analytics_dropped\":3}"));
  service_->reporterIDsReplies.clear();
  EXPECT_EQ(run({"status"}), 0);
  EXPECT_THAT(takeOutput(), HasSubstr("analytics_dropped  3"));
}

TEST_F(ToolTest, SaysThatNothingWasRecordedWithoutAStore) {
  EXPECT_EQ(run({"sessions"}), 1);
  EXPECT_EQ(run({"show", "1"}), 1);
  EXPECT_EQ(run({"query", "SELECT 1"}), 1);
  EXPECT_THAT(err_.str(), HasSubstr("nothing was recorded yet"));
}

TEST_F(ToolStoreTest, ListsSessions) {
  addSession();
  store_->addMessage(1, 0, "{}");
  store_->run(
      "INSERT INTO telemetry_sessions (id, reporter_id, started_at)"
      " VALUES (2, 43, 4000000)");
  EXPECT_EQ(run({"sessions"}), 0);
  EXPECT_EQ(takeOutput(),
            "SESSION  REPORTER  SERVICE    STARTED                  DURATION  MESSAGES\n"
            "1        42        telephony  1970-01-01 00:00:01.000  2.500 s   1\n"
            "2        43                   1970-01-01 00:00:04.000  running   0\n");
  EXPECT_EQ(run({"sessions", "-n", "1", "--json"}), 0);
  EXPECT_EQ(takeOutput(),
            "[{\"id\":2,\"reporter_id\":43,\"service\":\"\",\"hierarchy_token\":\"\","
            "\"session_info\":null,\"user_info\":null,\"started_at\":4000000,"
            "\"flushed_at\":null,\"ended_at\":null,\"messages\":0}]\n");
}

TEST_F(ToolStoreTest, SaysThatThereIsNoSessionYet) {
  EXPECT_EQ(run({"sessions"}), 0);
  EXPECT_EQ(takeOutput(), "No session was recorded yet.\n");
  EXPECT_EQ(run({"sessions", "--json"}), 0);
  EXPECT_EQ(takeOutput(), "[]\n");
}

TEST_F(ToolStoreTest, ShowsAllOfASession) {
  addSession();
  store_->addMessage(7, 1, "{\"route\":\"speaker\"}");
  store_->addMessage(7, 1, "{\"route\":\"headset\"}");
  store_->addMessage(9, 0, "{\"underruns\":5}");
  store_->addMessage(65535, 65535,
                     "{\"Ostrel_Session_Summary_Event\":\"2\","
                     "\"Routing_RouteChange_Start_1\":\"{route: speaker}\","
                     "\"HAL_RouteChange_Start_1\":\"{route: headset}\","
                     "\"Chanreporting_Generic_1\":\"{underruns: 5}\","
                     "\"device_orientation\":\"left-up,normal\","
                     "\"device_orientation_time\":\"1.5,2.25\"}");
  EXPECT_EQ(run({"show", "1"}), 0);
  EXPECT_EQ(takeOutput(),
            "Session 1\n"
            "  Reporter  42\n"
            "  Service   telephony\n"
            "  Started   1970-01-01 00:00:01.000\n"
            "  Ended     1970-01-01 00:00:03.500\n"
            "  Flushed   1970-01-01 00:00:03.000\n"
            "  Duration  2.500 s\n"
            "  Token     00-ab\n"
            "User info\n"
            "  kTelvarUserInfoServiceName  telephony_session\n"
            "Messages (3)\n"
            "  +1.000 s  Routing_RouteChange_Start_1  {\"route\":\"speaker\"}\n"
            "  +1.000 s  HAL_RouteChange_Start_1      {\"route\":\"headset\"}\n"
            "  +1.000 s  Chanreporting_Generic_1      {\"underruns\":5}\n"
            "Driver statistics\n"
            "  underruns  5\n"
            "Orientation\n"
            "  1.5 s   device  left-up\n"
            "  2.25 s  device  normal\n"
            "Summary\n"
            "  Ostrel_Session_Summary_Event  2\n"
            "  Routing_RouteChange_Start_1   {route: speaker}\n"
            "  HAL_RouteChange_Start_1       {route: headset}\n"
            "  Chanreporting_Generic_1       {underruns: 5}\n"
            "  device_orientation            left-up,normal\n"
            "  device_orientation_time       1.5,2.25\n");
}

TEST_F(ToolStoreTest, WritesASessionAsJSON) {
  addSession();
  store_->addMessage(1, 0, "{\"n\":18446744073709551615}");
  EXPECT_EQ(run({"show", "last", "--json"}), 0);
  EXPECT_EQ(
      takeOutput(),
      "{\"session\":{\"id\":1,\"reporter_id\":42,\"service\":\"telephony\","
      "\"hierarchy_token\":\"00-ab\",\"session_info\":{\"k\":19},"
      "\"user_info\":{\"kTelvarUserInfoServiceName\":\"telephony_session\"},"
      "\"started_at\":1000000,\"flushed_at\":3000000,\"ended_at\":3500000,"
      "\"messages\":1},\"messages\":[{\"id\":1,\"identifier\":\"Generic_Generic_1\","
      "\"telemetry_session_id\":1,\"reporter_id\":42,\"category\":1,\"type\":0,"
      "\"payload\":{\"n\":18446744073709551615},\"created_at\":2000000}],"
      "\"driver_statistics\":[],\"orientation\":[],\"summary\":null}\n");
}

TEST_F(ToolStoreTest, FindsASessionByItsReporterToo) {
  addSession();
  EXPECT_EQ(run({"show", "42"}), 0);
  EXPECT_THAT(takeOutput(), HasSubstr("Session 1\n"));
  EXPECT_EQ(run({"show", "43"}), 1);
  EXPECT_EQ(run({"show", "first"}), 1);
  EXPECT_EQ(err_.str(),
            "ostrelctl: there is no session 43\nostrelctl: there is no session first\n");
}

TEST_F(ToolStoreTest, ShowsControlCharactersOfAPayloadAsText) {
  addSession();
  store_->addMessage(1, 0, "{\"k\":\"\\u001b[31m\u009b\"}");
  store_->addMessage(65535, 65535,
                     "{\"Ostrel_Session_Summary_Event\":\"2\",\"x\":\"\\u001b[31m\"}");
  EXPECT_EQ(run({"show", "1"}), 0);
  const std::string page = takeOutput();
  EXPECT_THAT(page, Not(HasSubstr("\x1b")));
  EXPECT_THAT(page, Not(HasSubstr("\u009b")));
  EXPECT_THAT(page, HasSubstr("\\u001b[31m"));
}

TEST_F(ToolStoreTest, WritesColoursOnlyWhereTheyAreWanted) {
  addSession();
  run({"show", "1"});
  EXPECT_THAT(takeOutput(), Not(HasSubstr("\x1b[1m")));
  tool_.colours = true;
  run({"show", "1"});
  EXPECT_THAT(takeOutput(), HasSubstr("\x1b[1mSession 1\x1b[0m\n"));
}

TEST_F(ToolStoreTest, QueriesTheStore) {
  addSession();
  EXPECT_EQ(run({"query",
                 "SELECT id, reporter_id AS who, NULL AS n, 0.5 AS half,"
                 " x'00ff' AS bytes FROM telemetry_sessions; SELECT 1;"}),
            0);
  EXPECT_EQ(takeOutput(), "id  who  n  half  bytes\n1   42      0.5   00ff\n1\n1\n");
  EXPECT_EQ(run({"query", "--json", "SELECT 1 AS a, 'x' AS a, NULL AS b"}), 0);
  EXPECT_EQ(takeOutput(), "[{\"a\":1,\"a_2\":\"x\",\"b\":null}]\n");
}

TEST_F(ToolStoreTest, RefusesSQLThatWritesAnything) {
  addSession();
  const std::string other = directory_ / "other.db";
  for (const std::string& sql :
       {std::string("DELETE FROM telemetry_sessions"),
        std::string("INSERT INTO telemetry_sessions (id) VALUES (9)"),
        std::string("SELECT 1; DROP TABLE telemetry_messages"),
        std::string("CREATE TEMP TABLE t (a)"), std::string("PRAGMA journal_mode=DELETE"),
        std::string("PRAGMA user_version=7"), std::string("VACUUM"),
        "VACUUM INTO '" + other + "'", "ATTACH '" + other + "' AS o"}) {
    EXPECT_EQ(run({"query", sql}), 1) << sql;
  }
  EXPECT_FALSE(std::filesystem::exists(other));
  takeOutput();
  EXPECT_EQ(run({"query", "--json", "SELECT count(*) AS n FROM telemetry_sessions"}), 0);
  EXPECT_EQ(takeOutput(), "[{\"n\":1}]\n");
}

TEST_F(ToolStoreTest, SaysWhatIsWrongWithSQL) {
  EXPECT_EQ(run({"query", "SELEC 1"}), 1);
  EXPECT_THAT(err_.str(), HasSubstr("syntax error"));
}

TEST_F(ToolStoreTest, ReadsTheStoreOfAStoppedService) {
  addSession();
  store_.reset();
  EXPECT_EQ(run({"show", "1"}), 0);
}

TEST_F(ToolStoreTest, SaysThatAFileIsNoStore) {
  store_.reset();
  std::ofstream(tool_.storePath) << std::string(5000, 'x');
  EXPECT_EQ(run({"sessions"}), 1);
  EXPECT_THAT(err_.str(), HasSubstr("cannot be read"));
}

TEST_F(ToolStoreTest, TailsMessagesAsTheyAreRecorded) {
  addSession();
  store_->addMessage(1, 0, "{\"old\":1}");
  int ticks = 0;
  clock_.meanwhile = [&] {
    if (++ticks == 2) store_->addMessage(7, 1, "{\"new\":1}");
    if (ticks == 4) store_->addMessage(7, 2, "{\"newer\":1}", "NULL");
  };
  EXPECT_EQ(run({"tail", "--count", "2"}), 0);
  EXPECT_EQ(takeOutput(),
            "1970-01-01 00:00:02.000  42  RouteChange_Start  {\"new\":1}\n"
            "1970-01-01 00:00:02.000  -  RouteChange_Stop  {\"newer\":1}\n");
}

TEST_F(ToolStoreTest, BeginsATailWithEarlierMessages) {
  addSession();
  for (int i = 0; i < 4; ++i) store_->addMessage(1, 0, "{}");
  EXPECT_EQ(run({"tail", "--json", "-n", "2", "--count", "2"}), 0);
  EXPECT_EQ(takeOutput(),
            "{\"id\":3,\"telemetry_session_id\":1,\"reporter_id\":42,\"category\":1,"
            "\"type\":0,\"payload\":{},\"created_at\":2000000}\n"
            "{\"id\":4,\"telemetry_session_id\":1,\"reporter_id\":42,\"category\":1,"
            "\"type\":0,\"payload\":{},\"created_at\":2000000}\n");
}

TEST_F(ToolTest, TailWaitsForAStoreToComeIntoBeing) {
  std::filesystem::create_directories(directory_ / "state");
  std::unique_ptr<TestStore> store;
  int ticks = 0;
  clock_.meanwhile = [&] {
    if (++ticks == 1) std::ofstream(tool_.storePath).flush();
    if (ticks == 3) store = std::make_unique<TestStore>(tool_.storePath);
    if (ticks == 5) store->addMessage(1, 0, "{\"first\":1}", "NULL");
  };
  EXPECT_EQ(run({"tail", "--count", "1"}), 0);
  EXPECT_THAT(out_.str(), HasSubstr("{\"first\":1}"));
  EXPECT_THAT(err_.str(), HasSubstr("waiting for a store"));
}

TEST_F(ToolStoreTest, TailGoesOnInAStoreThatTookTheOldOnesPlace) {
  store_->addMessage(1, 0, "{\"old\":1}", "NULL");
  std::unique_ptr<TestStore> replacement;
  clock_.meanwhile = [&] {
    if (replacement) return;
    store_.reset();
    std::filesystem::rename(tool_.storePath, tool_.storePath + ".aside");
    replacement = std::make_unique<TestStore>(tool_.storePath);
    replacement->addMessage(1, 0, "{\"fresh\":1}", "NULL");
  };
  EXPECT_EQ(run({"tail", "--count", "1"}), 0);
  EXPECT_THAT(out_.str(), HasSubstr("{\"fresh\":1}"));
}

}  // namespace
}  // namespace ostrel
