#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <thread>
#include <vector>

#include "platform/linux/OwnProcess.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "platform/linux/TimedConditionFactory.h"

namespace ostrel {
namespace {

using std::chrono::steady_clock;

constexpr std::size_t kMostThreads = 16;

class WorkQueueStress : public testing::Test {
 protected:
  std::shared_ptr<WorkQueue> makeQueue() {
    return queues_.makeSerialQueue("stress", QualityOfService::kUtility,
                                   /*relativePriority=*/0);
  }

  bool drain() { return queues_.drain(steady_clock::now() + std::chrono::minutes(5)); }

  const std::shared_ptr<TimerThread> timers_ = std::make_shared<TimerThread>();
  TimedConditionFactory conditions_{timers_};
  ThreadPoolWorkQueues queues_{timers_};
};

// A session that waits for its backend, reduced to its queue and condition.
struct Waiting {
  std::shared_ptr<WorkQueue> queue;
  std::shared_ptr<Condition> condition;
  steady_clock::time_point wokenAt;
  Condition::Wake reason = Condition::Wake::kSignalled;
  int stepsBefore = 0;
  int stepsAfter = 0;
  bool isOver = false;
};

TEST_F(WorkQueueStress, TenThousandQueuesThatWaitHoldNoThread) {
  constexpr int kQueues = 10000;
  constexpr auto kTimeout = std::chrono::seconds(9);
  std::vector<Waiting> all(kQueues);
  const auto begin = steady_clock::now();
  for (Waiting& one : all) {
    one.queue = makeQueue();
    one.condition = conditions_.makeCondition();
    one.queue->async([&one, kTimeout] {
      one.queue->suspend();
      one.condition->lock();
      one.condition->wait(kTimeout, [&one](Condition::Wake wake) {
        one.queue->resume([&one, wake] {
          one.wokenAt = steady_clock::now();
          one.reason = wake;
          one.isOver = true;
        });
      });
      one.condition->unlock();
    });
    one.queue->async([&one] { ++(one.isOver ? one.stepsAfter : one.stepsBefore); });
  }
  ASSERT_TRUE(drain());
  const auto allWait = steady_clock::now() - begin;
  ASSERT_LT(allWait, kTimeout) << "the first timed out before the last waited";
  EXPECT_LE(testing_support::threadsOfProcess(), kMostThreads);

  // The others are served meanwhile.
  const auto other = makeQueue();
  std::atomic<int> served{0};
  for (int i = 0; i < 1000; ++i) other->async([&served] { ++served; });
  ASSERT_TRUE(drain());
  EXPECT_EQ(served, 1000);
  EXPECT_LT(steady_clock::now() - begin, kTimeout);

  // One more timer behind theirs tells when all have fired.
  std::atomic<bool> isOver{false};
  timers_->scheduleAfter(kTimeout, [&isOver] { isOver = true; });
  std::size_t mostThreads = 0;
  while (!isOver) {
    mostThreads = std::max(mostThreads, testing_support::threadsOfProcess());
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ASSERT_TRUE(drain());
  EXPECT_LE(mostThreads, kMostThreads);
  for (const Waiting& one : all) {
    ASSERT_TRUE(one.isOver);
    ASSERT_EQ(one.reason, Condition::Wake::kTimedOut);
    ASSERT_GE(one.wokenAt - begin, kTimeout);
    ASSERT_EQ(one.stepsBefore, 0);
    ASSERT_EQ(one.stepsAfter, 1);
  }
}

TEST_F(WorkQueueStress, EightThreadsQueueOnTheSameQueuesAtOnce) {
  constexpr int kThreads = 8;
  constexpr int kQueues = 50;
  constexpr int kSteps = 20000;
  struct Counted {
    std::shared_ptr<WorkQueue> queue;
    int steps = 0;  // On the queue: a race is a fault of the queue.
    std::array<int, kThreads> last{};
    bool isOrdered = true;
  };
  std::vector<Counted> all(kQueues);
  for (Counted& one : all) one.queue = makeQueue();
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&all, t] {
      for (int i = 1; i <= kSteps; ++i) {
        Counted& one = all[static_cast<std::size_t>(i * (t + 1) % kQueues)];
        one.queue->async([&one, t, i] {
          ++one.steps;
          one.isOrdered = one.isOrdered && one.last[static_cast<std::size_t>(t)] < i;
          one.last[static_cast<std::size_t>(t)] = i;
        });
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  ASSERT_TRUE(drain());
  int steps = 0;
  for (const Counted& one : all) {
    steps += one.steps;
    EXPECT_TRUE(one.isOrdered);
  }
  EXPECT_EQ(steps, kThreads * kSteps);
}

TEST_F(WorkQueueStress, QueuesAreSuspendedAndResumedFromEveryThread) {
  constexpr int kQueues = 200;
  constexpr int kRounds = 50;
  std::atomic<int> resumed{0};
  std::atomic<int> others{0};
  std::vector<std::shared_ptr<WorkQueue>> all;
  for (int i = 0; i < kQueues; ++i) all.push_back(makeQueue());
  for (int round = 0; round < kRounds; ++round) {
    for (const auto& queue : all) {
      queue->async([this, &queue, &resumed] {
        queue->suspend();
        queues_.backgroundQueue().asyncAfter(
            std::chrono::microseconds(10),
            [&queue, &resumed] { queue->resume([&resumed] { ++resumed; }); });
      });
      queue->async([&others] { ++others; });
    }
  }
  while (resumed < kQueues * kRounds || others < kQueues * kRounds) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  ASSERT_TRUE(drain());
  EXPECT_EQ(resumed, kQueues * kRounds);
  EXPECT_EQ(others, kQueues * kRounds);
}

TEST_F(WorkQueueStress, ASignalAndATimeoutThatMeetWakeTheWaiterOnce) {
  constexpr int kRounds = 2000;
  std::atomic<int> woken{0};
  for (int i = 0; i < kRounds; ++i) {
    const auto condition = conditions_.makeCondition();
    condition->lock();
    condition->wait(std::chrono::microseconds(20),
                    [&woken](Condition::Wake) { ++woken; });
    condition->unlock();
    queues_.backgroundQueue().asyncAfter(std::chrono::microseconds(15), [condition] {
      condition->lock();
      condition->signal();
      condition->unlock();
    });
  }
  while (woken < kRounds) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  // Whatever is still under way would wake a waiter twice.
  std::atomic<bool> isOver{false};
  timers_->scheduleAfter(std::chrono::milliseconds(50), [&isOver] { isOver = true; });
  while (!isOver) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  ASSERT_TRUE(drain());
  EXPECT_EQ(woken, kRounds);
}

TEST_F(WorkQueueStress, OwnersReleaseTheirQueuesWhileTheyRun) {
  constexpr int kThreads = 8;
  constexpr int kQueues = 5000;
  std::atomic<int> ran{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([this, &ran] {
      for (int i = 0; i < kQueues; ++i) {
        auto queue = makeQueue();
        queue->async([&ran, queue] { ++ran; });
        queue->async([&ran] { ++ran; });
        queue.reset();
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  ASSERT_TRUE(drain());
  EXPECT_EQ(ran, 2 * kThreads * kQueues);
}

}  // namespace
}  // namespace ostrel
