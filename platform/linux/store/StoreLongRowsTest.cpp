// Rows whose texts are as long as one may be, and longer.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/ValueJSON.h"
#include "platform/fake/RecordingLog.h"
#include "platform/linux/store/StoreAnalyticsSink.h"
#include "platform/linux/store/StoreFaultVFS.h"
#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreTesting.h"
#include "platform/linux/store/StoreWattlogSink.h"

namespace ostrel {
namespace {

using testing::ElementsAre;
using testing::SizeIs;
using testing::StartsWith;

constexpr std::size_t kMost = 1000;
const Dictionary kShort{{"a", Value(1)}};

std::size_t lengthOf(const Dictionary& value) {
  std::string text;
  appendJSON(text, value.value(), JSONLayout::kCompact, JSONStrictness::kLenient,
             /*indent=*/0);
  return text.size();
}

// Of so many bytes as text, of which all but one are half of an escaped character.
Dictionary payloadOf(std::size_t bytes) {
  const std::size_t inner = bytes - std::string_view("{\"t\":\"\"}").size();
  std::string text(inner / 2, '\n');
  if (inner % 2 == 1) text += 'x';
  return {{"t", Value(text)}};
}

class StoreLongRows : public testing::Test {
 protected:
  void SetUp() override { log_ = RecordingLog::install(); }
  void TearDown() override {
    FaultVFS::instance().clearPlan();
    close();
    log_->uninstall();
  }

  // All that comes until a flush shares a commit.
  void open() {
    FaultVFS::instance().clearPlan();
    StoreOptions options;
    options.commitWindow = std::chrono::hours(1);
    options.firstRetry = std::chrono::milliseconds(1);
    options.retention.rowBytes = kMost;
    options.vfs = FaultVFS::kName;
    store_ = Store::open(path(), options);
    backend_ = std::make_unique<StoreTelemetryBackend>(store_);
    session_ = backend_->createSession(sessionInfo(7), userInfo(), {});
    ASSERT_EQ(flushed(*session_), std::nullopt);
  }
  void close() {
    session_.reset();
    backend_.reset();
    store_.reset();
  }
  std::string path() const { return directory_.path() + "/reports.db"; }

  // A row of each kind with texts of so many bytes.
  void addAll(std::size_t bytes) {
    EXPECT_TRUE(session_->sendMessage(1, 1, payloadOf(bytes)).succeeded);
    const std::size_t infos = lengthOf(sessionInfo(7)) + lengthOf(userInfo());
    EXPECT_TRUE(
        backend_
            ->sendOneMessage(sessionInfo(7), userInfo(), 2, 1, payloadOf(bytes - infos))
            .succeeded);
    addEvent(payloadOf(bytes - kName.size()));
    StoreWattlogSink(store_).logRegisteredEvent(
        1, kName, kShort, payloadOf(bytes - kName.size() - lengthOf(kShort)));
  }
  void addEvent(const Dictionary& payload) {
    StoreAnalyticsSink(store_).sendEventLazy(kName, [payload] { return payload; });
  }

  std::vector<std::string> lengths() const {
    return OtherConnection(path()).rows(
        "SELECT ifnull(length(session_info) + length(user_info), 0) + length(payload) "
        "FROM telemetry_messages UNION ALL "
        "SELECT length(name) + length(payload) FROM analytics_events UNION ALL "
        "SELECT length(name) + length(event) + length(attachment) FROM power_events");
  }
  std::string status(const std::string& key) const {
    return OtherConnection(path()).one("SELECT value FROM service_status WHERE key = '" +
                                       key + "'");
  }

  static inline const std::string kName = "an_event";

  TemporaryDirectory directory_;
  std::shared_ptr<RecordingLog> log_;
  std::shared_ptr<Store> store_;
  std::unique_ptr<StoreTelemetryBackend> backend_;
  std::shared_ptr<TelemetrySession> session_;
};

TEST_F(StoreLongRows, AreStoredUpToTheLimit) {
  open();
  addAll(kMost - 1);
  addAll(kMost);
  EXPECT_EQ(flushed(*session_), std::nullopt);
  EXPECT_THAT(lengths(),
              ElementsAre("999", "999", "1000", "1000", "999", "1000", "999", "1000"));
  EXPECT_THAT(log_->texts(LogLevel::kError), testing::IsEmpty());
}

TEST_F(StoreLongRows, BeyondTheLimitAreToldAsLostAndCostNoOther) {
  open();
  addAll(kMost - 1);
  addAll(kMost + 1);
  addAll(kMost);
  EXPECT_EQ(flushed(*session_), std::nullopt);
  EXPECT_THAT(lengths(),
              ElementsAre("999", "999", "1000", "1000", "999", "1000", "999", "1000"));
  EXPECT_EQ(status("lost"), "2");
  EXPECT_EQ(status("dropped_analytics"), "1");
  EXPECT_EQ(status("dropped_power"), "1");
  EXPECT_EQ(store_->counters().written, 8u);
  const auto errors = log_->texts(LogLevel::kError);
  EXPECT_THAT(errors, SizeIs(4));
  EXPECT_THAT(errors, testing::Each("a row is lost: its texts are longer than the 1000 "
                                    "bytes that the store takes of one"));
}

TEST_F(StoreLongRows, AreToldAsLostOnceThoughTheirCommitFails) {
  open();
  addAll(kMost);
  addAll(kMost + 1);
  FaultVFS::instance().setPlan(
      {FaultPlan::Kind::kWrite, SQLITE_IOERR_WRITE, /*after=*/0});
  flushed(*session_);
  ASSERT_TRUE(eventually([&] { return lengths().size() == 4; }));
  EXPECT_EQ(FaultVFS::instance().failed(), 1);
  EXPECT_EQ(flushed(*session_), std::nullopt);
  EXPECT_EQ(status("lost"), "2");
  EXPECT_EQ(status("dropped_analytics"), "1");
  EXPECT_EQ(status("dropped_power"), "1");
}

TEST_F(StoreLongRows, AreNoLongerThanSQLiteTakesThem) {
  sqlite3* connection = nullptr;
  ASSERT_EQ(sqlite3_open(":memory:", &connection), SQLITE_OK);
  const int most = sqlite3_limit(connection, SQLITE_LIMIT_LENGTH, /*newVal=*/-1);
  sqlite3_close(connection);
  constexpr std::size_t kOtherColumns = 1000;
  EXPECT_LE(limits::kStoreRowBytes + kOtherColumns, static_cast<std::size_t>(most));
}

}  // namespace
}  // namespace ostrel
