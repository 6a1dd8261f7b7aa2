#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <unordered_set>

#include "Statistics/Service/OstrelReportingServiceMain.h"
#include "Statistics/Service/ServiceTestFixture.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using Events = std::vector<std::string>;

constexpr ProcessID kPid = 1234;
constexpr ProcessID kOwnPid = 4242;
constexpr const char* kUptimeEvent =
    "analytics com.orbisk.ostrel.ostrelreportingclientuptime";

// The entry and the root object.

class OstrelReportingServiceEntry : public CoreTest {};

TEST_F(OstrelReportingServiceEntry, ServesTheListenerAndReturnsItsExitStatus) {
  EXPECT_EQ(OstrelReportingServiceMain(platform, *fakes.listener), 0);

  EXPECT_TRUE(fakes.listener->isResumed());
  EXPECT_EQ(fakes.events->all().back(), "listener.resume");
}

TEST_F(OstrelReportingServiceEntry, MakesTheRootObjectInItsOrder) {
  fakes.log->recordInto(fakes.events);

  const auto root = OstrelReportingServiceDelegate::init(platform);

  const Events events = takeEvents();
  ASSERT_GE(events.size(), 3u);
  EXPECT_EQ(events[0], "notify.registerDispatch com.orbisk.ostrel.reporting");
  EXPECT_EQ(events[1], "log default osrs notify setup result 0");
  EXPECT_EQ(events[2], "log info osrd creating chanreporting driver utility");
}

TEST_F(OstrelReportingServiceEntry, MakesOneSerialQueueOfTheHighestClass) {
  const auto root = OstrelReportingServiceDelegate::init(platform);

  const auto queues = fakes.workQueues->queues();
  ASSERT_EQ(queues.size(), 1u);
  EXPECT_EQ(queues[0]->label(), "com.orbisk.ostrel.reporting.server");
  EXPECT_EQ(queues[0]->qualityOfService(), QualityOfService::kUserInteractive);
  EXPECT_EQ(queues[0]->relativePriority(), 0);
  EXPECT_EQ(serverQueue(), queues[0]);
}

TEST_F(OstrelReportingServiceEntry, ReplacesAnEarlierServerQueue) {
  const auto first = OstrelReportingServiceDelegate::init(platform);
  const auto firstQueue = serverQueue();

  const auto second = OstrelReportingServiceDelegate::init(platform);

  EXPECT_NE(serverQueue(), firstQueue);
}

TEST_F(OstrelReportingServiceEntry, BeginsEnabledWithoutDefaultsAndClients) {
  fakes.userDefaults->setSuite("com.orbisk.ostrel", {{"disable_reporting", true}});

  const auto root = OstrelReportingServiceDelegate::init(platform);

  EXPECT_TRUE(root->reportingEnabled());
  EXPECT_EQ(root->defaults(), std::nullopt);
  EXPECT_NE(root->driverUtility(), nullptr);
  EXPECT_EQ(fakes.events->count("defaults.openSuite com.orbisk.ostrel"), 0u);
}

// Accepting.

class OstrelReportingServiceConnection : public ServiceTest {
 protected:
  std::optional<std::string> nameOf(ProcessID pid) {
    return connect(pid)->clientProcessName();
  }
};

TEST_F(OstrelReportingServiceConnection, AcceptsAndResumesEveryConnection) {
  const auto connection = accept(kPid);

  ASSERT_NE(connection, nullptr);
  EXPECT_TRUE(connection->isResumed());
  EXPECT_NE(accept(0), nullptr);
  EXPECT_NE(accept(-5), nullptr);
}

TEST_F(OstrelReportingServiceConnection, LogsTheConnectionThenItsServerInstance) {
  accept(kPid);

  EXPECT_EQ(takeLines(),
            (LogLines{defaultLine("osrs", "newConnection: connection from pid 1234"),
                      defaultLine("osrs", "<OstrelReportingServiceDelegate>, 1234")}));
}

TEST_F(OstrelReportingServiceConnection, ExportsAServerInstanceOfTheClient) {
  const auto instance = instanceOf(*accept(kPid));

  ASSERT_NE(instance, nullptr);
  EXPECT_EQ(instance->clientID(), kPid);
  EXPECT_EQ(instance->master(), root);
  EXPECT_EQ(instance->clientStartDate(), std::nullopt);
  EXPECT_EQ(instance->clientProcessName(), std::nullopt);
}

TEST_F(OstrelReportingServiceConnection, NeverWritesTheErrorSlot) {
  std::optional<ErrorObject> error = ErrorObject{"untouched", /*code=*/1, ""};

  const auto instance =
      OstrelReportingServerInstance::initWithMasterAndID(root, kPid, &error);

  EXPECT_EQ(error->domain, "untouched");
  EXPECT_EQ(instance->clientID(), kPid);
}

TEST_F(OstrelReportingServiceConnection, RegistersOnTheServerQueue) {
  fakes.processInfo->setCommandName(kPid, "player");
  const auto instance = instanceOf(*accept(kPid));
  fakes.clock->advance(seconds(3));
  EXPECT_EQ(registeredClients(), std::vector<ProcessID>{});
  forgetRecords();

  fakes.runUntilIdle();

  EXPECT_EQ(registeredClients(), std::vector<ProcessID>{kPid});
  EXPECT_EQ(instance->clientStartDate(), Date{ManualClock::kStart.secondsSince1970 + 3});
  EXPECT_EQ(instance->clientProcessName(), "player");
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingServiceConnection, ListsClientsInTheOrderOfRegistration) {
  accept(3);
  accept(1);
  accept(2);
  fakes.runUntilIdle();

  EXPECT_EQ(registeredClients(), (std::vector<ProcessID>{3, 1, 2}));
}

TEST_F(OstrelReportingServiceConnection, RunsRequestsAfterTheRegistration) {
  const auto instance = instanceOf(*accept(kPid));
  instance->createReportingSession(ReporterID{7}, boolReply());
  instance->reporterIDValid(ReporterID{7}, dictionaryReply());

  fakes.runUntilIdle();

  EXPECT_EQ(replies, (Replies{"true", "{reporterID: 7, serviceType: 65535}"}));
}

// The process name.

TEST_F(OstrelReportingServiceConnection, NamesItsOwnProcessItself) {
  const auto instance = instanceOf(*accept(kOwnPid));
  fakes.runUntilIdle();

  EXPECT_EQ(instance->clientProcessName(), "ostrelreportingd");
  EXPECT_TRUE(fakes.events->startingWith("process.commandName").empty());
}

TEST_F(OstrelReportingServiceConnection, AsksForTheNameOfAnotherProcess) {
  fakes.processInfo->setCommandName(1, "init");

  EXPECT_EQ(nameOf(1), "init");
}

TEST_F(OstrelReportingServiceConnection, HasNoNameWhenTheQueryFails) {
  EXPECT_EQ(nameOf(kPid), std::nullopt);
}

TEST_F(OstrelReportingServiceConnection, DoesNotAskForAProcessIdOfZeroOrBelow) {
  accept(0);
  accept(-1);
  fakes.runUntilIdle();

  EXPECT_TRUE(fakes.events->startingWith("process.commandName").empty());
}

// Interruption and invalidation.

TEST_F(OstrelReportingServiceConnection, InterruptionRemovesTheClient) {
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  forgetRecords();

  connection->onlyInterrupt();
  EXPECT_EQ(takeLines(),
            LogLines{defaultLine("osrs", "InterruptionHandler: connection exited")});
  fakes.runUntilIdle();

  EXPECT_EQ(registeredClients(), std::vector<ProcessID>{});
  EXPECT_EQ(takeLines(),
            LogLines{defaultLine("osrs", "removing 1234 from the server client list")});
}

TEST_F(OstrelReportingServiceConnection, InvalidationSendsTheUptimeThenRemovesTheClient) {
  fakes.processInfo->setCommandName(kPid, "player");
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  forgetRecords();
  fakes.clock->advance(milliseconds(12750));

  connection->invalidate();
  EXPECT_EQ(takeLines(),
            LogLines{defaultLine("osrs",
                                 "InvalidationHandler: connection exited process=player "
                                 "uptime_sec=12")});
  EXPECT_EQ(fakes.analyticsSink->names(),
            Events{"com.orbisk.ostrel.ostrelreportingclientuptime"});
  EXPECT_EQ(fakes.analyticsSink->payload(0),
            (Dictionary{{"processName", "player"}, {"seconds", 12.75}}));
  fakes.runUntilIdle();

  EXPECT_EQ(registeredClients(), std::vector<ProcessID>{});
  EXPECT_EQ(takeLines(),
            LogLines{defaultLine("osrs", "removing 1234 from the server client list")});
}

TEST_F(OstrelReportingServiceConnection, SecondRemovalFindsNothingAndSaysNothing) {
  fakes.processInfo->setCommandName(kPid, "player");
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  forgetRecords();

  connection->interrupt();  // And invalidates.
  fakes.runUntilIdle();

  EXPECT_EQ(fakes.log->texts(),
            (Events{"InterruptionHandler: connection exited",
                    "InvalidationHandler: connection exited process=player uptime_sec=0",
                    "removing 1234 from the server client list"}));
  EXPECT_EQ(fakes.events->count(kUptimeEvent), 1u);
}

TEST_F(OstrelReportingServiceConnection, SendsNoUptimeWithoutAName) {
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  forgetRecords();

  connection->invalidate();

  EXPECT_EQ(takeLines(),
            (LogLines{defaultLine("osrs",
                                  "InvalidationHandler: connection exited process=(null) "
                                  "uptime_sec=0"),
                      defaultLine("osrs", "clientProcessName is nil. clientpid=1234")}));
  EXPECT_TRUE(fakes.analyticsSink->names().empty());
}

TEST_F(OstrelReportingServiceConnection, HasNoNameForAProcessIdOfZeroOrBelow) {
  const auto connection = accept(0);
  fakes.runUntilIdle();
  forgetRecords();

  connection->invalidate();

  EXPECT_EQ(fakes.log->count("clientProcessName is nil. clientpid=0"), 1u);
  EXPECT_TRUE(fakes.analyticsSink->names().empty());
}

TEST_F(OstrelReportingServiceConnection, InvalidatedBeforeItsRegistrationHasNoStartDate) {
  fakes.processInfo->setCommandName(kPid, "player");
  const auto connection = accept(kPid);
  const auto instance = instanceOf(*connection);
  forgetRecords();

  connection->invalidate();
  EXPECT_EQ(takeLines(),
            (LogLines{defaultLine("osrs",
                                  "clientStartDate is nil. clientpid=1234 "
                                  "clientprocessname=unknown"),
                      defaultLine("osrs",
                                  "InvalidationHandler: connection exited process=(null) "
                                  "uptime_sec=-1"),
                      defaultLine("osrs", "clientProcessName is nil. clientpid=1234")}));
  fakes.runUntilIdle();  // Registers, then removes.

  EXPECT_EQ(registeredClients(), std::vector<ProcessID>{});
  EXPECT_EQ(takeLines(),
            LogLines{defaultLine("osrs", "removing 1234 from the server client list")});
}

/// A connection that lets its exported object go before it is invalidated.
class ForgetfulConnection final : public IPCConnection {
 public:
  ProcessID processIdentifier() const override { return 99; }
  std::string description() const override { return "forgetful connection"; }
  void setExportedObject(
      std::shared_ptr<OstrelReportingServiceProtocol> newObject) override {
    object = std::move(newObject);
  }
  std::shared_ptr<OstrelReportingServiceProtocol> exportedObject() const override {
    return object;
  }
  void setInterruptionHandler(std::function<void()> handler) override {
    interruption = std::move(handler);
  }
  void setInvalidationHandler(std::function<void()> handler) override {
    invalidation = std::move(handler);
  }
  void resume() override {}

  std::shared_ptr<OstrelReportingServiceProtocol> object;
  std::function<void()> interruption;
  std::function<void()> invalidation;
};

TEST_F(OstrelReportingServiceConnection, BearsThatItsInstanceIsGone) {
  const auto connection = std::make_shared<ForgetfulConnection>();
  root->listenerShouldAcceptNewConnection(*fakes.listener, connection);
  connection->object.reset();
  fakes.runUntilIdle();  // There is nothing to register any more.
  EXPECT_EQ(registeredClients(), std::vector<ProcessID>{});
  forgetRecords();

  connection->interruption();
  connection->invalidation();
  fakes.runUntilIdle();

  EXPECT_EQ(takeLines(),
            (LogLines{defaultLine("osrs", "InterruptionHandler: connection exited"),
                      defaultLine("osrs",
                                  "clientStartDate is nil. clientpid=99 "
                                  "clientprocessname=unknown"),
                      defaultLine("osrs",
                                  "InvalidationHandler: connection exited process=(null) "
                                  "uptime_sec=-1"),
                      defaultLine("osrs", "clientProcessName is nil. clientpid=99")}));
  EXPECT_TRUE(fakes.analyticsSink->names().empty());
}

TEST_F(OstrelReportingServiceConnection, KeepsInThePastTextForAFutureStartDate) {
  fakes.processInfo->setCommandName(kPid, "player");
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  forgetRecords();
  fakes.clock->setWallClock(Date{ManualClock::kStart.secondsSince1970 - 90.5});

  connection->invalidate();

  EXPECT_EQ(takeLines(),
            (LogLines{defaultLine("osrs",
                                  "clientStartDate is in the past. clientpid=1234 "
                                  "clientprocessname=player"),
                      defaultLine("osrs",
                                  "InvalidationHandler: connection exited process=player "
                                  "uptime_sec=90")}));
  EXPECT_EQ(fakes.analyticsSink->payload(0),
            (Dictionary{{"processName", "player"}, {"seconds", 90.5}}));
}

TEST_F(OstrelReportingServiceConnection, SaysUnknownForAFutureStartDateWithoutAName) {
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  forgetRecords();
  fakes.clock->setWallClock(Date{ManualClock::kStart.secondsSince1970 - 1});

  connection->invalidate();

  EXPECT_EQ(fakes.log->count("clientStartDate is in the past. clientpid=1234 "
                             "clientprocessname=unknown"),
            1u);
}

TEST_F(OstrelReportingServiceConnection, LeavesSessionsToTheLastReference) {
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  {
    const auto session = createStarted(*instanceOf(*connection), 7);
    fakes.telemetryBackend->releaseCallbacks();  // The backend's own reference.
  }
  auto held = instanceOf(*connection);

  connection->invalidate();
  fakes.runUntilIdle();
  EXPECT_EQ(fakes.events->count("trace 0x21042834"), 0u);
  held.reset();

  EXPECT_EQ(fakes.events->count("trace 0x21042834"), 1u);
  EXPECT_EQ(fakes.events->count("backend.release 1"), 1u);
  EXPECT_EQ(fakes.events->count("backend.flush 1"), 0u);
}

TEST_F(OstrelReportingServiceConnection, FindsNoSessionOfAClientThatIsRemoved) {
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  create(*instanceOf(*connection), 7);
  const auto other = connect(5);
  const auto held = instanceOf(*connection);
  connection->invalidate();
  fakes.runUntilIdle();

  other->reporterIDValid(ReporterID{7}, dictionaryReply());
  other->getAllReporters(idsReply());
  fakes.runUntilIdle();

  EXPECT_EQ(replies, (Replies{"{reporterID: 0, serviceType: 65535}", "()"}));
}

// In a table that takes an ID as its own hash they would all meet in one place.
TEST_F(OstrelReportingServiceConnection, SpreadsSessionsWhoseIDsAreChosenToMeet) {
  constexpr std::size_t kSessions = 3000;
  std::unordered_set<std::int64_t> grown;
  for (std::size_t i = 0; i < kSessions; ++i) grown.insert(static_cast<std::int64_t>(i));
  const auto step = static_cast<std::int64_t>(grown.bucket_count());
  const auto client = connect(kPid);

  for (std::size_t i = 1; i <= kSessions; ++i) {
    client->createReportingSession(ReporterID{static_cast<std::int64_t>(i) * step},
                                   /*reply=*/nullptr);
  }
  fakes.runUntilIdle();

  onServerQueue([&] {
    assertOnServerQueue();
    const auto& sessions = client->clientReportingSessionMap();
    EXPECT_EQ(sessions.size(), kSessions);
    std::size_t most = 0;
    for (std::size_t bucket = 0; bucket < sessions.bucket_count(); ++bucket) {
      most = std::max(most, sessions.bucket_size(bucket));
    }
    EXPECT_LT(most, 30u);
  });
}

TEST_F(OstrelReportingServiceConnection, ServesALateRequestOfARemovedClientOnItsOwnMap) {
  const auto connection = accept(kPid);
  fakes.runUntilIdle();
  const auto held = instanceOf(*connection);
  connection->invalidate();
  fakes.runUntilIdle();

  held->createReportingSession(ReporterID{7}, boolReply());
  held->setServiceType(ServiceType{3}, ReporterID{7}, boolReply());
  held->getServiceNameForReporterID(ReporterID{7}, typeReply());
  fakes.runUntilIdle();

  EXPECT_EQ(replies, (Replies{"true", "true", "65535"}));
  EXPECT_EQ(sessionOf(*held, 7)->serviceType(), ServiceType{3});
}

// The end of the service.

TEST_F(OstrelReportingServiceConnection, KillEndsTheProcessAtOnceWithStatus2) {
  const auto client = connect(kPid);

  client->killService(boolReply());

  EXPECT_EQ(fakes.processInfo->endStatus(), 2);
  EXPECT_EQ(takeLines(), LogLines{defaultLine("osrs", "DESTROYING SERVICE")});
  fakes.runUntilIdle();
  EXPECT_EQ(replies, Replies{});
}

}  // namespace
}  // namespace ostrel
