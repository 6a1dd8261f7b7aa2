// Sessions and the root object on the real queues, under a storm of requests; what is
// around them is in memory.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingServiceDelegate.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/RealQueues.h"
#include "platform/linux/ThreadPoolWorkQueues.h"

namespace ostrel {
namespace {

constexpr int kThreads = 8;
constexpr int kStepsPerThread = 400;
constexpr ReporterID kShared{1};
constexpr std::uint16_t kSummary = 0xFFFF;

class SessionStress : public testing::Test {
 protected:
  using Random = std::mt19937;

  SessionStress() {
    forgetIsInternalBuildForTesting();
    fakes.deviceInfo->setAnswer("InternalBuild", true);
    platform = fakes.platform();
    queues = testing_support::putOnRealQueues(platform);
  }
  ~SessionStress() override { forgetIsInternalBuildForTesting(); }

  /// Runs `step` so often on each of the threads, with its number and dice.
  template <typename Step>
  static void storm(Step step) {
    std::vector<std::thread> threads;
    for (int thread = 0; thread < kThreads; ++thread) {
      threads.emplace_back([thread, &step] {
        Random random(static_cast<unsigned>(thread));
        for (int i = 0; i < kStepsPerThread; ++i) step(thread, random);
      });
    }
    for (std::thread& each : threads) each.join();
  }
  static int roll(Random& random, int sides) {
    return static_cast<int>(random() % static_cast<unsigned>(sides));
  }
  /// One that has a telemetry session; those of some track orientation.
  static ServiceType anyType(Random& random) {
    return static_cast<ServiceType>(roll(random, 11));
  }

  void drain() {
    ASSERT_TRUE(
        queues->drain(std::chrono::steady_clock::now() + std::chrono::seconds(60)));
  }

  /// How often telemetry sessions were flushed. Each must have at most one summary,
  /// exactly at its end, behind all messages, and be released.
  std::size_t checkTelemetrySessions() const {
    std::size_t flushes = 0;
    for (std::size_t i = 1; i <= fakes.telemetryBackend->sessionCount(); ++i) {
      const auto session = fakes.telemetryBackend->session(i);
      const auto messages = session->messages();
      const auto isSummary = [](const auto& each) { return each.category == kSummary; };
      const auto first = std::ranges::find_if(messages, isSummary);
      const auto behind = std::distance(first, messages.end());
      EXPECT_LE(behind, 1) << "Session " << i << " goes on behind its summary.";
      EXPECT_LE(session->flushCount(), 1u) << "Session " << i;
      if (session->flushCount() == 0) {
        EXPECT_EQ(behind, 0) << "Session " << i << " has a summary without a stop.";
      } else if (!messages.empty()) {
        EXPECT_EQ(behind, 1) << "Session " << i << " has no summary.";
      }
      EXPECT_TRUE(session->isReleased()) << "Session " << i;
      flushes += session->flushCount();
    }
    return flushes;
  }

  FakePlatform fakes;
  std::shared_ptr<ThreadPoolWorkQueues> queues;
  OstrelReportingPlatform platform;
};

TEST_F(SessionStress, StopsOneSessionAsOftenAsItStarted) {
  const auto session =
      OstrelReportingSession::initWithID(kShared, /*processIdentifiers=*/{1}, platform);
  std::atomic<std::size_t> completions{0};
  std::atomic<int> accepted{0};
  std::atomic<int> sent{0};
  session->setTransactionCompleteBlock([&](bool) { ++completions; });

  storm([&](int thread, Random& random) {
    switch (roll(random, 8)) {
      case 0:
        session->start();
        break;
      case 1:
        session->stop();
        break;
      case 2:
        session->setServiceType(anyType(random));
        break;
      case 3:
        session->setConfiguration(Dictionary{{"thread", thread}});
        break;
      case 4:
        session->updateDefaults(Dictionary{{"device_name", "Phone"}});
        break;
      case 5:
        fakes.orientationService->turnDevice(1 + roll(random, 4));
        break;
      default:
        ++sent;
        session->sendMessage(Dictionary{{"a b", thread}}, MessageCategory{1},
                             MessageType{1},
                             [&](const std::optional<ErrorObject>& error) {
                               if (!error) ++accepted;
                             });
    }
  });
  session->stop();
  drain();

  EXPECT_FALSE(session->started());
  EXPECT_EQ(accepted, sent);
  EXPECT_GT(completions, 0u);
  EXPECT_EQ(completions, fakes.telemetryBackend->sessionCount());
  EXPECT_EQ(completions, checkTelemetrySessions());
  EXPECT_TRUE(fakes.orientationService->deviceObservers().empty());
  session->setTransactionCompleteBlock({});
}

TEST_F(SessionStress, ServesAStormOfClientsOnSharedAndOwnSessions) {
  auto root = OstrelReportingServiceDelegate::init(platform);
  fakes.listener->setDelegate(root.get());
  std::vector<std::shared_ptr<FakeIPCConnection>> connections;
  for (int i = 0; i < kThreads; ++i) {
    connections.push_back(fakes.listener->accept(/*pid=*/i + 2));
  }
  std::atomic<std::size_t> stops{0};
  std::atomic<int> asked{0};
  std::atomic<int> answered{0};
  const auto answer = [&](auto&&...) { ++answered; };

  storm([&](int thread, Random& random) {
    auto& connection = connections[static_cast<std::size_t>(thread)];
    const auto client = connection->exportedObject();
    const ReporterID own{100 + thread};
    const ReporterID id =
        roll(random, 2) == 0 ? kShared : ReporterID{100 + roll(random, kThreads)};
    switch (roll(random, 14)) {
      case 0:
      case 1:
        ++asked;
        client->createReportingSession(roll(random, 2) == 0 ? kShared : own, answer);
        break;
      case 2:
        ++asked;
        client->setServiceType(anyType(random), id, answer);
        break;
      case 3:
        ++asked;
        client->setConfiguration(Dictionary{{"thread", thread}}, id, answer);
        break;
      case 4:
      case 5:
      case 6:
        client->startReportingSessionForID(id, [&](bool isDone) {
          if (isDone) ++stops;
        });
        break;
      case 7:
        ++asked;
        client->stopReportingSessionForID(id, answer);
        break;
      case 8:
        ++asked;
        client->destroyReportingSession(id, answer);
        break;
      case 9:
        fakes.userDefaults->setSuite(
            "com.orbisk.ostrel",
            {{"disable_reporting", roll(random, 4) == 0}, {"device_name", "Phone"}});
        fakes.notifications->post("com.orbisk.ostrel.reporting");
        break;
      case 10:
        ++asked;
        client->getAllReporters(answer);
        break;
      case 11:
        fakes.orientationService->turnDevice(1 + roll(random, 4));
        break;
      case 12:
        if (roll(random, 8) == 0) {
          connection->interrupt();
          connection = fakes.listener->accept(/*pid=*/thread + 2);
          break;
        }
        [[fallthrough]];
      default:
        ++asked;
        client->sendMessage(
            Dictionary{{"a b", thread}}, MessageCategory{1}, MessageType{1},
            roll(random, 3) == 0 ? std::nullopt
                                 : std::optional<ReporterIDs>({kShared, own, id}),
            answer);
    }
  });
  // However the storm went, the service goes on after it.
  drain();
  fakes.userDefaults->setSuite("com.orbisk.ostrel", {{"disable_reporting", false}});
  fakes.notifications->post("com.orbisk.ostrel.reporting");
  drain();
  const std::size_t stopsOfStorm = stops;
  const auto client = connections[0]->exportedObject();
  client->createReportingSession(ReporterID{1}, /*reply=*/{});
  client->startReportingSessionForID(ReporterID{1}, [&](bool isDone) {
    if (isDone) ++stops;
  });
  drain();
  client->stopReportingSessionForID(ReporterID{1}, /*reply=*/{});
  drain();
  EXPECT_EQ(stops, stopsOfStorm + 1);

  for (int i = 0; i < kThreads; ++i) {
    const auto& connection = connections[static_cast<std::size_t>(i)];
    for (const ReporterID id : {kShared, ReporterID{100 + i}}) {
      connection->exportedObject()->destroyReportingSession(id, /*reply=*/{});
    }
    connection->invalidate();
  }
  connections.clear();
  drain();
  // What keeps a session that was dropped while it was started: its observers, and the
  // completion that the fake backend holds on to.
  fakes.orientationService->releaseCallbacks();
  fakes.telemetryBackend->releaseCallbacks();

  EXPECT_EQ(answered, asked);
  EXPECT_GT(stops, 0u);
  // A stop through the service is told to whoever started the session last.
  EXPECT_EQ(stops, checkTelemetrySessions());
  fakes.listener->setDelegate(nullptr);
  fakes.notifications->releaseCallbacks();
}

}  // namespace
}  // namespace ostrel
