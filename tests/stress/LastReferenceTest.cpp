// The last reference of a session goes on every kind of thread: it is torn down once,
// there, with no lock held and nobody waiting for himself.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingServiceDelegate.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/RealQueues.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "tests/stress/AnsweringBackend.h"

namespace ostrel {
namespace {

constexpr int kSessions = 200;
constexpr int kStormThreads = 8;
// Fewer where every access is watched.
#ifdef OSTREL_SANITIZED
constexpr int kStormSessions = 250;
#else
constexpr int kStormSessions = 2500;
#endif

/// Where each session ended. It reaches for the locks of the twins meanwhile: a session
/// that ends under one of them hangs the test.
class TeardownTrace final : public KernelTrace {
 public:
  explicit TeardownTrace(const FakePlatform& fakes) : fakes_(fakes) {}

  void trace(TraceCode code) override {
    if (code == TraceCode::kSessionCreated) ++created_;
    if (code != TraceCode::kSessionTeardown) return;
    fakes_.orientationService->deviceObservers();
    fakes_.telemetryBackend->sessionCount();
    fakes_.events->add("teardown");
    const bool isOnServerQueue = serverQueue() != nullptr && serverQueue()->isCurrent();
    const std::lock_guard lock(mutex_);
    threads_.push_back(std::this_thread::get_id());
    if (isOnServerQueue) ++onServerQueue_;
  }

  int created() const { return created_; }
  int tornDown() const {
    const std::lock_guard lock(mutex_);
    return static_cast<int>(threads_.size());
  }
  int onServerQueue() const {
    const std::lock_guard lock(mutex_);
    return onServerQueue_;
  }
  std::thread::id lastThread() const {
    const std::lock_guard lock(mutex_);
    return threads_.empty() ? std::thread::id() : threads_.back();
  }
  int on(std::thread::id thread) const {
    const std::lock_guard lock(mutex_);
    return static_cast<int>(std::count(threads_.begin(), threads_.end(), thread));
  }

 private:
  const FakePlatform& fakes_;
  std::atomic<int> created_{0};
  mutable std::mutex mutex_;
  std::vector<std::thread::id> threads_;
  int onServerQueue_ = 0;
};

class LastReference : public testing::Test {
 protected:
  LastReference() {
    forgetIsInternalBuildForTesting();
    fakes.deviceInfo->setAnswer("InternalBuild", true);
    trace = std::make_shared<TeardownTrace>(fakes);
    platform = fakes.platform();
    queues = testing_support::putOnRealQueues(platform);
    platform.conditions = std::make_shared<HastyConditions>(platform.conditions);
    platform.kernelTrace = trace;
  }
  ~LastReference() override { forgetIsInternalBuildForTesting(); }

  std::shared_ptr<OstrelReportingSession> makeSession(std::uint16_t type) {
    auto session = OstrelReportingSession::initWithID(
        ReporterID{++sessions_}, /*processIdentifiers=*/{1}, platform);
    session->setServiceType(ServiceType{type});
    return session;
  }

  void drain() {
    ASSERT_TRUE(
        queues->drain(std::chrono::steady_clock::now() + std::chrono::minutes(2)));
  }

  /// Runs `action` on a thread of its own and returns which that was.
  template <typename Action>
  static std::thread::id onOwnThread(Action action) {
    std::thread thread(action);
    const std::thread::id id = thread.get_id();
    thread.join();
    return id;
  }

  void waitFor(const std::function<bool()>& condition) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(2);
    while (!condition() && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    ASSERT_TRUE(condition());
  }

  FakePlatform fakes;
  OstrelReportingPlatform platform;
  std::shared_ptr<ThreadPoolWorkQueues> queues;
  std::shared_ptr<TeardownTrace> trace;

 private:
  std::atomic<std::int64_t> sessions_{0};
};

TEST_F(LastReference, GoesOnTheServerQueue) {
  const auto root = OstrelReportingServiceDelegate::init(platform);
  fakes.listener->setDelegate(root.get());
  const auto connection = fakes.listener->accept(/*pid=*/2);
  for (int i = 1; i <= kSessions; ++i) {
    connection->exportedObject()->createReportingSession(ReporterID{i}, /*reply=*/{});
    connection->exportedObject()->destroyReportingSession(ReporterID{i}, /*reply=*/{});
  }
  drain();
  EXPECT_EQ(trace->created(), kSessions);
  EXPECT_EQ(trace->tornDown(), kSessions);
  EXPECT_EQ(trace->onServerQueue(), kSessions);
  connection->invalidate();
  drain();
  fakes.listener->setDelegate(nullptr);
}

TEST_F(LastReference, GoesOnTheSessionsOwnQueue) {
  std::promise<void> dropped;
  const std::shared_future<void> isDropped = dropped.get_future().share();
  for (int i = 0; i < kSessions; ++i) {
    const auto session = makeSession(/*type=*/11);
    session->start();
    session->sessionReportingQueue()->async([isDropped] { isDropped.wait(); });
    session->sendMessage({}, MessageCategory{1}, MessageType{1}, /*reply=*/{});
    session->stop();
  }
  dropped.set_value();
  drain();
  EXPECT_EQ(trace->tornDown(), kSessions);
  EXPECT_EQ(trace->on(std::this_thread::get_id()), 0);
  EXPECT_EQ(trace->onServerQueue(), 0);
}

TEST_F(LastReference, GoesOnABackendThread) {
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::held());
  std::vector<std::weak_ptr<OstrelReportingSession>> sessions;
  for (int i = 0; i < kSessions; ++i) {
    const auto session = makeSession(/*type=*/0);
    session->start();
    sessions.push_back(session);
  }
  // Each waits in vain; then only the completion that the backend kept holds it.
  waitFor([&] {
    return std::ranges::all_of(sessions, [](const auto& session) {
      const auto alive = session.lock();
      return alive && alive->started();
    });
  });
  drain();
  // The timer thread lets go of a wait a moment after it ended it.
  waitFor([&] {
    return std::ranges::all_of(
        sessions, [](const auto& session) { return session.use_count() == 1; });
  });
  EXPECT_EQ(trace->tornDown(), 0);
  const auto thread = onOwnThread([this] {
    for (std::size_t i = 1; i <= fakes.telemetryBackend->sessionCount(); ++i) {
      fakes.telemetryBackend->session(i)->forgetDiscovery();
    }
  });
  EXPECT_EQ(trace->on(thread), kSessions);
  EXPECT_EQ(trace->tornDown(), kSessions);
}

TEST_F(LastReference, GoesOnTheOrientationThread) {
  for (int i = 0; i < kSessions; ++i) {
    {
      const auto session = makeSession(/*type=*/2);
      session->start();
      drain();
    }
    fakes.telemetryBackend->lastSession()->forgetDiscovery();
    // A call is under way when the observers are unregistered.
    auto callback = fakes.orientationService->deviceCallback("OstrelReportingService " +
                                                             std::to_string(i + 1));
    ASSERT_TRUE(callback);
    fakes.orientationService->releaseCallbacks();
    EXPECT_EQ(trace->tornDown(), i);
    const auto thread = onOwnThread([&callback] {
      callback(1);
      callback = nullptr;
    });
    ASSERT_EQ(trace->tornDown(), i + 1);
    EXPECT_EQ(trace->lastThread(), thread);
  }
}

TEST_F(LastReference, GoesOnTheThreadOfTheListener) {
  const auto root = OstrelReportingServiceDelegate::init(platform);
  fakes.listener->setDelegate(root.get());
  const auto connection = fakes.listener->accept(/*pid=*/2);
  for (int i = 1; i <= kSessions; ++i) {
    connection->exportedObject()->createReportingSession(ReporterID{i}, /*reply=*/{});
  }
  connection->onlyInterrupt();  // The root object lets go of the client.
  drain();
  EXPECT_EQ(trace->tornDown(), 0);
  connection->releaseCallbacks();
  EXPECT_EQ(trace->on(std::this_thread::get_id()), kSessions);
  EXPECT_EQ(trace->tornDown(), kSessions);
  fakes.listener->setDelegate(nullptr);
}

TEST_F(LastReference, GoesAnywhereInAStorm) {
  const auto backend =
      std::make_shared<AnsweringBackend>(fakes.telemetryBackend, /*seed=*/2);
  platform.telemetryBackend = backend;
  std::atomic<bool> isOver{false};
  std::thread orientation([&] {
    for (int i = 0; !isOver; ++i) {
      fakes.orientationService->turnDevice(1);
      fakes.orientationService->turnInterface(10);
      // The observers of sessions that nobody stopped.
      if (i % 100 == 0) fakes.orientationService->releaseCallbacks();
      std::this_thread::sleep_for(std::chrono::microseconds(100));
    }
  });
  std::vector<std::thread> threads;
  for (int thread = 0; thread < kStormThreads; ++thread) {
    threads.emplace_back([this, thread] {
      std::mt19937 dice(static_cast<unsigned>(thread));
      for (int i = 0; i < kStormSessions; ++i) {
        static const std::uint16_t kTypes[] = {0, 2, 4, 7, 11};
        const auto session = makeSession(kTypes[dice() % 5]);
        for (unsigned step = dice() % 6; step > 0; --step) {
          switch (dice() % 5) {
            case 0:
            case 1:
              session->start();
              break;
            case 2:
              session->stop();
              break;
            case 3:
              session->setServiceType(ServiceType{kTypes[dice() % 5]});
              break;
            default:
              session->sendMessage({}, MessageCategory{1}, MessageType{1}, /*reply=*/{});
          }
        }
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  const int made = kStormThreads * kStormSessions;
  waitFor([&] { return trace->tornDown() >= made; });
  isOver = true;
  orientation.join();
  backend->end();
  drain();
  EXPECT_EQ(trace->created(), made);
  EXPECT_EQ(trace->tornDown(), made);
}

}  // namespace
}  // namespace ostrel
