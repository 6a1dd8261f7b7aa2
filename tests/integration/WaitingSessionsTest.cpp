// Sessions that wait for a backend that never answers, on the real queues, timers
// and clock.
#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <iterator>
#include <memory>
#include <thread>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingServiceDelegate.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/OwnProcess.h"
#include "platform/linux/RealQueues.h"
#include "platform/linux/ThreadPoolWorkQueues.h"

namespace ostrel {
namespace {

using std::chrono::steady_clock;

constexpr int kSessions = 10'000;
constexpr std::size_t kMostThreads = 16;
// What the sessions' own steps may take; many times that where the thread sanitizer
// watches them.
#ifdef OSTREL_SANITIZED
constexpr std::chrono::milliseconds kLateness{10'000};
#else
constexpr std::chrono::milliseconds kLateness{1500};
#endif

class WaitingSessions : public testing::Test {
 protected:
  WaitingSessions() {
    fakes.telemetryBackend->setDiscovery(FakeDiscovery::held());
    platform = fakes.platform();
    queues = testing_support::putOnRealQueues(platform);
    root = OstrelReportingServiceDelegate::init(platform);
  }

  std::shared_ptr<OstrelReportingServerInstance> connect(ProcessID pid) {
    connection = fakes.listener->accept(pid);
    return std::static_pointer_cast<OstrelReportingServerInstance>(
        connection->exportedObject());
  }

  /// Whether each session's start has come to its end, told by a message's reply
  /// that comes behind it.
  static std::future<void> whenAllStarted(
      const std::vector<std::shared_ptr<OstrelReportingSession>>& sessions) {
    auto left = std::make_shared<std::atomic<std::size_t>>(sessions.size());
    auto all = std::make_shared<std::promise<void>>();
    for (const auto& session : sessions) {
      session->sendMessage(Dictionary{{"a", 1}}, MessageCategory{1}, MessageType{1},
                           [left, all](const std::optional<ErrorObject>& error) {
                             EXPECT_EQ(error->description, "No valid TelvarSession");
                             if (left->fetch_sub(1) == 1) all->set_value();
                           });
    }
    return all->get_future();
  }

  FakePlatform fakes;
  std::shared_ptr<FakeIPCConnection> connection;
  std::shared_ptr<ThreadPoolWorkQueues> queues;
  OstrelReportingPlatform platform;
  std::shared_ptr<OstrelReportingServiceDelegate> root;
};

TEST_F(WaitingSessions, AreAllDetachedAfterNineSecondsAndHoldNoThread) {
  std::vector<std::shared_ptr<OstrelReportingSession>> sessions;
  for (int id = 1; id <= kSessions; ++id) {
    sessions.push_back(OstrelReportingSession::initWithID(
        ReporterID{id}, /*processIdentifiers=*/{1}, platform));
  }
  fakes.listener->setDelegate(root.get());
  const auto other = connect(/*pid=*/2);

  const auto begin = steady_clock::now();
  for (const auto& session : sessions) session->start();
  std::future<void> allStarted = whenAllStarted(sessions);

  std::size_t mostThreads = 0;
  std::chrono::nanoseconds longestReply{0};
  int repliesWhileWaiting = 0;
  while (allStarted.wait_for(std::chrono::milliseconds(100)) ==
         std::future_status::timeout) {
    ASSERT_LT(steady_clock::now() - begin, BackendWaitTimeout + 2 * kLateness);
    std::promise<void> answered;
    const auto asked = steady_clock::now();
    other->getAllReporters([&](const ReporterIDs&) { answered.set_value(); });
    answered.get_future().wait();
    longestReply =
        std::max<std::chrono::nanoseconds>(longestReply, steady_clock::now() - asked);
    mostThreads = std::max(mostThreads, testing_support::threadsOfProcess());
    ++repliesWhileWaiting;
  }
  const auto took = steady_clock::now() - begin;

  EXPECT_GE(took, BackendWaitTimeout);
  EXPECT_LT(took, BackendWaitTimeout + kLateness);
  EXPECT_LE(mostThreads, kMostThreads);
  EXPECT_GT(repliesWhileWaiting, 20);
  EXPECT_LT(longestReply, std::chrono::seconds(1));
  for (const auto& session : sessions) {
    ASSERT_TRUE(session->started());
    ASSERT_EQ(session->reportingSession(), nullptr);
  }
  // A client that is there keeps the service, and the service its clients.
  connection->invalidate();
  EXPECT_TRUE(queues->drain(steady_clock::now() + std::chrono::seconds(30)));
  fakes.listener->setDelegate(nullptr);
}

}  // namespace
}  // namespace ostrel
