// Starts, stops and changes of type of one session by eight clients at once, on the real
// queues, with a backend that answers from threads of its own.
#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <chrono>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingServiceDelegate.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/RealQueues.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "tests/stress/AnsweringBackend.h"

namespace ostrel {
namespace {

constexpr int kClients = 8;
constexpr int kRequestsPerClient = 1500;
constexpr ReporterID kShared{1};
const std::string kSessionStart = "trace 0x2104282c";
const std::string kSessionStop = "trace 0x21042830";
const std::string kSummary = "analytics com.orbisk.ostrel.Undefined.Unknown";

/// What one start request was answered.
struct StartReplies {
  std::atomic<int> stops{0};
  std::atomic<int> refusals{0};
};

class StartStopStorm : public testing::Test {
 protected:
  StartStopStorm() {
    forgetIsInternalBuildForTesting();
    backend = std::make_shared<AnsweringBackend>(fakes.telemetryBackend, /*seed=*/1);
    platform = fakes.platform();
    queues = testing_support::putOnRealQueues(platform);
    platform.conditions = std::make_shared<HastyConditions>(platform.conditions);
    platform.telemetryBackend = backend;
    root = OstrelReportingServiceDelegate::init(platform);
    fakes.listener->setDelegate(root.get());
    for (int i = 0; i < kClients; ++i) {
      connections.push_back(fakes.listener->accept(/*pid=*/i + 2));
    }
    client(0).createReportingSession(kShared, /*reply=*/{});
    drain();
  }
  ~StartStopStorm() override {
    fakes.listener->setDelegate(nullptr);
    fakes.notifications->releaseCallbacks();
    forgetIsInternalBuildForTesting();
  }

  OstrelReportingServiceProtocol& client(int number) {
    return *connections[static_cast<std::size_t>(number)]->exportedObject();
  }

  void drain() {
    ASSERT_TRUE(
        queues->drain(std::chrono::steady_clock::now() + std::chrono::minutes(2)));
  }

  void request(int number, std::mt19937& dice, StartReplies& replies) {
    const auto answer = [this](auto&&...) { ++answered; };
    switch (dice() % 8) {
      case 0:
      case 1:
      case 2:
        client(number).startReportingSessionForID(kShared, [&replies](bool isStop) {
          ++(isStop ? replies.stops : replies.refusals);
        });
        break;
      case 3:
      case 4:
        ++asked;
        client(number).stopReportingSessionForID(kShared, answer);
        break;
      case 5:  // Only the client that made it can, so all speak as that one.
        ++asked;
        client(0).setServiceType(ServiceType{static_cast<std::uint16_t>(dice() % 12)},
                                 kShared, answer);
        break;
      default:
        ++asked;
        client(number).sendMessage(Dictionary{{"a b", number}}, MessageCategory{1},
                                   MessageType{1}, ReporterIDs{kShared}, answer);
    }
  }

  /// The session's queue is serial, and so is what it did. Returns its stops.
  int checkSummaries() {
    int stops = 0;
    int deliveries = 0;
    bool isStarted = false;
    bool wantsSummary = false;
    for (const std::string& event : fakes.events->all()) {
      if (event == kSummary) {
        EXPECT_TRUE(wantsSummary) << "at stop " << stops;
        wantsSummary = false;
      } else if (event.starts_with("analytics com.orbisk.ostrel.Generic")) {
        ++deliveries;
      } else if (event == kSessionStart) {
        EXPECT_FALSE(isStarted);
        EXPECT_FALSE(wantsSummary) << "of stop " << stops;
        isStarted = true;
        deliveries = 0;
      } else if (event == kSessionStop) {
        EXPECT_TRUE(isStarted);
        isStarted = false;
        ++stops;
        wantsSummary = deliveries > 0;
      }
    }
    EXPECT_FALSE(wantsSummary) << "of the last stop";
    return stops;
  }

  FakePlatform fakes;
  std::shared_ptr<ThreadPoolWorkQueues> queues;
  std::shared_ptr<AnsweringBackend> backend;
  OstrelReportingPlatform platform;
  std::shared_ptr<OstrelReportingServiceDelegate> root;
  std::vector<std::shared_ptr<FakeIPCConnection>> connections;
  std::atomic<int> asked{0};
  std::atomic<int> answered{0};
};

TEST_F(StartStopStorm, SummarisesAndAnswersEachStopOfAStartedSessionOnce) {
  std::vector<std::unique_ptr<std::array<StartReplies, kRequestsPerClient>>> replies;
  for (int i = 0; i < kClients; ++i) {
    replies.push_back(std::make_unique<std::array<StartReplies, kRequestsPerClient>>());
  }
  std::vector<std::thread> threads;
  for (int number = 0; number < kClients; ++number) {
    threads.emplace_back([this, number, &replies] {
      std::mt19937 dice(static_cast<unsigned>(number));
      for (StartReplies& each : *replies[static_cast<std::size_t>(number)]) {
        request(number, dice, each);
      }
    });
  }
  for (std::thread& thread : threads) thread.join();

  // Waits that are under way hold the queue; a stop of what they start ends the storm.
  client(0).stopReportingSessionForID(kShared, /*reply=*/{});
  client(0).destroyReportingSession(kShared, /*reply=*/{});
  for (const auto& connection : connections) connection->invalidate();
  connections.clear();
  const std::string teardown = "trace 0x21042834";
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(2);
  while (fakes.events->count(teardown) == 0 &&
         std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  backend->end();
  drain();

  EXPECT_EQ(fakes.events->count(teardown), 1u);
  EXPECT_EQ(answered, asked);
  const int stops = checkSummaries();
  EXPECT_GT(stops, 100);
  int answeredStops = 0;
  for (const auto& ofClient : replies) {
    for (const StartReplies& each : *ofClient) {
      EXPECT_EQ(each.refusals, 0);  // The session was there all the time.
      answeredStops += each.stops;
    }
  }
  EXPECT_EQ(answeredStops, stops);
}

}  // namespace
}  // namespace ostrel
