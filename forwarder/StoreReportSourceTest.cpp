// On stores that the service's own code writes.
#include "forwarder/StoreReportSource.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreTesting.h"

namespace ostrel {
namespace {

constexpr const char* kToken = "00-0123456789abcdef0123456789abcdef-00f067aa0ba902b7-01";
constexpr BatchSize kAll{1000, 1 << 20};

Dictionary infoOf(std::int64_t reporterID) {
  return {{kTelvarSessionInfoSessionID, Value(reporterID)},
          {kTelvarSessionInfoHierarchyToken, Value(kToken)}};
}

class StoreReportSourceTest : public ::testing::Test {
 protected:
  std::string path() const { return directory_.path() + "/state/reports.db"; }

  void open() {
    std::int64_t ticks = 0;
    StoreOptions options;
    options.now = [ticks]() mutable { return 1000 * ++ticks; };
    store_ = Store::open(path(), std::move(options));
    backend_ = std::make_unique<StoreTelemetryBackend>(store_);
  }
  void close() {
    backend_.reset();
    store_.reset();
  }
  std::shared_ptr<TelemetrySession> makeSession() {
    return backend_->createSession(infoOf(77), userInfo(), {});
  }
  /// So many messages of one session, durable.
  void send(int count, const std::string& text = "x") {
    auto session = makeSession();
    for (int i = 0; i < count; ++i) {
      EXPECT_TRUE(
          session->sendMessage(2, 7, Dictionary{{"text", Value(text)}}).succeeded);
    }
    EXPECT_EQ(flushed(*session), std::nullopt);
  }
  ReportBatch read(std::int64_t after, BatchSize most) {
    auto batch = StoreReportSource(path()).reportsAfter(after, most);
    EXPECT_TRUE(batch.value) << batch.error->description;
    return batch.value ? *batch.value : ReportBatch();
  }

  TemporaryDirectory directory_;
  std::shared_ptr<Store> store_;
  std::unique_ptr<StoreTelemetryBackend> backend_;
};

TEST_F(StoreReportSourceTest, GivesAMessageOfASession) {
  open();
  send(1);
  const ReportBatch batch = read(0, kAll);
  EXPECT_EQ(batch.newestID, 1);
  ASSERT_EQ(batch.reports.size(), 1u);
  const Report& report = batch.reports[0];
  EXPECT_EQ(report.id, 1);
  EXPECT_EQ(report.sessionID, 1);
  EXPECT_EQ(report.reporterID, 77);
  EXPECT_EQ(report.category, 2);
  EXPECT_EQ(report.type, 7);
  EXPECT_EQ(report.createdAt, 2000);
  EXPECT_EQ(report.hierarchyToken, kToken);
  ASSERT_TRUE(report.payload.object());
  EXPECT_EQ(*find(*report.payload.object(), "text")->string(), "x");
  ASSERT_TRUE(report.userInfo.object());
  EXPECT_EQ(*find(*report.userInfo.object(), kTelvarUserInfoClientName)->string(),
            "com.orbisk.ostrel");
}

TEST_F(StoreReportSourceTest, GivesAMessageWithoutASession) {
  open();
  EXPECT_TRUE(
      backend_->sendOneMessage(infoOf(-1), userInfo(), 9, 0, Dictionary()).succeeded);
  close();
  const ReportBatch batch = read(0, kAll);
  ASSERT_EQ(batch.reports.size(), 1u);
  const Report& report = batch.reports[0];
  EXPECT_EQ(report.sessionID, std::nullopt);
  EXPECT_EQ(report.reporterID, -1);
  EXPECT_EQ(report.hierarchyToken, kToken);
  EXPECT_TRUE(report.userInfo.object());
}

TEST_F(StoreReportSourceTest, GivesWhatFollows) {
  open();
  send(5);
  const ReportBatch batch = read(3, kAll);
  ASSERT_EQ(batch.reports.size(), 2u);
  EXPECT_EQ(batch.reports[0].id, 4);
  EXPECT_EQ(batch.newestID, 5);
  EXPECT_TRUE(read(5, kAll).reports.empty());
}

TEST_F(StoreReportSourceTest, GivesNoMoreThanItIsAskedFor) {
  open();
  send(10, std::string(1000, 'x'));
  EXPECT_EQ(read(0, {3, 1 << 20}).reports.size(), 3u);
  const std::size_t few = read(0, {1000, 2500}).reports.size();
  EXPECT_EQ(few, 3u);
  EXPECT_EQ(read(0, {1000, 1}).reports.size(), 1u);
}

TEST_F(StoreReportSourceTest, GivesNothingWhereThereIsNoStore) {
  EXPECT_EQ(read(0, kAll).store, "");
}

TEST_F(StoreReportSourceTest, GivesNothingBeforeTheFirstCommit) {
  open();
  testing_support::eventually([&] { return std::filesystem::exists(path()); });
  close();
  EXPECT_EQ(read(0, kAll).store, "");
}

TEST_F(StoreReportSourceTest, KnowsAStoreAgain) {
  open();
  send(1);
  const std::string name = read(0, kAll).store;
  EXPECT_EQ(name.size(), 32u);
  close();
  EXPECT_EQ(read(0, kAll).store, name);
  open();
  send(1);
  EXPECT_EQ(read(0, kAll).store, name);
}

TEST_F(StoreReportSourceTest, TellsAStoreThatWasMadeAnewFromTheOneBefore) {
  open();
  send(1);
  const std::string before = read(0, kAll).store;
  close();
  std::filesystem::remove_all(directory_.path() + "/state");
  open();
  send(1);
  EXPECT_EQ(read(0, kAll).store.size(), 32u);
  EXPECT_NE(read(0, kAll).store, before);
}

TEST_F(StoreReportSourceTest, NamesAStoreThatHadNoNameWithItsNextCommit) {
  open();
  send(1);
  close();
  OtherConnection(path()).run("DELETE FROM service_status WHERE key = 'store_id'");
  EXPECT_EQ(read(0, kAll).store, "");
  open();
  send(1);
  EXPECT_EQ(read(0, kAll).store.size(), 32u);
  EXPECT_EQ(read(0, kAll).reports.size(), 2u);
}

TEST_F(StoreReportSourceTest, ChangesNothingInTheStore) {
  open();
  send(1);
  close();
  OtherConnection other(path());
  const auto before = other.one("PRAGMA data_version");
  read(0, kAll);
  EXPECT_EQ(other.one("PRAGMA data_version"), before);
}

TEST_F(StoreReportSourceTest, SaysWhyAStoreCannotBeRead) {
  std::filesystem::create_directories(directory_.path() + "/state");
  directory_.write("state/reports.db", std::string(8192, 'x'));
  const auto batch = StoreReportSource(path()).reportsAfter(0, kAll);
  ASSERT_TRUE(batch.error);
  EXPECT_NE(batch.error->description.find("cannot be read"), std::string::npos);
}

TEST_F(StoreReportSourceTest, GivesTextThatIsNoJSONAsText) {
  open();
  send(1);
  OtherConnection(path()).run("UPDATE telemetry_messages SET payload = '{broken'");
  EXPECT_EQ(*read(0, kAll).reports.at(0).payload.string(), "{broken");
}

}  // namespace
}  // namespace ostrel
