#include "platform/linux/store/Store.h"

#include <sys/stat.h>

#include <limits>
#include <thread>

#include "platform/linux/store/StoreAnalyticsSink.h"
#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreTesting.h"
#include "platform/linux/store/StoreWattlogSink.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using SteadyClock = std::chrono::steady_clock;

class StoreTest : public ::testing::Test {
 protected:
  std::string path() const { return directory_.path() + "/state/reports.db"; }

  // A store whose clock counts 1000, 2000, 3000...
  void open() {
    StoreOptions options;
    options.now = [this] { return 1000 * ++ticks_; };
    open(options);
  }

  void open(StoreOptions options) {
    store_ = Store::open(path(), std::move(options));
    backend_ = std::make_unique<StoreTelemetryBackend>(store_);
    analytics_ = std::make_unique<StoreAnalyticsSink>(store_);
    wattlog_ = std::make_unique<StoreWattlogSink>(store_);
  }

  // A store in which a few messages may wait, and do for long.
  void openWithSmallQueue() {
    StoreOptions options;
    options.queuedBytes = 4096;
    options.commitWindow = std::chrono::hours(1);
    open(options);
  }

  void close() {
    analytics_.reset();
    wattlog_.reset();
    backend_.reset();
    store_.reset();
  }

  std::shared_ptr<TelemetrySession> makeSession(std::int64_t reporterID) {
    return backend_->createSession(sessionInfo(reporterID), userInfo(), {});
  }

  // Everything queued before is durable.
  void settle() { EXPECT_EQ(flushed(*makeSession(0)), std::nullopt); }

  TemporaryDirectory directory_;
  std::atomic<std::int64_t> ticks_{0};
  std::atomic<std::int64_t> now_{1'000'000};
  std::shared_ptr<Store> store_;
  std::unique_ptr<StoreTelemetryBackend> backend_;
  std::unique_ptr<StoreAnalyticsSink> analytics_;
  std::unique_ptr<StoreWattlogSink> wattlog_;
};

const Dictionary kPayload{{"volume", Value(0.5)}, {"route", Value("speaker")}};

TEST_F(StoreTest, WritesASessionAndItsMessages) {
  open();
  auto session = makeSession(77);
  EXPECT_TRUE(session->sendMessage(2, 7, kPayload).succeeded);
  EXPECT_TRUE(session->sendMessage(0xFFFF, 0xFFFF, Dictionary()).succeeded);
  EXPECT_EQ(flushed(*session), std::nullopt);
  session.reset();
  close();
  OtherConnection reader(path());
  EXPECT_EQ(reader.rows("SELECT * FROM telemetry_sessions"),
            std::vector<std::string>{
                "1|77|00-token|{\"kTelvarSessionInfoClientType\":19,"
                "\"kTelvarSessionInfoClientVersion\":1.0,"
                "\"kTelvarSessionInfoSessionID\":77,"
                "\"kTelvarSessionInfoBatchEvent\":true,"
                "\"kTelvarSessionInfoHierarchyToken\":\"00-token\"}|"
                "{\"kTelvarUserInfoClientName\":\"com.orbisk.ostrel\"}|1000|4000|5000"});
  EXPECT_EQ(reader.rows("SELECT * FROM telemetry_messages"),
            (std::vector<std::string>{
                "1|1|NULL|NULL|2|7|{\"volume\":0.5,\"route\":\"speaker\"}|2000",
                "2|1|NULL|NULL|65535|65535|{}|3000"}));
}

TEST_F(StoreTest, WritesAMessageWithoutASession) {
  open();
  EXPECT_TRUE(
      backend_->sendOneMessage(sessionInfo(-1), userInfo(), 9, 0, kPayload).succeeded);
  close();
  EXPECT_EQ(OtherConnection(path()).rows(
                "SELECT id, telemetry_session_id, json_extract(session_info, "
                "'$.kTelvarSessionInfoSessionID'), user_info, category, type, payload, "
                "created_at FROM telemetry_messages"),
            std::vector<std::string>{
                "1|NULL|-1|{\"kTelvarUserInfoClientName\":\"com.orbisk.ostrel\"}|9|0|"
                "{\"volume\":0.5,\"route\":\"speaker\"}|1000"});
}

TEST_F(StoreTest, LeavesFlushedAtEmptyWithoutAFlush) {
  open();
  makeSession(1).reset();
  close();
  EXPECT_EQ(OtherConnection(path()).one(
                "SELECT started_at, flushed_at, ended_at FROM telemetry_sessions"),
            "1000|NULL|2000");
}

TEST_F(StoreTest, LeavesEndedAtEmptyWhileTheHandleIsHeld) {
  open();
  auto session = makeSession(1);
  EXPECT_EQ(flushed(*session), std::nullopt);
  EXPECT_EQ(
      OtherConnection(path()).one("SELECT flushed_at, ended_at FROM telemetry_sessions"),
      "2000|NULL");
}

TEST_F(StoreTest, WritesReporterIDsOfTheWholeRange) {
  open();
  makeSession(std::numeric_limits<std::int64_t>::min()).reset();
  makeSession(std::numeric_limits<std::int64_t>::max()).reset();
  close();
  EXPECT_EQ(OtherConnection(path()).rows("SELECT reporter_id FROM telemetry_sessions"),
            (std::vector<std::string>{"-9223372036854775808", "9223372036854775807"}));
}

TEST_F(StoreTest, WritesWhatJSONCannotSayAsSubstitutes) {
  open();
  DictionaryBuilder payload;
  payload.set("nan", Value(std::numeric_limits<double>::quiet_NaN()));
  payload.set(Value(5).view(), Value(Date{1769860800.25}).view());
  payload.set("nul", Value(std::string_view("a\0b", 3)));
  makeSession(1)->sendMessage(0, 0, payload.build());
  close();
  EXPECT_EQ(OtherConnection(path()).one("SELECT payload FROM telemetry_messages"),
            R"({"nan":"NaN","5":"2026-01-31T12:00:00.250Z","nul":"a\u0000b"})");
}

TEST_F(StoreTest, WritesManyMessagesInOrder) {
  open();
  constexpr int kCount = 5000;
  auto session = makeSession(1);
  for (int i = 0; i < kCount; ++i) {
    ASSERT_TRUE(session->sendMessage(1, 1, {{"i", Value(i)}}).succeeded);
  }
  EXPECT_EQ(flushed(*session), std::nullopt);
  OtherConnection reader(path());
  EXPECT_EQ(reader.one("SELECT count(*), min(id), max(id) FROM telemetry_messages WHERE "
                       "json_extract(payload, '$.i') = id - 1"),
            "5000|1|5000");
  EXPECT_EQ(store_->counters().accepted, 5000u);
  EXPECT_EQ(store_->counters().written, 5000u);
}

TEST_F(StoreTest, KeepsMessagesOfManyThreadsEachInOrder) {
  open();
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([this, thread] {
      auto session = makeSession(thread);
      for (int i = 0; i < 1000; ++i) session->sendMessage(1, 1, {{"i", Value(i)}});
      EXPECT_EQ(flushed(*session), std::nullopt);
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(OtherConnection(path()).rows(
                "SELECT count(*), sum(i < before) FROM (SELECT json_extract(payload, "
                "'$.i') AS i, lag(json_extract(payload, '$.i'), 1, -1) OVER (PARTITION "
                "BY telemetry_session_id ORDER BY id) AS before FROM "
                "telemetry_messages)"),
            std::vector<std::string>{"4000|0"});
}

TEST_F(StoreTest, WritesAnalyticsEvents) {
  open();
  analytics_->sendEventLazy("com.orbisk.ostrel.A.B", [] { return kPayload; });
  settle();
  EXPECT_EQ(OtherConnection(path()).rows("SELECT * FROM analytics_events"),
            std::vector<std::string>{"1|com.orbisk.ostrel.A.B|{\"volume\":0.5,\"route\":"
                                     "\"speaker\"}|1000"});
}

TEST_F(StoreTest, AsksTheProviderOnTheWritersThreadAndOnce) {
  open();
  std::atomic<int> calls{0};
  std::atomic<bool> wasHere{false};
  const auto here = std::this_thread::get_id();
  analytics_->sendEventLazy("a", [&] {
    ++calls;
    wasHere = std::this_thread::get_id() == here;
    return Dictionary();
  });
  settle();
  EXPECT_EQ(calls, 1);
  EXPECT_FALSE(wasHere);
}

TEST_F(StoreTest, AsksOnlyForWantedEvents) {
  open();
  settle();
  OtherConnection(path()).run(
      "DELETE FROM analytics_interest; INSERT INTO analytics_interest VALUES "
      "('*.Start'), ('com.[ab].*')");
  std::atomic<int> calls{0};
  for (const char* name : {"x.Start", "x.Stop", "com.a.y", "com.c.y", "x.Start"}) {
    analytics_->sendEventLazy(name, [&] {
      ++calls;
      return Dictionary();
    });
  }
  settle();
  EXPECT_EQ(calls, 3);
  EXPECT_EQ(OtherConnection(path()).rows("SELECT name FROM analytics_events"),
            (std::vector<std::string>{"x.Start", "com.a.y", "x.Start"}));
  EXPECT_EQ(store_->counters().droppedAnalytics, 0u);
}

TEST_F(StoreTest, WantsNothingWhenAllPatternsAreGone) {
  open();
  settle();
  OtherConnection(path()).run("DELETE FROM analytics_interest");
  analytics_->sendEventLazy("a", [] { return Dictionary(); });
  settle();
  EXPECT_EQ(OtherConnection(path()).one("SELECT count(*) FROM analytics_events"), "0");
}

TEST_F(StoreTest, SurvivesAProviderThatThrows) {
  open();
  analytics_->sendEventLazy("a", []() -> Dictionary { throw 5; });
  analytics_->sendEventLazy("b", [] { return Dictionary(); });
  settle();
  EXPECT_EQ(OtherConnection(path()).rows("SELECT name FROM analytics_events"),
            std::vector<std::string>{"b"});
  EXPECT_EQ(store_->counters().droppedAnalytics, 1u);
}

TEST_F(StoreTest, DropsAnalyticsEventsBeyondTheBoundAndCountsThem) {
  StoreOptions options;
  options.queuedEvents = 3;
  options.commitWindow = std::chrono::hours(1);
  open(options);
  settle();  // The writer has had its first look, and waits.
  for (int i = 0; i < 5; ++i) {
    analytics_->sendEventLazy("a", [] { return Dictionary(); });
  }
  EXPECT_EQ(store_->counters().droppedAnalytics, 2u);
  settle();
  OtherConnection reader(path());
  EXPECT_EQ(reader.one("SELECT count(*) FROM analytics_events"), "3");
  EXPECT_EQ(reader.one("SELECT value FROM service_status WHERE key = "
                       "'dropped_analytics'"),
            "2");
}

TEST_F(StoreTest, WritesWhatOthersCountWhenTheySayThatItChanged) {
  std::atomic<std::uint64_t> refused{0};
  StoreOptions options;
  options.otherCounts = [&refused] {
    return std::vector<StatusCount>{{"sessions_refused", refused.load()}};
  };
  open(options);
  settle();
  refused = 7;
  store_->noteStatusChange();
  OtherConnection reader(path());
  EXPECT_TRUE(eventually([&] {
    return reader.one(
               "SELECT value FROM service_status WHERE key = "
               "'sessions_refused'") == "7";
  }));
  EXPECT_EQ(store_->counters().accepted, 0u);
}

TEST_F(StoreTest, WritesPowerEvents) {
  open();
  wattlog_->logRegisteredEvent(28, "Mediora_Haptics", {{"EngineOnDuration", Value(1.5)}},
                               std::nullopt);
  wattlog_->logRegisteredEvent(-1, "other", Dictionary(), kPayload);
  settle();
  EXPECT_EQ(OtherConnection(path()).rows(
                "SELECT id, client_id, name, event, created_at, attachment FROM "
                "power_events"),
            (std::vector<std::string>{
                "1|28|Mediora_Haptics|{\"EngineOnDuration\":1.5}|1000|NULL",
                "2|-1|other|{}|2000|{\"volume\":0.5,\"route\":\"speaker\"}"}));
}

TEST_F(StoreTest, RefusesMessagesBeyondTheBound) {
  openWithSmallQueue();
  auto session = makeSession(1);
  const Dictionary payload{{"text", Value(std::string(1000, 'x'))}};
  int accepted = 0;
  Success success;
  for (; accepted < 100; ++accepted) {
    success = session->sendMessage(1, 1, payload);
    if (!success.succeeded) break;
  }
  // The writer may take over once what waits, while the messages come.
  EXPECT_GT(accepted, 2);
  EXPECT_LT(accepted, 9);
  ASSERT_TRUE(success.error);
  EXPECT_EQ(success.error->domain, kOstrelErrorDomain);
  EXPECT_EQ(success.error->description, "too much waits to be stored");
  EXPECT_EQ(store_->counters().refused, 1u);
  EXPECT_EQ(flushed(*session), std::nullopt);
  EXPECT_TRUE(session->sendMessage(1, 1, payload).succeeded);
}

TEST_F(StoreTest, CountsOnlyTheOwnBytesOfAMessageThatSharesItsBuffer) {
  openWithSmallQueue();
  auto session = makeSession(1);
  std::string burst(64 * 1024, '\0');
  const auto own = kPayload.value().bytes();
  std::copy(own.begin(), own.end(), burst.begin());
  const ValueBuffer shared = ValueBuffer::copyOf(
      {reinterpret_cast<const std::uint8_t*>(burst.data()), burst.size()});
  const Dictionary payload(shared, shared.data());

  EXPECT_TRUE(session->sendMessage(1, 1, payload).succeeded);
  EXPECT_TRUE(session->sendMessage(1, 1, payload).succeeded);
  EXPECT_EQ(flushed(*session), std::nullopt);
}

TEST_F(StoreTest, IsDurableWithinTheWindowWithoutAFlush) {
  open(StoreOptions());
  settle();
  OtherConnection reader(path());
  auto session = makeSession(1);
  for (int i = 1; i <= 10; ++i) {
    const auto accepted = SteadyClock::now();
    ASSERT_TRUE(session->sendMessage(1, 1, kPayload).succeeded);
    ASSERT_TRUE(eventually([&] {
      return reader.one("SELECT count(*) FROM telemetry_messages") == std::to_string(i);
    }));
    EXPECT_LT(SteadyClock::now() - accepted, milliseconds(250));
  }
}

TEST_F(StoreTest, CommitsAtOnceOnAFlush) {
  StoreOptions options;
  options.commitWindow = std::chrono::hours(1);
  open(options);
  auto session = makeSession(1);
  session->sendMessage(1, 1, kPayload);
  EXPECT_EQ(flushed(*session), std::nullopt);
  EXPECT_EQ(OtherConnection(path()).one("SELECT count(*) FROM telemetry_messages"), "1");
}

TEST_F(StoreTest, AnswersAFlushWhoseHandleIsReleasedAtOnce) {
  open();
  Awaited<bool> done;
  auto session = makeSession(1);
  session->flush([&](std::optional<ErrorObject> error) { done.set(!error); });
  session.reset();
  EXPECT_EQ(done.get(), true);
  close();
  EXPECT_EQ(done.times(), 1);
  EXPECT_EQ(
      OtherConnection(path()).one("SELECT flushed_at, ended_at FROM telemetry_sessions"),
      "2000|3000");
}

TEST_F(StoreTest, CommitsWhatWasAcceptedWhenItShutsDown) {
  StoreOptions options;
  options.commitWindow = std::chrono::hours(1);
  open(options);
  auto session = makeSession(1);
  for (int i = 0; i < 1000; ++i) session->sendMessage(1, 1, kPayload);
  EXPECT_TRUE(store_->shutdown(SteadyClock::now() + std::chrono::seconds(30)));
  EXPECT_EQ(OtherConnection(path()).one("SELECT count(*) FROM telemetry_messages"),
            "1000");
}

TEST_F(StoreTest, RefusesEverythingAfterItShutDown) {
  open();
  auto session = makeSession(1);
  EXPECT_TRUE(store_->shutdown(SteadyClock::time_point::max()));
  EXPECT_EQ(session->sendMessage(1, 1, kPayload).error->description,
            "the store is closed");
  EXPECT_EQ(backend_->sendOneMessage({}, {}, 1, 1, {}).error->description,
            "the store is closed");
  EXPECT_EQ(flushed(*session)->description, "the store is closed");
  analytics_->sendEventLazy("a", [] { return Dictionary(); });
  EXPECT_EQ(store_->counters().droppedAnalytics, 1u);
  session.reset();
  makeSession(2).reset();
}

TEST_F(StoreTest, FindsTheBackendStore) {
  open();
  Awaited<std::optional<Array>> backends;
  auto session = makeSession(1);
  session->startConfiguration([&](std::optional<Array> found) { backends.set(found); });
  EXPECT_EQ(backends.get(), ArrayBuilder().append(Value("store")).build());
}

TEST_F(StoreTest, AnswersDiscoveryInlineOnceItIsOpen) {
  open();
  settle();
  bool isAnswered = false;
  auto session = makeSession(1);
  session->startConfiguration([&](std::optional<Array>) { isAnswered = true; });
  EXPECT_TRUE(isAnswered);
}

TEST_F(StoreTest, NeverAnswersDiscoveryAfterTheRelease) {
  for (int i = 0; i < 200; ++i) {
    open();
    auto session = makeSession(1);
    std::atomic<bool> isReleased{false};
    session->startConfiguration(
        [&](std::optional<Array>) { EXPECT_FALSE(isReleased.load()); });
    session.reset();
    isReleased = true;
    close();
  }
}

TEST_F(StoreTest, StandsAReleaseInsideTheAnswer) {
  open();
  Awaited<bool> done;
  auto session = makeSession(1);
  session->startConfiguration([&](std::optional<Array>) {
    session.reset();
    done.set(true);
  });
  EXPECT_EQ(done.get(), true);
}

TEST_F(StoreTest, GoesOnInTheSameFile) {
  open();
  makeSession(1)->sendMessage(1, 1, kPayload);
  close();
  open();
  makeSession(2)->sendMessage(1, 1, kPayload);
  close();
  OtherConnection reader(path());
  EXPECT_EQ(reader.rows("SELECT id, reporter_id FROM telemetry_sessions"),
            (std::vector<std::string>{"1|1", "2|2"}));
  EXPECT_EQ(reader.rows("SELECT id, telemetry_session_id FROM telemetry_messages"),
            (std::vector<std::string>{"1|1", "2|2"}));
  EXPECT_EQ(store_, nullptr);
}

TEST_F(StoreTest, MakesItsDirectoryAndFilesPrivate) {
  const mode_t before = ::umask(0);
  open();
  settle();
  ::umask(before);
  const auto mode = [](const std::string& path) {
    struct stat status;
    return ::stat(path.c_str(), &status) == 0 ? status.st_mode & 0777 : 0;
  };
  EXPECT_EQ(mode(directory_.path() + "/state"), 0700u);
  EXPECT_EQ(mode(path()), 0600u);
  EXPECT_EQ(mode(path() + "-wal"), 0600u);
  EXPECT_EQ(mode(path() + "-shm"), 0600u);
}

TEST_F(StoreTest, SaysItsVersionAndItsJournal) {
  open();
  settle();
  OtherConnection reader(path());
  EXPECT_EQ(reader.one("PRAGMA user_version"), "2");
  EXPECT_EQ(reader.one("PRAGMA journal_mode"), "wal");
  EXPECT_EQ(reader.one("SELECT pattern FROM analytics_interest"), "*");
}

TEST_F(StoreTest, RemovesTheOldestRowsOfALargeStore) {
  StoreOptions options;
  options.retention.bytes = 2'000'000;
  open(options);
  const Dictionary payload{{"text", Value(std::string(1000, 'x'))}};
  auto session = makeSession(1);
  makeSession(2).reset();
  for (int round = 0; round < 100; ++round) {
    for (int i = 0; i < 100; ++i) session->sendMessage(1, 1, payload);
    EXPECT_EQ(flushed(*session), std::nullopt);
  }
  OtherConnection reader(path());
  EXPECT_EQ(reader.one("SELECT max(id), min(id) > 5000, count(*) > 500 FROM "
                       "telemetry_messages"),
            "10000|1|1");
  EXPECT_EQ(reader.rows("SELECT reporter_id FROM telemetry_sessions"),
            (std::vector<std::string>{"1", "2"}));
  EXPECT_EQ(reader.one("SELECT value = 10000 - (SELECT count(*) FROM telemetry_messages) "
                       "FROM service_status WHERE key = 'removed'"),
            "1");
  EXPECT_EQ(reader.one("SELECT (page_count - freelist_count) * page_size < 4000000 FROM "
                       "pragma_page_count, pragma_freelist_count, pragma_page_size"),
            "1");
}

TEST_F(StoreTest, RemovesRowsThatAreTooOld) {
  StoreOptions options;
  options.now = [this] { return now_.load(); };
  options.retention.age = std::chrono::hours(1);
  open(options);
  makeSession(1)->sendMessage(1, 1, kPayload);
  analytics_->sendEventLazy("old", [] { return kPayload; });
  wattlog_->logRegisteredEvent(1, "old", kPayload, std::nullopt);
  settle();
  now_ = 1'000'000 + 3'600'000'000 + 1;
  makeSession(2)->sendMessage(2, 2, kPayload);
  analytics_->sendEventLazy("new", [] { return kPayload; });
  wattlog_->logRegisteredEvent(1, "new", kPayload, std::nullopt);
  settle();
  settle();
  OtherConnection reader(path());
  EXPECT_EQ(reader.rows("SELECT category FROM telemetry_messages"),
            std::vector<std::string>{"2"});
  EXPECT_EQ(reader.rows("SELECT name FROM analytics_events"),
            std::vector<std::string>{"new"});
  EXPECT_EQ(reader.rows("SELECT name FROM power_events"),
            std::vector<std::string>{"new"});
  EXPECT_EQ(reader.one("SELECT count(*) FROM telemetry_sessions WHERE reporter_id = 1"),
            "0");
}

TEST_F(StoreTest, MakesTokensOfOneTrace) {
  open();
  const HierarchyToken root = backend_->makeHierarchyToken(std::nullopt);
  const HierarchyToken child = backend_->makeHierarchyToken(root);
  EXPECT_THAT(root, ::testing::MatchesRegex("00-[0-9a-f]+-[0-9a-f]+-01"));
  EXPECT_EQ(root.size(), 55u);
  EXPECT_EQ(child.size(), 55u);
  EXPECT_EQ(child.substr(0, 36), root.substr(0, 36));
  EXPECT_NE(child, root);
  EXPECT_NE(backend_->makeHierarchyToken(std::nullopt).substr(0, 36), root.substr(0, 36));
  EXPECT_NE(backend_->makeHierarchyToken("00-short").size(), 0u);
}

}  // namespace
}  // namespace ostrel
