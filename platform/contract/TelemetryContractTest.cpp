// The telemetry backend and the sinks beside it.
#include <atomic>
#include <thread>

#include "platform/fake/FakeTelemetryBackend.h"
#include "platform/fake/RecordingSinks.h"
#include "platform/linux/store/StoreAnalyticsSink.h"
#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreTesting.h"
#include "platform/linux/store/StoreWattlogSink.h"

namespace ostrel {
namespace {

struct TelemetryInMemory {
  std::size_t messagesOfFirstSession() { return backend.session(1)->messages().size(); }
  std::size_t loneMessages() { return backend.singleMessages().size(); }
  bool isFirstSessionEnded() { return backend.session(1)->isReleased(); }
  std::vector<std::string> analytics() { return analyticsSink.names(); }
  std::size_t powerEvents() { return wattlogSink.logged().size(); }

  const SharedEventLog events = std::make_shared<EventLog>();
  FakeTelemetryBackend backend{events};
  RecordingAnalyticsSink analyticsSink{events};
  RecordingWattlogSink wattlogSink{events};
};

struct TelemetryInTheStore {
  TelemetryInTheStore() {
    Awaited<bool> isUsable;
    store->whenKnown([&](bool answer) { isUsable.set(answer); });
    EXPECT_EQ(isUsable.get(), true);
  }

  std::size_t count(const std::string& sql) {
    return std::stoul(OtherConnection(path).one(sql));
  }
  std::size_t messagesOfFirstSession() {
    return count(
        "SELECT count(*) FROM telemetry_messages WHERE telemetry_session_id = 1");
  }
  std::size_t loneMessages() {
    return count(
        "SELECT count(*) FROM telemetry_messages WHERE telemetry_session_id IS NULL");
  }
  bool isFirstSessionEnded() {
    return count(
               "SELECT count(*) FROM telemetry_sessions WHERE id = 1 AND ended_at "
               "IS NOT NULL") == 1;
  }
  std::vector<std::string> analytics() {
    return OtherConnection(path).rows("SELECT name FROM analytics_events ORDER BY id");
  }
  std::size_t powerEvents() { return count("SELECT count(*) FROM power_events"); }

  TemporaryDirectory directory;
  const std::string path = directory.path() + "/reports.db";
  const std::shared_ptr<Store> store = Store::open(path);
  StoreTelemetryBackend backend{store};
  StoreAnalyticsSink analyticsSink{store};
  StoreWattlogSink wattlogSink{store};
};

template <typename Subject>
class TelemetryBackendContract : public testing::Test {
 protected:
  // Makes a session and waits for its discovery.
  std::shared_ptr<TelemetrySession> makeSession() {
    auto session = subject_.backend.createSession(sessionInfo(7), userInfo(),
                                                  /*frameworksToCheck=*/{});
    Awaited<std::optional<Array>> found;
    session->startConfiguration(
        [&](std::optional<Array> backends) { found.set(std::move(backends)); });
    const auto answer = found.get();
    EXPECT_TRUE(answer && *answer) << "a backend is found";
    EXPECT_EQ(found.times(), 1);
    return session;
  }

  Subject subject_;
};
using Subjects = testing::Types<TelemetryInMemory, TelemetryInTheStore>;
TYPED_TEST_SUITE(TelemetryBackendContract, Subjects);

TYPED_TEST(TelemetryBackendContract, MakesEachTokenAnew) {
  const auto root = this->subject_.backend.makeHierarchyToken(std::nullopt);
  const auto other = this->subject_.backend.makeHierarchyToken(std::nullopt);
  const auto below = this->subject_.backend.makeHierarchyToken(root);
  EXPECT_FALSE(root.empty());
  EXPECT_NE(root, other);
  EXPECT_NE(root, below);
}

TYPED_TEST(TelemetryBackendContract, FindsABackendOnce) { this->makeSession(); }

TYPED_TEST(TelemetryBackendContract, DescribesASessionInOneLine) {
  const std::string description = this->makeSession()->description();
  EXPECT_FALSE(description.empty());
  EXPECT_EQ(description.find('\n'), std::string::npos);
}

TYPED_TEST(TelemetryBackendContract, TakesMessagesAndMakesThemDurableAtAFlush) {
  const auto session = this->makeSession();
  for (std::uint16_t i = 0; i < 10; ++i) {
    const Success sent = session->sendMessage(65535, i, {{"index", Value(i)}});
    EXPECT_TRUE(sent.succeeded);
    EXPECT_FALSE(sent.error);
  }
  EXPECT_FALSE(flushed(*session));
  EXPECT_EQ(this->subject_.messagesOfFirstSession(), 10u);
}

TYPED_TEST(TelemetryBackendContract, CompletesAFlushWhoseSessionIsReleasedAtOnce) {
  auto session = this->makeSession();
  Awaited<std::optional<ErrorObject>> result;
  EXPECT_TRUE(session->sendMessage(9, 0, Dictionary()).succeeded);
  session->flush([&](std::optional<ErrorObject> error) { result.set(error); });
  session.reset();
  const auto error = result.get();
  ASSERT_TRUE(error);
  EXPECT_FALSE(*error);
  EXPECT_EQ(result.times(), 1);
  EXPECT_EQ(this->subject_.messagesOfFirstSession(), 1u);
}

TYPED_TEST(TelemetryBackendContract, FlushesASessionWithoutMessages) {
  EXPECT_FALSE(flushed(*this->makeSession()));
}

TYPED_TEST(TelemetryBackendContract, EndsASessionWhenItsLastReferenceGoes) {
  auto session = this->makeSession();
  auto copy = session;
  session.reset();
  EXPECT_TRUE(copy->sendMessage(1, 2, Dictionary()).succeeded);
  EXPECT_FALSE(flushed(*copy));
  EXPECT_FALSE(this->subject_.isFirstSessionEnded());
  copy.reset();
  EXPECT_TRUE(eventually([&] { return this->subject_.isFirstSessionEnded(); }));
}

TYPED_TEST(TelemetryBackendContract, KeepsSessionsApart) {
  const auto first = this->makeSession();
  const auto second = this->makeSession();
  EXPECT_TRUE(first->sendMessage(1, 1, Dictionary()).succeeded);
  EXPECT_TRUE(second->sendMessage(2, 2, Dictionary()).succeeded);
  EXPECT_TRUE(second->sendMessage(3, 3, Dictionary()).succeeded);
  EXPECT_FALSE(flushed(*first));
  EXPECT_FALSE(flushed(*second));
  EXPECT_EQ(this->subject_.messagesOfFirstSession(), 1u);
}

TYPED_TEST(TelemetryBackendContract, MayBeReleasedBeforeItsDiscoveryEnds) {
  std::atomic<int> answers{0};
  auto session = this->subject_.backend.createSession(sessionInfo(7), userInfo(),
                                                      /*frameworksToCheck=*/{});
  session->startConfiguration([&](const std::optional<Array>&) { ++answers; });
  session.reset();
  this->makeSession();  // Its own answer comes later than that of the first.
  EXPECT_LE(answers, 1);
}

TYPED_TEST(TelemetryBackendContract, SendsAMessageWithoutASession) {
  const Success sent = this->subject_.backend.sendOneMessage(
      sessionInfo(-1), userInfo(), /*category=*/2, /*type=*/3, {{"a", Value(1)}});
  EXPECT_TRUE(sent.succeeded);
  EXPECT_FALSE(sent.error);
  EXPECT_TRUE(eventually([&] { return this->subject_.loneMessages() == 1; }));
}

TYPED_TEST(TelemetryBackendContract, TakesMessagesOfOneSessionFromManyThreads) {
  const auto session = this->makeSession();
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&session] {
      for (int i = 0; i < 100; ++i) {
        EXPECT_TRUE(session->sendMessage(1, 1, {{"i", Value(i)}}).succeeded);
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_FALSE(flushed(*session));
  EXPECT_EQ(this->subject_.messagesOfFirstSession(), 400u);
}

TYPED_TEST(TelemetryBackendContract, KeepsAnalyticsEventsInOrder) {
  this->subject_.analyticsSink.sendEventLazy("first", [] { return Dictionary(); });
  this->subject_.analyticsSink.sendEventLazy("second", [] { return Dictionary(); });
  EXPECT_TRUE(eventually([&] { return this->subject_.analytics().size() == 2; }));
  EXPECT_THAT(this->subject_.analytics(), testing::ElementsAre("first", "second"));
}

TYPED_TEST(TelemetryBackendContract, AsksForAnAnalyticsPayloadOnceAtMost) {
  std::atomic<int> calls{0};
  this->subject_.analyticsSink.sendEventLazy("event", [&] {
    ++calls;
    return Dictionary{{"a", Value(1)}};
  });
  EXPECT_TRUE(eventually([&] { return this->subject_.analytics().size() == 1; }));
  EXPECT_LE(calls, 1);
}

TYPED_TEST(TelemetryBackendContract, TakesPowerEventsWithAndWithoutAttachment) {
  this->subject_.wattlogSink.logRegisteredEvent(
      /*clientID=*/12, "Mediora_Haptics", {{"seconds", Value(1.5)}}, std::nullopt);
  this->subject_.wattlogSink.logRegisteredEvent(
      /*clientID=*/12, "Mediora_Haptics", Dictionary(), Dictionary{{"more", Value(1)}});
  EXPECT_TRUE(eventually([&] { return this->subject_.powerEvents() == 2; }));
}

}  // namespace
}  // namespace ostrel
