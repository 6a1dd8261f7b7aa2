// Who loses rows when the store or the disk is full, and stores from before that was
// known.
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>

#include "platform/linux/store/StoreDatabase.h"
#include "platform/linux/store/StoreFaultVFS.h"
#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreTesting.h"
#include "platform/linux/store/StoreWattlogSink.h"

namespace ostrel {
namespace {

namespace fs = std::filesystem;
using std::chrono::milliseconds;

/// A user's clients, as far as the store sees them.
class User final : public PayloadAccount {
 public:
  explicit User(std::int64_t number) : number_(number) {}
  std::int64_t user() const noexcept override { return number_; }
  void charge(std::size_t) noexcept override {}
  void relieve(std::size_t) noexcept override {}
  bool keep(std::size_t) noexcept override { return true; }
  void discard(std::size_t) noexcept override {}

 private:
  const std::int64_t number_;
};

/// What a user's request causes while it is alive.
class RequestOf final : public Burden {
 public:
  explicit RequestOf(std::int64_t user) : Burden(user) {}
};

class OwnersOfRows : public testing::Test {
 protected:
  static constexpr std::int64_t kVictim = 1000;
  static constexpr std::int64_t kFlooder = 1001;

  std::string path() const { return directory.path() + "/state/reports.db"; }
  void open() { open(StoreOptions()); }
  void open(StoreOptions options) {
    options.flushPause = milliseconds(0);
    store = Store::open(path(), options);
    backend = std::make_unique<StoreTelemetryBackend>(store);
  }
  void close() {
    sessions.clear();
    backend.reset();
    store.reset();
  }
  static StoreOptions optionsOfSmallStore() {
    StoreOptions options;
    options.retention.bytes = 2'000'000;
    return options;
  }
  TelemetrySession& begin(std::int64_t user) {
    const BurdenShare request(new RequestOf(user));
    const Burden::Scope bearing(request.get());
    sessions.push_back(backend->createSession(sessionInfo(user), userInfo(), {}));
    return *sessions.back();
  }
  static Dictionary payloadOf(std::int64_t user, int number) {
    return DictionaryBuilder(std::make_shared<User>(user))
        .set("i", Value(number))
        .set("text", Value(std::string(1000, 'x')))
        .build();
  }
  /// Messages with the numbers from `first` on, durable.
  void send(TelemetrySession& session, std::int64_t user, int count, int first = 0) {
    for (int i = 0; i < count; ++i) {
      ASSERT_TRUE(session.sendMessage(1, 1, payloadOf(user, first + i)).succeeded);
      if (i % 500 == 499) {
        ASSERT_EQ(flushed(session), std::nullopt);
      }
    }
    ASSERT_EQ(flushed(session), std::nullopt);
  }
  std::string one(const std::string& sql) { return OtherConnection(path()).one(sql); }
  std::vector<std::string> owners(const std::string& kind) {
    return OtherConnection(path()).rows(
        "SELECT first_id, last_id, user FROM row_owners WHERE kind = " + kind);
  }

  TemporaryDirectory directory;
  std::atomic<std::int64_t> now{1'000'000};  // Asked until the last session is gone.
  std::shared_ptr<Store> store;
  std::unique_ptr<StoreTelemetryBackend> backend;
  std::vector<std::shared_ptr<TelemetrySession>> sessions;
};

constexpr const char* kMessagesOfVictim =
    "SELECT count(*) FROM telemetry_messages WHERE telemetry_session_id IN "
    "(SELECT id FROM telemetry_sessions WHERE reporter_id = 1000)";

TEST_F(OwnersOfRows, KeepRowsThatOthersFlood) {
  constexpr int kOfVictim = 1000;
  constexpr int kARound = 500;
  // More in longer runs.
  const char* text = std::getenv("OSTREL_FLOOD_ROWS");
  const int rounds = (text != nullptr ? std::atoi(text) : 10'000) / kARound;
  StoreOptions options;
  options.retention.bytes = 4'000'000;
  open(options);
  send(begin(kVictim), kVictim, kOfVictim);
  sessions.clear();
  for (int round = 0; round < rounds; ++round) {
    send(begin(kFlooder), kFlooder, kARound);
    sessions.clear();
  }
  send(begin(kVictim), kVictim, 1);

  const std::string all = std::to_string(kOfVictim + rounds * kARound + 1);
  const std::string allSessions = std::to_string(rounds + 2);
  EXPECT_EQ(one(kMessagesOfVictim), std::to_string(kOfVictim + 1));
  EXPECT_EQ(one("SELECT count(*) FROM telemetry_sessions WHERE reporter_id = 1000"), "2");
  EXPECT_EQ(one("SELECT count(*) BETWEEN 1500 AND 5000 FROM telemetry_messages"), "1");
  EXPECT_EQ(one("SELECT count(*) < 15 FROM telemetry_sessions WHERE reporter_id = 1001"),
            "1")
      << "sessions without messages go too";
  EXPECT_EQ(one("SELECT max(id) FROM telemetry_messages"), all);
  EXPECT_EQ(one("SELECT value = " + all + " + " + allSessions +
                " - (SELECT count(*) FROM telemetry_messages) - (SELECT count(*) FROM "
                "telemetry_sessions) FROM service_status WHERE key = 'removed'"),
            "1");
}

TEST_F(OwnersOfRows, LoseTheirOldestRowsUntilAllHaveAlike) {
  open(optionsOfSmallStore());
  TelemetrySession& first = begin(1);
  TelemetrySession& second = begin(2);
  TelemetrySession& third = begin(3);
  for (int round = 0; round < 10; ++round) {
    send(first, 1, 100, 100 * round);
    send(second, 2, 300, 300 * round);
    send(third, 3, 600, 600 * round);
  }
  const std::string counts =
      "FROM (SELECT count(*) AS n, min(i) AS low, max(i) AS high FROM (SELECT "
      "telemetry_session_id AS session, json_extract(payload, '$.i') AS i FROM "
      "telemetry_messages) GROUP BY session)";
  EXPECT_EQ(one("SELECT count(*), min(n) > 100, max(n) < 3 * min(n) " + counts), "3|1|1");
  EXPECT_EQ(one("SELECT min(n = high - low + 1), group_concat(high) " + counts),
            "1|999,2999,5999");
}

TEST_F(OwnersOfRows, AreWhoseClientCausedARow) {
  open();
  TelemetrySession& session = begin(5);
  const Dictionary ofNobody{{"a", Value(1)}};
  session.sendMessage(1, 1, payloadOf(6, 0));
  session.sendMessage(1, 1, payloadOf(6, 1));
  session.sendMessage(1, 1, ofNobody);
  backend->sendOneMessage(sessionInfo(-1), userInfo(), 1, 1, payloadOf(7, 0));
  backend->sendOneMessage(sessionInfo(-1), userInfo(), 1, 1, ofNobody);
  store->addAnalyticsEvent("event", [] { return payloadOf(8, 0); });
  store->addPowerEvent({28, "event", payloadOf(9, 0), std::nullopt});
  {
    const BurdenShare request(new RequestOf(10));
    const Burden::Scope bearing(request.get());
    session.sendMessage(1, 1, ofNobody);
    store->addAnalyticsEvent("event", [] { return Dictionary(); });
  }
  ASSERT_EQ(flushed(session), std::nullopt);

  EXPECT_EQ(owners("0"),
            (std::vector<std::string>{"1|2|6", "3|3|5", "4|4|7", "5|5|-1", "6|6|10"}))
      << "what a session sends by itself is that of who caused it, or started it";
  EXPECT_EQ(owners("1"), (std::vector<std::string>{"1|1|8", "2|2|10"}));
  EXPECT_EQ(owners("2"), std::vector<std::string>{"1|1|9"});
  EXPECT_EQ(owners("3"), std::vector<std::string>{"1|1|5"});
  EXPECT_EQ(one("SELECT sum(bytes) = (SELECT sum(bytes) FROM row_owners) FROM "
                "owner_bytes"),
            "1");
}

TEST_F(OwnersOfRows, LetTheNextLoseRowsWhereNoneOfTheirsMayGo) {
  open(optionsOfSmallStore());
  // Sessions that have not ended.
  const Dictionary info{{"text", Value(std::string(20'000, 'x'))}};
  const BurdenShare request(new RequestOf(kFlooder));
  {
    const Burden::Scope bearing(request.get());
    for (int i = 0; i < 200; ++i) {
      sessions.push_back(backend->createSession(sessionInfo(kFlooder), info, {}));
    }
  }
  send(begin(2), 2, 3000);
  EXPECT_EQ(one("SELECT count(*) FROM telemetry_sessions"), "201");
  EXPECT_EQ(one("SELECT max(id), count(*) < 2500 FROM telemetry_messages"), "3000|1");
}

// As where many rows have become too old at once.
TEST_F(OwnersOfRows, KeepSessionsWithMessagesThoughTheOldestOfTheseHasGone) {
  open();
  send(begin(1), 1, 1500);
  sessions.clear();
  send(begin(2), 2, 1);
  close();
  // The oldest that is left by the first removal, of 1,000.
  OtherConnection(path()).run("DELETE FROM telemetry_messages WHERE id = 1001");
  StoreOptions options;
  options.retention.bytes = 1'000'000;
  open(options);
  send(begin(2), 2, 1);
  EXPECT_EQ(one("SELECT min(id), count(*) FROM telemetry_messages"), "1002|501");
  EXPECT_EQ(one("SELECT count(*) FROM telemetry_sessions WHERE reporter_id = 1"), "1");
}

TEST_F(OwnersOfRows, AreBorneHoweverSomebodyMeddledWithThem) {
  open(optionsOfSmallStore());
  TelemetrySession& session = begin(1);
  send(session, 1, 1000);
  OtherConnection(path()).run(
      "UPDATE row_owners SET bytes = -5;"
      "INSERT OR REPLACE INTO row_owners VALUES "
      "(0, -9223372036854775808, 9223372036854775807, 1, 9223372036854775807),"
      "(1, 5, 1, 1, 1e300), (3, -9223372036854775808, -5, 1, 'text'), (7, 1, 1, 1, 1);"
      "INSERT OR REPLACE INTO owner_bytes VALUES (1, 9223372036854775807), (77, 9e300)");
  for (int round = 0; round < 10; ++round) send(session, 1, 400);
  EXPECT_EQ(one("SELECT max(id), count(*) < 4000 FROM telemetry_messages"), "5000|1");
}

TEST_F(OwnersOfRows, AreForgottenWithRowsThatAreTooOld) {
  StoreOptions options;
  options.now = [this] { return now.load(); };
  options.retention.age = std::chrono::hours(1);
  open(options);
  send(begin(1), 1, 500);
  sessions.clear();
  now += 3'600'000'001;
  send(begin(2), 2, 10);
  now += 3'600'000'001;
  send(begin(2), 2, 1);

  EXPECT_EQ(one("SELECT count(*) FROM telemetry_messages"), "1");
  EXPECT_EQ(owners("0"), std::vector<std::string>{"511|511|2"});
  EXPECT_EQ(one("SELECT sum(bytes) < 3000 FROM owner_bytes"), "1");
}

TEST_F(OwnersOfRows, AreCutBackOnADiskThatIsNearlyFull) {
  StoreOptions options;
  options.retention.percentKeptFree = 100;
  options.retention.bytesInNeed = 2'000'000;
  open(options);
  TelemetrySession& session = begin(1);
  for (int round = 0; round < 20; ++round) send(session, 1, 500, 500 * round);
  close();
  EXPECT_LT(fs::file_size(path()), 4'000'000u);
  EXPECT_EQ(one("SELECT max(id), count(*) > 500 FROM telemetry_messages"), "10000|1");
}

TEST_F(OwnersOfRows, HaveTheirRowsOnANearlyFullDiskWhereTheStoreIsSmall) {
  StoreOptions options;
  options.retention.percentKeptFree = 100;
  options.retention.bytesInNeed = 20'000'000;
  open(options);
  send(begin(1), 1, 3000);
  EXPECT_EQ(one("SELECT count(*) FROM telemetry_messages"), "3000");
}

TEST(StoreDatabaseRoom, IsScarceBelowTheLimit) {
  EXPECT_TRUE(StoreDatabase::isScarce(/*available=*/49, /*bytes=*/1000, /*percent=*/5));
  EXPECT_FALSE(StoreDatabase::isScarce(/*available=*/50, /*bytes=*/1000, /*percent=*/5));
  EXPECT_FALSE(StoreDatabase::isScarce(/*available=*/51, /*bytes=*/1000, /*percent=*/5));
}

// A store of version 1.

constexpr int kOldSessions = 3;
constexpr int kOldMessages = 400;

void makeOldStore(const std::string& path, const char* vfs) {
  fs::create_directories(fs::path(path).parent_path());
  sqlite3* connection = nullptr;
  ASSERT_EQ(sqlite3_open_v2(path.c_str(), &connection,
                            SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, vfs),
            SQLITE_OK);
  const std::string rows =
      "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < ";
  const std::string sql =
      "PRAGMA page_size = 16384; PRAGMA journal_mode = WAL; BEGIN;"
      "CREATE TABLE telemetry_sessions (id INTEGER PRIMARY KEY, reporter_id INTEGER, "
      "hierarchy_token TEXT, session_info TEXT, user_info TEXT, started_at INTEGER, "
      "flushed_at INTEGER, ended_at INTEGER);"
      "CREATE TABLE telemetry_messages (id INTEGER PRIMARY KEY, telemetry_session_id "
      "INTEGER, session_info TEXT, user_info TEXT, category INTEGER, type INTEGER, "
      "payload TEXT, created_at INTEGER);"
      "CREATE TABLE analytics_events (id INTEGER PRIMARY KEY, name TEXT, payload TEXT, "
      "created_at INTEGER);"
      "CREATE TABLE power_events (id INTEGER PRIMARY KEY, client_id INTEGER, name TEXT, "
      "event TEXT, created_at INTEGER, attachment TEXT);"
      "CREATE TABLE analytics_interest (pattern TEXT PRIMARY KEY);"
      "INSERT INTO analytics_interest VALUES ('*');"
      "CREATE TABLE service_status (key TEXT PRIMARY KEY, value);"
      "PRAGMA application_id = 1330860620; PRAGMA user_version = 1;" +
      rows + std::to_string(kOldSessions) +
      ") INSERT INTO telemetry_sessions (id, reporter_id, ended_at) SELECT i, i, i FROM "
      "n;" +
      rows + std::to_string(kOldMessages) +
      ") INSERT INTO telemetry_messages (telemetry_session_id, category, type, payload, "
      "created_at) SELECT 1 + i % 3, 1, 2, json_object('i', i, 'text', hex(zeroblob("
      "200))), 5 FROM n; COMMIT";
  ASSERT_EQ(sqlite3_exec(connection, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK)
      << sqlite3_errmsg(connection);
  sqlite3_close(connection);
}

class StoreOfVersion1 : public OwnersOfRows {
 protected:
  StoreOfVersion1() { FaultVFS::instance().clearPlan(); }
  ~StoreOfVersion1() override { FaultVFS::instance().clearPlan(); }

  // Its rows are very old.
  static constexpr std::chrono::hours kAges{24 * 365 * 100};

  static StoreOptions optionsOfFaults() {
    StoreOptions options;
    options.vfs = FaultVFS::kName;
    options.firstRetry = milliseconds(1);
    options.longestRetry = milliseconds(2);
    options.retention.age = kAges;
    return options;
  }
  /// It is opened, and one message added.
  void useAt(const std::string& place) {
    const auto used = Store::open(place, optionsOfFaults());
    StoreTelemetryBackend itsBackend(used);
    const auto session = itsBackend.createSession(sessionInfo(9), userInfo(), {});
    ASSERT_TRUE(eventually([&] {
      return session->sendMessage(1, 1, payloadOf(9, 0)).succeeded && !flushed(*session);
    }));
    EXPECT_EQ(used->counters().setAside, 0u);
  }
  /// All that it held and the message, in a store of this version.
  static void expectUpgraded(const std::string& place) {
    OtherConnection reader(place);
    EXPECT_EQ(reader.one("PRAGMA integrity_check"), "ok");
    EXPECT_EQ(reader.one("PRAGMA user_version"), "2");
    EXPECT_EQ(reader.one("SELECT count(*), sum(json_extract(payload, '$.i')) FROM "
                         "telemetry_messages WHERE type = 2"),
              "400|80200");
    EXPECT_EQ(reader.one("SELECT count(*) > 0 FROM telemetry_messages WHERE type = 1"),
              "1");
    EXPECT_EQ(reader.one("SELECT count(*) FROM telemetry_sessions WHERE ended_at < 4"),
              "3");
    EXPECT_EQ(reader.rows("SELECT kind, first_id, last_id FROM row_owners WHERE user = "
                          "-1 AND first_id = 1"),
              (std::vector<std::string>{"0|1|400", "3|1|3"}));
  }
};

TEST_F(StoreOfVersion1, IsMadeOneOfThisVersion) {
  makeOldStore(path(), FaultVFS::kName);
  useAt(path());
  expectUpgraded(path());
  EXPECT_EQ(one("SELECT count(*), min(bytes > 100000) FROM owner_bytes WHERE user = -1"),
            "1|1");
}

TEST_F(StoreOfVersion1, LosesItsOldestRowsWhenItIsTheLargestOwner) {
  makeOldStore(path(), /*vfs=*/nullptr);
  StoreOptions options;
  options.retention.bytes = 250'000;
  options.retention.age = kAges;
  // The session's row comes with a message: alone it would leave the newest of the old.
  options.commitWindow = std::chrono::hours(1);
  open(options);
  Awaited<bool> isUsable;
  store->whenKnown([&](bool isKnownUsable) { isUsable.set(isKnownUsable); });
  ASSERT_EQ(isUsable.get(), true);
  TelemetrySession& session = begin(9);
  for (int i = 0; i < 40; ++i) send(session, 9, 1, i);
  EXPECT_EQ(one("SELECT count(*) FROM telemetry_messages WHERE type = 2"), "0");
  EXPECT_EQ(one("SELECT count(*) FROM telemetry_messages WHERE type = 1"), "40");
}

TEST_F(StoreOfVersion1, IsUpgradedThoughAnyCallFails) {
  for (const bool isForEver : {false, true}) {
    FaultPlan plan;
    plan.isForEver = isForEver;
    std::int64_t failed = 1;
    for (plan.after = 0; plan.after < 1000 && failed != 0; ++plan.after) {
      SCOPED_TRACE(plan.after);
      fs::remove_all(directory / "state");
      FaultVFS::instance().clearPlan();
      makeOldStore(path(), FaultVFS::kName);
      FaultVFS::instance().setPlan(plan);
      {
        StoreDatabase database(path(), FaultVFS::kName);
        const StoreDatabase::Result result = database.open();
        failed = FaultVFS::instance().failed();
        if (result) {
          EXPECT_EQ(result->kind, StoreFault::Kind::kTransient);
        }
      }
      FaultVFS::instance().clearPlan();
      useAt(path());
      expectUpgraded(path());
      ASSERT_FALSE(HasFailure());
    }
    EXPECT_EQ(failed, 0) << "opening has more calls than were tried";
  }
}

TEST_F(StoreOfVersion1, IsUpgradedAfterAKillAtAnyCall) {
  FaultPlan plan;
  plan.endsProcess = true;
  bool isKilled = true;
  for (plan.after = 0; plan.after < 1000 && isKilled; ++plan.after) {
    SCOPED_TRACE(plan.after);
    fs::remove_all(directory / "state");
    FaultVFS::instance().clearPlan();
    makeOldStore(path(), FaultVFS::kName);
    const pid_t child = ::fork();
    if (child == 0) {
      FaultVFS::instance().setPlan(plan);
      StoreDatabase database(path(), FaultVFS::kName);
      database.open();
      ::_exit(0);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, /*options=*/0), child);
    isKilled = WIFEXITED(status) && WEXITSTATUS(status) == FaultVFS::kEnded;
    useAt(path());
    expectUpgraded(path());
    ASSERT_FALSE(HasFailure());
  }
  EXPECT_GT(plan.after, 30);
  EXPECT_FALSE(isKilled) << "opening has more calls than were tried";
}

TEST_F(StoreOfVersion1, IsUpgradedAfterAPowerCutAtAnyChange) {
  FaultVFS& vfs = FaultVFS::instance();
  vfs.clearPlan();
  vfs.startRecording();
  makeOldStore(path(), FaultVFS::kName);
  vfs.mark(1);
  useAt(path());
  const std::vector<FileEvent> events = vfs.stopRecording();
  const std::string image = directory / "image";
  PowerCut power(20260131);
  vfs.setSkipsSync(true);
  bool isThere = false;
  int cuts = 0;
  for (std::size_t i = 0; i < events.size(); ++i) {
    power.apply(events[i]);
    isThere |= events[i].kind == FileEvent::Kind::kMark;
    for (int cut = 0; isThere && cut < 10; ++cut, ++cuts) {
      SCOPED_TRACE(i);
      testing_support::writeFiles(image, power.cut());
      useAt(image + "/reports.db");
      expectUpgraded(image + "/reports.db");
      ASSERT_FALSE(HasFailure());
    }
  }
  vfs.setSkipsSync(false);
  EXPECT_GT(cuts, 100);
}

}  // namespace
}  // namespace ostrel
