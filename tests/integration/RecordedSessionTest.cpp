// A telephony session from its start to its stop on an internal build: messages from a
// client, counters that another process publishes, and a device that is turned; then
// everything that it leaves behind.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <regex>
#include <stdexcept>

#include "platform/linux/TestSockets.h"
#include "tests/integration/ServiceUnderTest.h"

namespace ostrel {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::MatchesRegex;
using testing_support::ChildProcess;

constexpr ReporterID kReporter{7};
constexpr MessageCategory kRouteChange{0x40000007};
constexpr MessageCategory kSessionGeneric{0x08000001};
constexpr MessageType kGeneric{0};
constexpr MessageType kStart{1};
constexpr ServiceType kTelephony{2};

/// The sensor service of a device that can be turned, on a bus of its own.
class TurnableDevice {
 public:
  /// The bus is where the service under test looks for the system's. Throws when the
  /// sensors do not come up.
  explicit TurnableDevice(const ServiceUnderTest& service)
      : service_(service), address_("unix:path=" + service / "bus") {
    service.write("bus.conf",
                  "<busconfig><type>system</type><listen>" + address_ +
                      "</listen><policy context=\"default\"><allow user=\"*\"/>"
                      "<allow own=\"*\"/><allow send_destination=\"*\"/>"
                      "<allow receive_sender=\"*\"/></policy></busconfig>");
    bus_ = std::make_unique<ChildProcess>(std::vector<std::string>{
        "dbus-daemon", "--config-file=" + service / "bus.conf", "--nofork"});
    EXPECT_TRUE(
        eventually([&] { return testing_support::isListenedTo(service / "bus"); }));
    sensors_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{
            "/usr/bin/python3", "-m", "dbusmock", "--template", "iio-sensors-proxy",
            "--parameters",
            R"({"has_accelerometer": true, "accelerometer_orientation": "normal"})"},
        service / "sensors.txt", service.environment());
    const auto isThere = [this] {
      return call({"GetInternalProperty", "s", "AccelerometerOrientation"}) == 0;
    };
    if (!eventually(isThere)) {
      throw std::runtime_error("no sensors: " + service.read("sensors.txt"));
    }
  }

  /// Whether the service knows how the device is held: no turn before that is one.
  bool isRead() const {
    return service_.read("sensors.txt")
               .find(
                   "Get /net/hadess/SensorProxy "
                   "net.hadess.SensorProxy.AccelerometerOrientation") !=
           std::string::npos;
  }
  void turn(const std::string& orientation) {
    EXPECT_EQ(call({"SetInternalProperty", "ssv", "net.hadess.SensorProxy",
                    "AccelerometerOrientation", "s", orientation}),
              0);
  }

 private:
  int call(const std::vector<std::string>& arguments) {
    std::vector<std::string> command{"busctl",
                                     "--address=" + address_,
                                     "call",
                                     "net.hadess.SensorProxy",
                                     "/net/hadess/SensorProxy",
                                     "org.freedesktop.DBus.Mock"};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return ChildProcess(std::move(command)).wait();
  }

  const ServiceUnderTest& service_;
  const std::string address_;
  std::unique_ptr<ChildProcess> bus_;
  std::unique_ptr<ChildProcess> sensors_;
};

/// Starts the service as a careful administrator's shell would.
void startWithNarrowUmask(ServiceUnderTest& service) {
  const mode_t before = ::umask(077);
  service.start();
  ::umask(before);
}

std::vector<std::filesystem::path> sessionLogs(const ServiceUnderTest& service) {
  std::vector<std::filesystem::path> found;
  if (!std::filesystem::exists(service / "logs/Audio/Reporting")) return found;
  for (const auto& entry :
       std::filesystem::directory_iterator(service / "logs/Audio/Reporting")) {
    found.push_back(entry.path());
  }
  return found;
}

/// The session is recorded once; each test looks at one thing that it left.
class RecordedSession : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    service_ = new ServiceUnderTest;
    record();
  }
  static void TearDownTestSuite() {
    delete service_;
    service_ = nullptr;
  }

  static void publish(const std::string& group, const std::string& subgroup,
                      std::vector<std::string> counters) {
    std::vector<std::string> arguments{"channels", "publish",    "--group",
                                       group,      "--subgroup", subgroup};
    arguments.insert(arguments.end(), counters.begin(), counters.end());
    EXPECT_EQ(service_->ostrelctl(std::move(arguments)), 0);
  }

  static void turn(TurnableDevice& device, const std::string& orientation) {
    device.turn(orientation);
    EXPECT_TRUE(eventually([&] {
      return service_->read("log.txt").find("mode=device orientation=\"" + orientation +
                                            "\" app=\"com.example.dialer\"") !=
             std::string::npos;
    })) << service_->read("log.txt");
  }

  static void record() {
    ServiceUnderTest& service = *service_;
    service.write("machine-info", "DEPLOYMENT=development\nCHASSIS=handset\n");
    TurnableDevice device(service);
    // The service subscribes to what there is when it starts.
    publish("Speaker", "Amplifier", {"underruns=10", "frames=1000", "resets=4"});
    publish("Haptics", "Stats", {"strokes=-5"});
    publish("Camera", "Stats", {"shots=1"});
    ::setenv("reporting_rtc_verbose", "5", /*replace=*/1);
    startWithNarrowUmask(service);
    ::unsetenv("reporting_rtc_verbose");

    RecordingClient client(service.socketPath());
    client->createReportingSession(kReporter, client.boolean("create"));
    client->setServiceType(kTelephony, kReporter, client.boolean("set type"));
    client->setConfiguration(
        {{{"HostApplicationDisplayID", "com.example.dialer"}, {"codec name", "EVS"}}},
        kReporter, client.boolean("configure"));
    client->startReportingSessionForID(kReporter, client.boolean("start"));
    EXPECT_TRUE(eventually([&] { return device.isRead(); }));

    client->sendMessage({{"route", "Speaker"}, {"gain db", -3.5}}, kRouteChange, kStart,
                        {{kReporter}}, client.error("send"));
    client->sendMessage({{"EngineOnTime", 1.5}, {"ostrelreporting_timestamp", 1000}},
                        kSessionGeneric, kGeneric, {{kReporter}}, client.error("send"));
    EXPECT_TRUE(service.waitForRows("SELECT id FROM telemetry_messages", 2));
    turn(device, "left-up");
    client->sendMessage({{"routes", ArrayBuilder().append("A").append(2).build()},
                         {"HostApplicationDisplayID", "the client's own"}},
                        kRouteChange, kStart, {{kReporter}}, client.error("send"));
    EXPECT_TRUE(service.waitForRows("SELECT id FROM telemetry_messages", 3));
    turn(device, "normal");

    publish("Speaker", "Amplifier", {"underruns=13", "frames=1000", "resets=1"});
    publish("Haptics", "Stats", {"strokes=4"});
    publish("Camera", "Stats", {"shots=50"});
    client->stopReportingSessionForID(kReporter, client.boolean("stop"));
    client.wait(8);
    EXPECT_THAT(client.takeReplies(),
                testing::UnorderedElementsAre(
                    "create true", "set type true", "configure true", "send no error",
                    "send no error", "send no error", "stop true", "start true"));
    // Not recorded any more.
    device.turn("right-up");
    EXPECT_EQ(service.terminate(), 0);
  }

  /// Turns what differs from one recording to the next into a letter.
  static std::string withoutTimes(const std::string& text) {
    return std::regex_replace(text, std::regex("[0-9]+\\.[0-9]{3,}(e-?[0-9]+)?"), "T");
  }

  static ServiceUnderTest* service_;
};

ServiceUnderTest* RecordedSession::service_ = nullptr;

TEST_F(RecordedSession, LeavesALogNamedByTimeApplicationAndServiceType) {
  const auto logs = sessionLogs(*service_);

  ASSERT_EQ(logs.size(), 1u);
  EXPECT_THAT(logs[0].filename().string(),
              MatchesRegex("[0-9]{8}-[0-9]{6}[+-][0-9]{4}-ostrel-com\\.example\\.dialer-"
                           "telephony\\.json"));
}

TEST_F(RecordedSession, LeavesALogOfItsUserInfoMessagesAndTurns) {
  const auto logs = sessionLogs(*service_);
  ASSERT_EQ(logs.size(), 1u);

  const std::string text =
      service_->read("logs/Audio/Reporting/" + logs[0].filename().string());

  EXPECT_EQ(withoutTimes(text), R"([
  {
    "HostApplicationDisplayID": "com.example.dialer",
    "codec name": "EVS"
  },
  {
    "Routing_RouteChange_Start_1": {
      "route": "Speaker",
      "gain_db": -3.5
    }
  },
  {
    "Session_Generic_Generic_1": {
      "EngineOnTime": 1.5,
      "ostrelreporting_timestamp": 1000
    }
  },
  {
    "device_orientation": "left-up",
    "device_orientation_time": T
  },
  {
    "Routing_RouteChange_Start_2": {
      "routes": [
        "A",
        2
      ],
      "HostApplicationDisplayID": "the client's own"
    }
  },
  {
    "device_orientation": "normal",
    "device_orientation_time": T
  },
  {
    "Chanreporting_Generic_1": {
      "underruns": 3,
      "strokes": 9
    }
  }
])");
}

TEST_F(RecordedSession, LeavesItsLogWhereEverybodyMayWrite) {
  struct stat status = {};
  const std::string directory = *service_ / "logs/Audio/Reporting";

  ASSERT_EQ(::stat(directory.c_str(), &status), 0);

  EXPECT_EQ(status.st_mode & 07777u, 0777u);
}

TEST_F(RecordedSession, TimesTheTurnsFromItsStart) {
  const auto rows = service_->rows(
      "SELECT json_extract(payload, '$.device_orientation_time') FROM "
      "telemetry_messages WHERE category = 65535");
  ASSERT_EQ(rows.size(), 1u);
  const auto comma = rows[0].find(',');
  ASSERT_NE(comma, std::string::npos);

  const double first = std::stod(rows[0].substr(0, comma));
  const double second = std::stod(rows[0].substr(comma + 1));

  EXPECT_GT(first, 0);
  EXPECT_LT(first, second);
  EXPECT_LT(second, 120);
}

TEST_F(RecordedSession, IsASessionInTheStore) {
  const auto rows = service_->rows(
      "SELECT reporter_id, user_info, started_at <= flushed_at, flushed_at <= ended_at, "
      "json_extract(session_info, '$.kTelvarSessionInfoHierarchyToken') = "
      "hierarchy_token, json_remove(session_info, '$.kTelvarSessionInfoHierarchyToken') "
      "FROM telemetry_sessions");

  EXPECT_THAT(rows, ElementsAre("7|{\"kTelvarUserInfoClientName\":\"com.orbisk.ostrel\","
                                "\"kTelvarUserInfoServiceName\":\"telephony_session\","
                                "\"HostApplicationDisplayID\":\"com.example.dialer\","
                                "\"codec name\":\"EVS\"}|1|1|1|"
                                "{\"kTelvarSessionInfoClientType\":19,"
                                "\"kTelvarSessionInfoClientVersion\":1.0,"
                                "\"kTelvarSessionInfoSessionID\":7,"
                                "\"kTelvarSessionInfoBatchEvent\":true}"));
}

TEST_F(RecordedSession, IsATraceOfItsOwn) {
  EXPECT_THAT(service_->rows("SELECT hierarchy_token FROM telemetry_sessions"),
              ElementsAre(MatchesRegex("00-[0-9a-f]{32}-[0-9a-f]{16}-[0-9a-f]{2}")));
}

TEST_F(RecordedSession, HasItsMessagesCountersAndSummaryInTheStore) {
  auto rows = service_->rows(
      "SELECT telemetry_session_id = (SELECT id FROM telemetry_sessions), session_info, "
      "user_info, category, type, payload FROM telemetry_messages ORDER BY id");
  for (std::string& row : rows) row = withoutTimes(row);

  EXPECT_THAT(
      rows,
      ElementsAre(
          R"(1|NULL|NULL|7|1|{"route":"Speaker","gain_db":-3.5})",
          R"(1|NULL|NULL|1|0|{"EngineOnTime":1.5,"ostrelreporting_timestamp":1000})",
          R"(1|NULL|NULL|7|1|{"routes":["A",2],)"
          R"("HostApplicationDisplayID":"the client's own"})",
          R"(1|NULL|NULL|9|0|{"underruns":3,"strokes":9})",
          R"(1|NULL|NULL|65535|65535|{"Ostrel_Session_Summary_Event":"2",)"
          R"("Routing_RouteChange_Start_1":"{route: Speaker, gain_db: -3.5}",)"
          R"("Session_Generic_Generic_1":)"
          R"("{EngineOnTime: 1.5, ostrelreporting_timestamp: 1000}",)"
          R"("device_orientation":"left-up,normal",)"
          R"("device_orientation_time":"T,T",)"
          R"("Routing_RouteChange_Start_2":)"
          R"("{routes: [A, 2], HostApplicationDisplayID: the client's own}",)"
          R"("Chanreporting_Generic_1":"{underruns: 3, strokes: 9}"})"));
}

TEST_F(RecordedSession, IsMirroredToAnalyticsAsItWasReceived) {
  auto rows = service_->rows(
      "SELECT name, CASE WHEN name LIKE '%.Undefined.Unknown' THEN json_extract(payload, "
      "'$.HostApplicationDisplayID', '$.Ostrel_Session_Summary_Event') ELSE payload END "
      "FROM analytics_events WHERE name NOT LIKE '%uptime' ORDER BY id");

  EXPECT_THAT(
      rows,
      ElementsAre(
          "com.orbisk.ostrel.Routing_RouteChange.Start|"
          R"({"route":"Speaker","gain db":-3.5,)"
          R"("HostApplicationDisplayID":"com.example.dialer"})",
          "com.orbisk.ostrel.Session_Generic.Generic|"
          R"({"EngineOnTime":1.5,"ostrelreporting_timestamp":1000,)"
          R"("HostApplicationDisplayID":"com.example.dialer"})",
          "com.orbisk.ostrel.Routing_RouteChange.Start|"
          R"({"routes":["A",2],"HostApplicationDisplayID":"com.example.dialer"})",
          "com.orbisk.ostrel.Chanreporting.Generic|"
          R"({"underruns":3,"strokes":9,"HostApplicationDisplayID":"com.example.dialer"})",
          R"(com.orbisk.ostrel.Undefined.Unknown|["com.example.dialer","2"])"));
}

TEST_F(RecordedSession, MirrorsTheRunningTimeOfTheEngineToThePowerLog) {
  EXPECT_THAT(service_->rows("SELECT client_id, name, event FROM power_events"),
              ElementsAre(R"(28|Mediora_Haptics|{"EngineOnDuration":1.5,)"
                          R"("ApplicationName":"com.example.dialer",)"
                          R"("TimestampEnd":1000})"));
}

TEST_F(RecordedSession, IsItsClientsUsersInTheStore) {
  EXPECT_THAT(service_->rows("SELECT kind, user, sum(last_id - first_id + 1) FROM "
                             "row_owners WHERE user != -1 GROUP BY kind, user"),
              ElementsAre("0|" + std::to_string(::geteuid()) + "|5",
                          "1|" + std::to_string(::geteuid()) + "|5",
                          "2|" + std::to_string(::geteuid()) + "|1",
                          "3|" + std::to_string(::geteuid()) + "|1"));
}

/// A short session, on a build and with a host application of the test's choice.
class ShortSession : public testing::Test {
 protected:
  void record(const std::string& machineInfo, Dictionary configuration) {
    service.write("machine-info", machineInfo);
    startWithNarrowUmask(service);
    RecordingClient client(service.socketPath());
    client->createReportingSession(kReporter, /*reply=*/{});
    client->setServiceType(kTelephony, kReporter, /*reply=*/{});
    client->setConfiguration(std::move(configuration), kReporter, /*reply=*/{});
    client->startReportingSessionForID(kReporter, client.boolean("start"));
    client->sendMessage({{"a", 1}}, kRouteChange, kStart, {{kReporter}}, /*reply=*/{});
    client->stopReportingSessionForID(kReporter, client.boolean("stop"));
    EXPECT_EQ(client.wait(2).size(), 2u);
    client->close();
    EXPECT_EQ(service.terminate(), 0);
    EXPECT_THAT(service.rows("SELECT payload FROM telemetry_messages WHERE category = "
                             "65535"),
                ElementsAre(R"({"Ostrel_Session_Summary_Event":"2",)"
                            R"("Routing_RouteChange_Start_1":"{a: 1}"})"));
  }

  ServiceUnderTest service;
};

constexpr const char* kInternal = "DEPLOYMENT=development\nCHASSIS=watch\n";

TEST_F(ShortSession, LeavesNoLogOnABuildThatIsNotInternal) {
  record("DEPLOYMENT=production\nCHASSIS=handset\n", Dictionary());

  EXPECT_THAT(sessionLogs(service), IsEmpty());
}

TEST_F(ShortSession, LeavesALogWithTheNullTextWithoutAHostApplication) {
  record(kInternal, Dictionary());

  const auto logs = sessionLogs(service);
  ASSERT_EQ(logs.size(), 1u);
  EXPECT_THAT(logs[0].filename().string(), HasSubstr("-ostrel-(null)-telephony.json"));
  EXPECT_EQ(service.read("logs/Audio/Reporting/" + logs[0].filename().string()), R"([
  {},
  {
    "Routing_RouteChange_Start_1": {
      "a": 1
    }
  }
])");
}

TEST_F(ShortSession, LeavesNothingOutsideTheLogDirectory) {
  std::filesystem::create_directory(service / "logs");
  std::filesystem::create_directory(service / "elsewhere");

  record(kInternal, {{"HostApplicationDisplayID", "/../../../../elsewhere/x"}});

  EXPECT_THAT(sessionLogs(service), IsEmpty());
  EXPECT_TRUE(std::filesystem::is_empty(service / "elsewhere"));
  EXPECT_THAT(service.read("log.txt"), HasSubstr("jsonOutput writeToURL: "));
}

}  // namespace
}  // namespace ostrel
