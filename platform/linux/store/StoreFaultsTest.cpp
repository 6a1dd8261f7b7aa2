// Faults of the file and of the file system below it.
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <fstream>
#include <thread>

#include "platform/Logging.h"
#include "platform/fake/RecordingLog.h"
#include "platform/linux/SmallFileSystem.h"
#include "platform/linux/store/StoreAnalyticsSink.h"
#include "platform/linux/store/StoreDatabase.h"
#include "platform/linux/store/StoreFaultVFS.h"
#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreTesting.h"
#include "platform/linux/store/StoreWattlogSink.h"
#include "platform/linux/store/StoreWriter.h"

namespace ostrel {
namespace {

namespace fs = std::filesystem;
using std::chrono::milliseconds;
using SteadyClock = std::chrono::steady_clock;

StoreOptions quickOptions() {
  StoreOptions options;
  options.commitWindow = milliseconds(5);
  options.firstRetry = milliseconds(5);
  options.longestRetry = milliseconds(20);
  return options;
}

class StoreFaults : public ::testing::Test {
 protected:
  void SetUp() override { log_ = RecordingLog::install(); }
  void TearDown() override {
    FaultVFS::instance().clearPlan();
    close();
    log_->uninstall();
  }

  std::string stateDirectory() const { return directory_.path() + "/state"; }
  std::string path() const { return stateDirectory() + "/reports.db"; }

  void open() { open(quickOptions()); }
  void open(const StoreOptions& options) {
    store_ = Store::open(path(), options);
    backend_ = std::make_unique<StoreTelemetryBackend>(store_);
  }
  void close() {
    session_.reset();
    backend_.reset();
    store_.reset();
  }

  void makeSession() {
    session_ = backend_->createSession(sessionInfo(7), userInfo(), {});
  }

  Success send(int number) { return session_->sendMessage(1, 1, {{"i", Value(number)}}); }

  // Sends until the store takes it.
  bool sendUntilAccepted(int number) {
    return eventually([&] { return send(number).succeeded; });
  }

  // Whether discovery finds the store.
  bool isFound() {
    Awaited<bool> found;
    const auto session = backend_->createSession(sessionInfo(1), userInfo(), {});
    session->startConfiguration(
        [&](std::optional<Array> backends) { found.set(backends.has_value()); });
    return found.get().value_or(false);
  }

  std::vector<std::string> numbers() {
    return OtherConnection(path()).rows(
        "SELECT json_extract(payload, '$.i') FROM telemetry_messages ORDER BY id");
  }

  std::vector<std::string> setAside() const {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(stateDirectory())) {
      const std::string name = entry.path().filename();
      if (name.starts_with("reports.db.damaged-") && !name.ends_with("-wal")) {
        names.push_back(name);
      }
    }
    return names;
  }

  // A store with one session and one message, closed.
  void makeSoundStore() {
    open();
    makeSession();
    ASSERT_TRUE(send(1).succeeded);
    close();
  }

  // The store begins anew within 2 s, whatever stands at its place.
  void expectNewStore(std::string_view reason) {
    const auto begin = SteadyClock::now();
    open();
    EXPECT_TRUE(isFound());
    EXPECT_LT(SteadyClock::now() - begin, std::chrono::seconds(2));
    makeSession();
    EXPECT_TRUE(send(2).succeeded);
    EXPECT_EQ(flushed(*session_), std::nullopt);
    EXPECT_EQ(numbers(), std::vector<std::string>{"2"});
    EXPECT_EQ(setAside().size(), 1u);
    EXPECT_EQ(store_->counters().setAside, 1u);
    const auto texts = log_->texts(LogLevel::kError);
    ASSERT_EQ(texts.size(), 1u);
    EXPECT_THAT(texts[0], ::testing::StartsWith("set the store " + path() + " aside as"));
    EXPECT_THAT(texts[0], ::testing::HasSubstr(std::string(reason)));
  }

  // A run of the store under the plan writes each accepted message once, in order.
  void runUnder(const FaultPlan& plan, std::int64_t& failed) {
    StoreOptions options = quickOptions();
    options.vfs = FaultVFS::kName;
    options.firstRetry = milliseconds(1);
    options.longestRetry = milliseconds(2);
    fs::remove_all(stateDirectory());
    FaultVFS& vfs = FaultVFS::instance();
    vfs.setPlan(plan);
    open(options);
    makeSession();
    std::vector<std::string> accepted;
    for (int i = 0; i < 12; ++i) {
      if (send(i).succeeded) accepted.push_back(std::to_string(i));
      if (i % 4 == 3) flushed(*session_);
    }
    failed = vfs.failed();
    vfs.clearPlan();
    ASSERT_TRUE(sendUntilAccepted(99));
    accepted.push_back("99");
    ASSERT_TRUE(eventually([&] { return !flushed(*session_); }));
    close();
    ASSERT_EQ(numbers(), accepted);
    OtherConnection reader(path());
    ASSERT_EQ(reader.one("SELECT count(*) FROM telemetry_sessions WHERE ended_at NOT "
                         "NULL AND flushed_at NOT NULL"),
              "1");
    ASSERT_EQ(reader.one("PRAGMA integrity_check"), "ok");
    ASSERT_TRUE(setAside().empty())
        << ::testing::PrintToString(log_->texts(LogLevel::kError));
  }

  void overwrite(std::size_t offset, const std::string& bytes) {
    std::fstream file(path(), std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(static_cast<std::streamoff>(offset));
    file << bytes;
    ASSERT_TRUE(file.good());
  }

  TemporaryDirectory directory_;
  std::shared_ptr<RecordingLog> log_;
  std::shared_ptr<Store> store_;
  std::unique_ptr<StoreTelemetryBackend> backend_;
  std::shared_ptr<TelemetrySession> session_;
};

TEST_F(StoreFaults, BeginsInAnEmptyFile) {
  fs::create_directories(stateDirectory());
  std::ofstream(path()).close();
  open();
  EXPECT_TRUE(isFound());
  EXPECT_TRUE(setAside().empty());
}

TEST_F(StoreFaults, SetsAsideAFileThatIsNoDatabase) {
  fs::create_directories(stateDirectory());
  std::ofstream(path()) << "this is a text, and a rather long one at that";
  expectNewStore("it is not a database");
}

TEST_F(StoreFaults, SetsAsideAFileOfOneByte) {
  fs::create_directories(stateDirectory());
  std::ofstream(path()) << "S";
  expectNewStore("it is not a database");
}

TEST_F(StoreFaults, SetsAsideADamagedHeader) {
  makeSoundStore();
  overwrite(0, "XXXX");
  expectNewStore("it is not a database");
}

TEST_F(StoreFaults, SetsAsideAnImpossiblePageSize) {
  makeSoundStore();
  overwrite(16, std::string("\x12\x34", 2));
  expectNewStore("file is not a database");
}

TEST_F(StoreFaults, SetsAsideATruncatedFile) {
  makeSoundStore();
  fs::resize_file(path(), fs::file_size(path()) / 2 + 100);
  expectNewStore("malformed");
}

TEST_F(StoreFaults, SetsAsideAFileCutAfterItsHeader) {
  makeSoundStore();
  fs::resize_file(path(), 100);
  expectNewStore("");
}

TEST_F(StoreFaults, SetsAsidePagesOfZeros) {
  makeSoundStore();
  overwrite(16384, std::string(3 * 16384, '\0'));
  expectNewStore("");
}

TEST_F(StoreFaults, SetsAsideAPageOfNoise) {
  makeSoundStore();
  std::string noise(16384, '\0');
  std::mt19937 random(1);
  for (char& c : noise) c = static_cast<char>(random());
  overwrite(16384, noise);
  expectNewStore("");
}

TEST_F(StoreFaults, SetsAsideADirectoryInPlaceOfTheFile) {
  fs::create_directories(path() + "/inside");
  expectNewStore("it is not a regular file");
}

TEST_F(StoreFaults, SetsAsideALinkInPlaceOfTheFile) {
  fs::create_directories(stateDirectory());
  std::ofstream(directory_.path() + "/victim") << "untouched";
  fs::create_symlink(directory_.path() + "/victim", path());
  expectNewStore("it is not a regular file");
  std::string text;
  std::ifstream(directory_.path() + "/victim") >> text;
  EXPECT_EQ(text, "untouched");
}

TEST_F(StoreFaults, SetsAsideAFIFOInPlaceOfTheFile) {
  fs::create_directories(stateDirectory());
  ASSERT_EQ(::mkfifo(path().c_str(), 0600), 0);
  expectNewStore("it is not a regular file");
}

TEST_F(StoreFaults, SetsAsideADatabaseOfSomethingElse) {
  fs::create_directories(stateDirectory());
  OtherConnection(path()).run("CREATE TABLE songs (title TEXT)");
  expectNewStore("it holds something else");
}

TEST_F(StoreFaults, SetsAsideAStoreWithOtherTables) {
  makeSoundStore();
  OtherConnection(path()).run("ALTER TABLE telemetry_messages DROP COLUMN payload");
  expectNewStore("its tables are others");
}

TEST_F(StoreFaults, StandsAForeignLog) {
  makeSoundStore();
  std::ofstream(path() + "-wal") << std::string(100'000, 'w');
  std::ofstream(path() + "-shm") << std::string(32'768, 's');
  open();
  EXPECT_TRUE(isFound());
  makeSession();
  EXPECT_TRUE(send(2).succeeded);
  EXPECT_EQ(flushed(*session_), std::nullopt);
  EXPECT_EQ(numbers(), (std::vector<std::string>{"1", "2"}));
}

TEST_F(StoreFaults, LeavesAStoreOfALaterVersionUntouched) {
  makeSoundStore();
  OtherConnection(path()).run("PRAGMA user_version = 3");
  std::ifstream before(path(), std::ios::binary);
  const std::string bytes((std::istreambuf_iterator<char>(before)), {});
  open();
  EXPECT_FALSE(isFound());
  makeSession();
  const Success result = send(2);
  EXPECT_FALSE(result.succeeded);
  EXPECT_THAT(result.error->description, ::testing::HasSubstr("version 3"));
  close();
  std::ifstream after(path(), std::ios::binary);
  EXPECT_TRUE(bytes == std::string((std::istreambuf_iterator<char>(after)), {}));
  EXPECT_EQ(log_->texts(LogLevel::kError).front(),
            "the store cannot be used: the store has version 3, written by a later "
            "service; this one knows 2");
}

TEST_F(StoreFaults, KeepsOnlyTwoFilesSetAside) {
  for (int i = 0; i < 4; ++i) {
    fs::create_directories(stateDirectory());
    fs::remove(path());
    std::ofstream(path()) << "damaged " << i;
    open();
    EXPECT_TRUE(isFound());
    close();
  }
  EXPECT_EQ(setAside().size(), 2u);
}

TEST_F(StoreFaults, BeginsAnewWhenTheFileIsDamagedWhileItRuns) {
  open();
  makeSession();
  ASSERT_TRUE(send(1).succeeded);
  ASSERT_EQ(flushed(*session_), std::nullopt);
  OtherConnection(path()).run("PRAGMA wal_checkpoint(TRUNCATE)");
  overwrite(0, std::string(200'000, 'X'));
  OtherConnection(path()).run("SELECT 1");
  ASSERT_TRUE(send(2).succeeded);
  ASSERT_TRUE(eventually([&] { return store_->counters().setAside == 1; }));
  ASSERT_TRUE(sendUntilAccepted(3));
  EXPECT_EQ(flushed(*session_), std::nullopt);
  session_.reset();
  close();
  OtherConnection reader(path());
  EXPECT_EQ(reader.rows("SELECT reporter_id, ended_at IS NULL FROM telemetry_sessions"),
            std::vector<std::string>{"7|0"});
  EXPECT_EQ(numbers().back(), "3");
}

TEST_F(StoreFaults, BeginsAnewWhenItsDirectoryIsRemoved) {
  open();
  makeSession();
  ASSERT_TRUE(send(1).succeeded);
  ASSERT_EQ(flushed(*session_), std::nullopt);
  fs::remove_all(stateDirectory());
  ASSERT_TRUE(send(2).succeeded);
  EXPECT_EQ(flushed(*session_), std::nullopt);
  EXPECT_EQ(numbers(), std::vector<std::string>{"2"});
  OtherConnection reader(path());
  EXPECT_EQ(reader.one("SELECT reporter_id FROM telemetry_sessions"), "7");
}

TEST_F(StoreFaults, RefusesWhileAnotherHoldsTheLockAndRecovers) {
  open();
  makeSession();
  ASSERT_TRUE(send(1).succeeded);
  ASSERT_EQ(flushed(*session_), std::nullopt);
  {
    OtherConnection other(path());
    other.run("BEGIN IMMEDIATE");
    ASSERT_TRUE(send(2).succeeded);
    ASSERT_TRUE(eventually([&] { return !send(3).succeeded; }));
    const Success refused = send(4);
    ASSERT_TRUE(refused.error);
    EXPECT_EQ(refused.error->domain, kOstrelErrorDomain);
    EXPECT_THAT(refused.error->description, ::testing::HasSubstr("locked"));
    EXPECT_FALSE(isFound());
    EXPECT_TRUE(flushed(*session_));
    other.run("ROLLBACK");
  }
  ASSERT_TRUE(sendUntilAccepted(5));
  EXPECT_EQ(flushed(*session_), std::nullopt);
  const auto all = numbers();
  EXPECT_EQ(all.front(), "1");
  EXPECT_EQ(all[1], "2");
  EXPECT_EQ(all.back(), "5");
  EXPECT_EQ(std::count(all.begin(), all.end(), "4"), 0);
  EXPECT_TRUE(log_->contains(LogLevel::kDefault, processLogScope.code(),
                             "the store can be used again"));
}

TEST_F(StoreFaults, RefusesOnAFullDiskAndRecovers) {
  StoreOptions options = quickOptions();
  options.vfs = FaultVFS::kName;
  FaultVFS::instance().clearPlan();
  open(options);
  makeSession();
  ASSERT_TRUE(send(1).succeeded);
  ASSERT_EQ(flushed(*session_), std::nullopt);
  FaultVFS::instance().setPlan({FaultPlan::Kind::kWrite, SQLITE_FULL, /*after=*/0,
                                /*isForEver=*/true});
  ASSERT_TRUE(send(2).succeeded);
  ASSERT_TRUE(eventually([&] { return !send(3).succeeded; }));
  EXPECT_THAT(send(4).error->description, ::testing::HasSubstr("full"));
  EXPECT_EQ(flushed(*session_)->description, send(5).error->description);
  FaultVFS::instance().clearPlan();
  ASSERT_TRUE(sendUntilAccepted(6));
  EXPECT_EQ(flushed(*session_), std::nullopt);
  const auto all = numbers();
  EXPECT_EQ(all.front(), "1");
  EXPECT_EQ(all[1], "2");
  EXPECT_EQ(all.back(), "6");
  EXPECT_EQ(OtherConnection(path()).one("SELECT value > 0 FROM service_status WHERE key "
                                        "= 'refused'"),
            "1");
}

// Ends and flushes insert nothing by which their commit could be told.
TEST_F(StoreFaults, KeepsTheEndOfASessionThoughItsCommitFailed) {
  StoreOptions options = quickOptions();
  options.vfs = FaultVFS::kName;
  for (const int code : {SQLITE_FULL, SQLITE_IOERR_WRITE}) {
    FaultVFS::instance().clearPlan();
    open(options);
    makeSession();
    ASSERT_TRUE(send(1).succeeded);
    ASSERT_EQ(flushed(*session_), std::nullopt);
    FaultVFS::instance().setPlan({FaultPlan::Kind::kWrite, code, /*after=*/0});
    session_.reset();
    ASSERT_TRUE(eventually([&] { return FaultVFS::instance().failed() == 1; }));
    close();
    EXPECT_EQ(OtherConnection(path()).one(
                  "SELECT count(*) FROM telemetry_sessions WHERE ended_at IS NULL"),
              "0")
        << code;
  }
}

TEST_F(StoreFaults, GivesUpTheOldestInALongFaultAndCountsThem) {
  StoreOptions options = quickOptions();
  options.vfs = FaultVFS::kName;
  FaultVFS::instance().setPlan({FaultPlan::Kind::kAny, SQLITE_FULL, /*after=*/0,
                                /*isForEver=*/true});
  open(options);
  for (int i = 0; i < 40'000; ++i) {
    backend_->createSession(sessionInfo(i), userInfo(), {}).reset();
  }
  EXPECT_TRUE(eventually([&] { return store_->counters().lost > 60'000; }));
  FaultVFS::instance().clearPlan();
  EXPECT_TRUE(eventually([&] { return isFound(); }));
  close();
  EXPECT_EQ(OtherConnection(path()).one(
                "SELECT count(*) > 5000, max(reporter_id) FROM telemetry_sessions WHERE "
                "ended_at NOT NULL"),
            "1|39999");
}

// From the n-th call on all fail: the commit among them, which may have been made.
TEST_F(StoreFaults, HasNothingTwiceThoughPartOfACommitWasGivenUp) {
  FaultVFS& vfs = FaultVFS::instance();
  const auto messageIn = [](int number) {
    StoreBatch batch;
    batch.push_back({/*time=*/1, LoneMessage{Dictionary(), Dictionary(), 1, 1,
                                             Dictionary{{"i", Value(number)}}}});
    return batch;
  };
  FaultPlan plan;
  plan.isForEver = true;
  std::int64_t failed = 1;
  int timesMade = 0;
  for (plan.after = 0; plan.after < 1000 && failed != 0; ++plan.after) {
    SCOPED_TRACE(plan.after);
    vfs.clearPlan();
    fs::remove_all(stateDirectory());
    StoreCounters counters;
    StoreWriter writer(path(), FaultVFS::kName, StoreRetention(), counters);
    writer.recover();
    ASSERT_FALSE(writer.fault());
    vfs.setPlan(plan);
    std::vector<StoreBatch> batches;
    for (int i = 1; i <= 2; ++i) batches.push_back(messageIn(i));
    writer.add(std::move(batches));
    writer.commit();
    failed = vfs.failed();
    if (writer.fault()) writer.keepAtMost(1);
    vfs.clearPlan();
    writer.recover();
    writer.commit();
    writer.close();
    const std::vector<std::string> all = numbers();
    if (all.size() == 2 && failed != 0) ++timesMade;
    EXPECT_EQ(all, all.size() == 2 ? (std::vector<std::string>{"1", "2"})
                                   : std::vector<std::string>{"2"});
  }
  EXPECT_EQ(failed, 0) << "a commit has more calls than were tried";
  EXPECT_GT(timesMade, 0);
}

// The n-th call below the store fails.
class StoreFailingCalls : public StoreFaults,
                          public ::testing::WithParamInterface<bool> {};

TEST_P(StoreFailingCalls, LoseNothingThatWasAccepted) {
  FaultPlan plan;
  plan.isForEver = GetParam();
  std::int64_t failed = 1;
  for (plan.after = 0; plan.after < 1000 && failed != 0; ++plan.after) {
    SCOPED_TRACE(plan.after);
    plan.code = plan.after % 2 == 0 ? SQLITE_FULL : SQLITE_IOERR_WRITE;
    runUnder(plan, failed);
    ASSERT_FALSE(HasFailure());
  }
  EXPECT_EQ(failed, 0) << "the run has more calls than were tried";
}

INSTANTIATE_TEST_SUITE_P(Once, StoreFailingCalls, ::testing::Values(false));
INSTANTIATE_TEST_SUITE_P(ForEver, StoreFailingCalls, ::testing::Values(true));

// Of more pages than SQLite reads to open it, so that the check of the content reads too.
TEST_F(StoreFaults, DoesNotTakeAPageThatCannotBeReadForDamage) {
  open();
  makeSession();
  const Dictionary payload{{"text", Value(std::string(100'000, 'x'))}};
  for (int i = 0; i < 10; ++i)
    ASSERT_TRUE(session_->sendMessage(1, 1, payload).succeeded);
  close();
  FaultVFS& vfs = FaultVFS::instance();
  int failures = 0;
  int failuresOfTheCheck = 0;
  FaultPlan plan;
  for (plan.after = 0; plan.after < 1000; ++plan.after) {
    SCOPED_TRACE(plan.after);
    vfs.setPlan(plan);
    StoreDatabase database(path(), FaultVFS::kName);
    const StoreDatabase::Result result = database.open();
    if (vfs.failed() == 0) break;
    if (!result) continue;
    ++failures;
    EXPECT_EQ(result->kind, StoreFault::Kind::kTransient) << result->description;
    const bool isOfTheCheck = result->description.starts_with("cannot check in");
    if (isOfTheCheck) ++failuresOfTheCheck;
  }
  EXPECT_LT(plan.after, 1000) << "opening has more calls than were tried";
  EXPECT_GT(failures, failuresOfTheCheck);
  EXPECT_GE(failuresOfTheCheck, 1);
}

// The second fault may hit the recovery from the first.
TEST_F(StoreFaults, LosesNothingToTwoFailingCalls) {
  const char* text = std::getenv("OSTREL_FAULT_PAIRS");
  const int pairs = text != nullptr ? std::atoi(text) : 60;
  std::mt19937 random(20260131);
  for (int pair = 0; pair < pairs; ++pair) {
    SCOPED_TRACE(pair);
    FaultPlan plan;
    plan.after = random() % 120;
    plan.second = 1 + random() % (random() % 2 == 0 ? 8 : 80);
    plan.code = pair % 2 == 0 ? SQLITE_FULL : SQLITE_IOERR_WRITE;
    std::int64_t failed = 0;
    runUnder(plan, failed);
    ASSERT_FALSE(HasFailure());
  }
}

// The steps of these tests return 0, or the number of the one that failed.
using testing_support::SmallFileSystem;

int fillTheDisk(const std::string& place) {
  SmallFileSystem disk(place, "1m");
  const auto store = Store::open(place + "/reports.db", quickOptions());
  StoreTelemetryBackend backend(store);
  const auto session = backend.createSession(sessionInfo(7), userInfo(), {});
  const Dictionary payload{{"text", Value(std::string(10'000, 'x'))}};
  Success success{/*succeeded=*/true, std::nullopt};
  int accepted = 0;
  for (; success.succeeded && accepted < 10'000; ++accepted) {
    success = session->sendMessage(1, 1, payload);
    std::this_thread::sleep_for(milliseconds(1));
  }
  if (success.succeeded) return 1;
  if (success.error->description.find("full") == std::string::npos) return 2;
  if (!disk.resize("64m")) return 3;
  if (!eventually([&] { return session->sendMessage(1, 1, payload).succeeded; })) {
    return 4;
  }
  if (flushed(*session)) return 5;
  const auto count = OtherConnection(place + "/reports.db")
                         .one("SELECT count(*) FROM telemetry_messages");
  return std::stoul(count) == store->counters().accepted ? 0 : 6;
}

TEST(StoreOnASmallFileSystem, RefusesWhenTheDiskIsFullAndGoesOnWhenItIsNot) {
  TemporaryDirectory place;
  testing_support::expectInChildWithSmallFileSystem(
      [&] { return fillTheDisk(place.path()); });
}

int makeItReadOnly(const std::string& place) {
  SmallFileSystem disk(place, "1m");
  const std::string path = place + "/reports.db";
  { const auto store = Store::open(path, quickOptions()); }
  if (!disk.makeReadOnly("1m")) return 1;
  const auto store = Store::open(path, quickOptions());
  StoreTelemetryBackend backend(store);
  const auto session = backend.createSession(sessionInfo(7), userInfo(), {});
  if (!eventually([&] { return !session->sendMessage(1, 1, {}).succeeded; })) return 2;
  const Success refused = session->sendMessage(1, 1, {});
  if (refused.error->description.find("Read-only") == std::string::npos) return 3;
  if (!disk.resize("1m")) return 4;
  if (!eventually([&] { return session->sendMessage(1, 2, {}).succeeded; })) return 5;
  if (flushed(*session)) return 6;
  return OtherConnection(path).one(
             "SELECT count(*) > 0 FROM telemetry_messages WHERE type = 2") == "1"
             ? 0
             : 7;
}

TEST(StoreOnASmallFileSystem, RefusesWhileItIsReadOnlyAndGoesOnAfterwards) {
  TemporaryDirectory place;
  testing_support::expectInChildWithSmallFileSystem(
      [&] { return makeItReadOnly(place.path()); });
}

}  // namespace
}  // namespace ostrel
