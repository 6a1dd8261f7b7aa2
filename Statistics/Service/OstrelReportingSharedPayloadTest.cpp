#include "Statistics/Service/OstrelReportingSharedPayload.h"

#include <gtest/gtest.h>

#include <atomic>
#include <latch>
#include <thread>

#include "Statistics/Service/ServiceTestFixture.h"
#include "platform/fake/CountingAccount.h"

namespace ostrel {
namespace {

const Dictionary kWithBlank{{"a b", 1}, {"c", "d e"}};
const Dictionary kWithoutBlank{{"a_b", 1}, {"c", "d e"}};
constexpr std::int64_t kSessions = 20;

/// A message of one client to several sessions, 1 to `kSessions`.
class SharedPayload : public ServiceTest {
 protected:
  SharedPayload() : client(connect(1)) {}

  void startAll() {
    for (std::int64_t id = 1; id <= kSessions; ++id) createStarted(*client, id);
  }

  void send(const Dictionary& message, const std::optional<ReporterIDs>& reportingIDs) {
    client->sendMessage(chargedTo(account, message), MessageCategory{0x40000007},
                        MessageType{1}, reportingIDs, /*reply=*/nullptr);
    fakes.runUntilIdle();
  }

  std::vector<Dictionary> delivered(std::size_t session) const {
    std::vector<Dictionary> payloads;
    for (const auto& message : fakes.telemetryBackend->session(session)->messages()) {
      payloads.push_back(message.payload);
    }
    return payloads;
  }

  const std::shared_ptr<CountingAccount> account = std::make_shared<CountingAccount>();
  const std::shared_ptr<OstrelReportingServerInstance> client;
};

TEST_F(SharedPayload, IsOneCopyForAllSessionsThatAreStarted) {
  startAll();

  send(kWithBlank, /*reportingIDs=*/std::nullopt);

  const std::uint8_t* const first = delivered(1).at(0).value().data();
  for (std::size_t session = 1; session <= kSessions; ++session) {
    EXPECT_EQ(delivered(session), std::vector<Dictionary>{kWithoutBlank}) << session;
    EXPECT_EQ(delivered(session).at(0).value().data(), first) << session;
  }
  EXPECT_EQ(account->timesCharged(), 2u) << "the message and the copy";
}

TEST_F(SharedPayload, IsOneCopyForAllSessionsOfAList) {
  createStarted(*client, 1);
  create(*client, 2);

  send(kWithBlank, ReporterIDs{ReporterID{1}, ReporterID{2}, ReporterID{1}});

  EXPECT_EQ(delivered(1), (std::vector<Dictionary>{kWithoutBlank, kWithoutBlank}));
  const auto singles = fakes.telemetryBackend->singleMessages();
  ASSERT_EQ(singles.size(), 1u);
  EXPECT_EQ(singles[0].payload, kWithoutBlank);
  EXPECT_EQ(account->timesCharged(), 2u);
}

TEST_F(SharedPayload, IsCopiedForEachMessageAnew) {
  startAll();

  send(kWithBlank, /*reportingIDs=*/std::nullopt);
  send({{"e f", 2}}, /*reportingIDs=*/std::nullopt);

  EXPECT_EQ(delivered(kSessions), (std::vector<Dictionary>{kWithoutBlank, {{"e_f", 2}}}));
  EXPECT_EQ(account->timesCharged(), 4u);
}

TEST_F(SharedPayload, LeavesTheListsAndTheMirrorWhatTheyWere) {
  startAll();

  send(kWithBlank, /*reportingIDs=*/std::nullopt);

  for (std::int64_t id = 1; id <= kSessions; ++id) {
    const auto list = sessionOf(*client, id)->aggregatedPayloadData();
    std::vector<std::string> entries;
    list->lock()->snapshot().forEach(
        [&](ValueView entry) { entries.push_back(description(entry)); });
    EXPECT_EQ(entries, std::vector<std::string>{
                           "{Routing_RouteChange_Start_1: {a_b: 1, c: d e}}"});
  }
  ASSERT_EQ(fakes.analyticsSink->names().size(), static_cast<std::size_t>(kSessions));
  for (std::size_t i = 0; i < kSessions; ++i) {
    EXPECT_EQ(fakes.analyticsSink->payload(i).get("a b"), Value(1)) << "as it was sent";
  }
}

TEST_F(SharedPayload, IsTheMessageWhereNoKeyHasABlank) {
  startAll();

  send(kWithoutBlank, /*reportingIDs=*/std::nullopt);

  EXPECT_EQ(delivered(kSessions), std::vector<Dictionary>{kWithoutBlank});
  EXPECT_EQ(account->timesCharged(), 1u);
}

TEST_F(SharedPayload, IsNotMadeForSessionsThatAreNotThere) {
  send(kWithBlank, ReporterIDs{ReporterID{98}, ReporterID{99}});

  EXPECT_EQ(account->timesCharged(), 1u);
}

/// As `CountingAccount`, for any thread.
class ThreadsAccount final : public PayloadAccount {
 public:
  void charge(std::size_t bytes) noexcept override {
    charged_ += bytes;
    ++timesCharged_;
  }
  void relieve(std::size_t bytes) noexcept override { charged_ -= bytes; }
  bool keep(std::size_t /*bytes*/) noexcept override { return true; }
  void discard(std::size_t /*bytes*/) noexcept override {}

  std::size_t charged() const { return charged_; }
  int timesCharged() const { return timesCharged_; }

 private:
  std::atomic<std::size_t> charged_{0};
  std::atomic<int> timesCharged_{0};
};

TEST(SharedPayloadOfThreads, IsMadeOnceAndGoesWithTheLastOfThem) {
  constexpr int kThreads = 8;
  constexpr int kRounds = 200;
  const auto account = std::make_shared<ThreadsAccount>();
  for (int round = 0; round < kRounds; ++round) {
    auto shared = std::make_shared<OstrelReportingSharedPayload>();
    std::latch begin(kThreads);
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
      threads.emplace_back(
          [&begin, shared, message = chargedTo(account, kWithBlank)]() mutable {
            begin.arrive_and_wait();
            const Dictionary payload = shared->of(message);
            EXPECT_EQ(payload, kWithoutBlank);
            shared.reset();
          });
    }
    shared.reset();
    for (std::thread& thread : threads) thread.join();
    threads.clear();
    ASSERT_EQ(account->timesCharged(), (round + 1) * (kThreads + 1));
    ASSERT_EQ(account->charged(), 0u);
  }
}

}  // namespace
}  // namespace ostrel
