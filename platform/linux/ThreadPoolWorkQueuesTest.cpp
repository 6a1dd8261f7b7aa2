#include "platform/linux/ThreadPoolWorkQueues.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <fstream>
#include <mutex>
#include <semaphore>
#include <thread>

namespace ostrel {
namespace {

using std::chrono::steady_clock;

/// Holds a step back until it is opened.
class Gate {
 public:
  Task holdingStep() {
    return [this] {
      entered_.release();
      open_.acquire();
    };
  }
  void waitUntilHolding() { entered_.acquire(); }
  void open() { open_.release(); }

 private:
  std::counting_semaphore<> entered_{0};
  std::counting_semaphore<> open_{0};
};

class ThreadPoolWorkQueuesTest : public testing::Test {
 protected:
  std::shared_ptr<WorkQueue> makeQueue(
      QualityOfService qualityOfService = QualityOfService::kUtility,
      int relativePriority = 0) {
    return queues_->makeSerialQueue("test", qualityOfService, relativePriority);
  }

  bool drain() { return queues_->drain(steady_clock::now() + std::chrono::seconds(30)); }

  std::unique_ptr<ThreadPoolWorkQueues> queues_ =
      std::make_unique<ThreadPoolWorkQueues>(std::make_shared<TimerThread>());
};

TEST_F(ThreadPoolWorkQueuesTest, HasNoThreadUntilAStepNeedsOne) {
  const auto queue = makeQueue();
  EXPECT_EQ(queues_->threadCount(), 0u);
  queue->async([] {});
  ASSERT_TRUE(drain());
  EXPECT_EQ(queues_->threadCount(), 1u);
}

TEST_F(ThreadPoolWorkQueuesTest, HasAFewThreadsForAnyNumberOfQueues) {
  std::vector<std::shared_ptr<WorkQueue>> all;
  std::atomic<int> count{0};
  for (const auto quality : {QualityOfService::kUserInteractive,
                             QualityOfService::kUtility, QualityOfService::kBackground}) {
    for (int i = 0; i < 1000; ++i) {
      all.push_back(makeQueue(quality));
      all.back()->async([&count] { ++count; });
    }
  }
  ASSERT_TRUE(drain());
  EXPECT_EQ(count, 3000);
  EXPECT_LE(queues_->threadCount(), ThreadPoolWorkQueues::kMostInteractiveThreads +
                                        ThreadPoolWorkQueues::kMostUtilityThreads +
                                        ThreadPoolWorkQueues::kMostBackgroundThreads);
}

TEST_F(ThreadPoolWorkQueuesTest, RunsTwoQueuesOfAClassAtOnce) {
  Gate gate;
  std::binary_semaphore ran{0};
  const auto blocked = makeQueue();
  const auto other = makeQueue();
  blocked->async(gate.holdingStep());
  gate.waitUntilHolding();
  other->async([&ran] { ran.release(); });
  ran.acquire();
  gate.open();
  EXPECT_TRUE(drain());
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchRunsAnInteractiveQueueOnItsThreadAtItsEnd) {
  const auto queue = makeQueue(QualityOfService::kUserInteractive);
  std::vector<int> ran;
  std::thread::id thread;
  {
    const ThreadPoolWorkQueues::Batch batch;
    queue->async([&] {
      thread = std::this_thread::get_id();
      EXPECT_TRUE(queue->isCurrent());
      ran.push_back(1);
      queue->async([&] { ran.push_back(3); });
    });
    queue->async([&] { ran.push_back(2); });
    EXPECT_TRUE(ran.empty());
  }
  EXPECT_EQ(ran, (std::vector<int>{1, 2, 3}));
  EXPECT_EQ(thread, std::this_thread::get_id());
  EXPECT_EQ(queues_->threadCount(), 0u);
  EXPECT_TRUE(drain());
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchLeavesASecondInteractiveQueueToAThread) {
  const auto first = makeQueue(QualityOfService::kUserInteractive);
  const auto second = makeQueue(QualityOfService::kUserInteractive);
  std::binary_semaphore ran{0};
  {
    const ThreadPoolWorkQueues::Batch batch;
    first->async([] {});
    second->async([&] { ran.release(); });
    ran.acquire();
  }
  EXPECT_EQ(queues_->threadCount(), 1u);
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchWakesTheThreadsOfOtherQueuesAtItsEnd) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  const auto session = makeQueue(QualityOfService::kUtility);
  session->async([] {});
  ASSERT_TRUE(drain());
  std::vector<int> ran;
  std::binary_semaphore isDone{0};
  {
    const ThreadPoolWorkQueues::Batch batch;
    server->async([&] {
      EXPECT_FALSE(session->isCurrent());
      session->async([&] { ran.push_back(1); });
      session->async([&] {
        EXPECT_FALSE(server->isCurrent());
        ran.push_back(2);
        isDone.release();
      });
    });
  }
  isDone.acquire();
  EXPECT_EQ(ran, (std::vector<int>{1, 2}));
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchTakesNoQueueThatAThreadRuns) {
  const auto queue = makeQueue(QualityOfService::kUserInteractive);
  Gate gate;
  queue->async(gate.holdingStep());
  gate.waitUntilHolding();
  std::thread::id thread;
  {
    const ThreadPoolWorkQueues::Batch batch;
    queue->async([&] { thread = std::this_thread::get_id(); });
  }
  gate.open();
  ASSERT_TRUE(drain());
  EXPECT_NE(thread, std::this_thread::get_id());
}

// More strands than a batch hands over at once.
TEST_F(ThreadPoolWorkQueuesTest, ABatchHandsOverAnyNumberOfQueues) {
  constexpr std::size_t kQueues = 1000;
  constexpr int kRounds = 3;
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  std::vector<std::shared_ptr<WorkQueue>> sessions;
  std::vector<std::vector<int>> ran(kQueues);
  for (std::size_t i = 0; i < kQueues; ++i) {
    sessions.push_back(makeQueue(QualityOfService::kUtility,
                                 /*relativePriority=*/i % 3 == 0 ? -1 : 0));
  }
  {
    const ThreadPoolWorkQueues::Batch batch;
    for (int round = 0; round < kRounds; ++round) {
      server->async([&, round] {
        for (std::size_t i = 0; i < kQueues; ++i) {
          sessions[i]->async([&ran, i, round] { ran[i].push_back(round); });
        }
      });
    }
  }
  ASSERT_TRUE(drain());
  EXPECT_THAT(ran, testing::Each(testing::ElementsAre(0, 1, 2)));
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchHandsOverQueuesOfSeveralClasses) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  const auto other = makeQueue(QualityOfService::kUserInteractive);
  const auto session = makeQueue(QualityOfService::kUtility);
  const auto background = makeQueue(QualityOfService::kBackground);
  std::atomic<int> count{0};
  {
    const ThreadPoolWorkQueues::Batch batch;
    server->async([&] {
      for (const auto& queue : {other, session, background}) {
        queue->async([&count] { ++count; });
      }
    });
  }
  ASSERT_TRUE(drain());
  EXPECT_EQ(count, 3);
}

// Around as many as are held back for one another.
TEST_F(ThreadPoolWorkQueuesTest, ABatchHandsTheStepsOfAQueueOverInTheirOrder) {
  for (const int steps : {1, 2, 63, 64, 65, 127, 128, 129, 1000}) {
    const auto server = makeQueue(QualityOfService::kUserInteractive);
    const auto session = makeQueue();
    std::vector<int> ran;
    {
      const ThreadPoolWorkQueues::Batch batch;
      for (int i = 0; i < steps; ++i) {
        server->async([&, i] { session->async([&, i] { ran.push_back(i); }); });
      }
    }
    ASSERT_TRUE(drain());
    ASSERT_EQ(ran.size(), static_cast<std::size_t>(steps));
    EXPECT_TRUE(std::is_sorted(ran.begin(), ran.end())) << steps;
  }
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchHandsStepsOverInTheOrderOfTheirQueues) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  const auto first = makeQueue();
  const auto second = makeQueue();
  std::atomic<int> firstRan{0};
  bool cameInOrder = true;
  {
    const ThreadPoolWorkQueues::Batch batch;
    for (int i = 0; i < 500; ++i) {
      server->async([&, i] {
        first->async([&] { ++firstRan; });
        // Queued later, by a step that another queue runs at its own time.
        if (i % 7 == 0) {
          second->async([&, i] {
            first->async([&, i] { cameInOrder = cameInOrder && firstRan > i; });
          });
        }
      });
    }
  }
  ASSERT_TRUE(drain());
  EXPECT_EQ(firstRan, 500);
  EXPECT_TRUE(cameInOrder);
}

// The batch's queue goes on elsewhere since others wait: what it had held back is there
// before what its later steps queue.
TEST_F(ThreadPoolWorkQueuesTest, ABatchHoldsNothingBackWhenItsQueueGoesOnElsewhere) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  const auto session = makeQueue();
  Gate gate;
  std::vector<std::shared_ptr<WorkQueue>> others;
  for (std::size_t i = 0; i <= ThreadPoolWorkQueues::kMostInteractiveThreads; ++i) {
    others.push_back(makeQueue(QualityOfService::kUserInteractive));
    others.back()->async(gate.holdingStep());
  }
  for (std::size_t i = 0; i < ThreadPoolWorkQueues::kMostInteractiveThreads; ++i) {
    gate.waitUntilHolding();
  }
  std::vector<int> ran;
  std::thread::id lastThread;
  {
    const ThreadPoolWorkQueues::Batch batch;
    for (int i = 0; i < 300; ++i) {
      server->async([&, i] {
        lastThread = std::this_thread::get_id();
        session->async([&, i] { ran.push_back(i); });
      });
    }
  }
  for (std::size_t i = 0; i < others.size(); ++i) gate.open();
  ASSERT_TRUE(drain());
  EXPECT_NE(lastThread, std::this_thread::get_id());
  ASSERT_EQ(ran.size(), 300u);
  EXPECT_TRUE(std::is_sorted(ran.begin(), ran.end()));
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchHandsStepsToAQueueThatIsHeld) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  const auto session = makeQueue();
  std::vector<int> ran;
  session->async([&] { session->suspend(); });
  ASSERT_TRUE(drain());
  {
    const ThreadPoolWorkQueues::Batch batch;
    for (int i = 1; i <= 100; ++i) {
      server->async([&, i] {
        session->async([&, i] { ran.push_back(i); });
        if (i == 50) session->resume([&] { ran.push_back(0); });
      });
    }
  }
  ASSERT_TRUE(drain());
  ASSERT_EQ(ran.size(), 101u);
  EXPECT_TRUE(std::is_sorted(ran.begin(), ran.end()));
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchRunsWhatAReleasedQueueWasGiven) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  int ran = 0;
  {
    const ThreadPoolWorkQueues::Batch batch;
    server->async([&] {
      const auto session = makeQueue();
      session->async([&] { ++ran; });
      session->async([&] { ++ran; });
    });
  }
  ASSERT_TRUE(drain());
  EXPECT_EQ(ran, 2);
}

/// One thread for all sessions' queues, which is held until it is let go.
class ThreadPoolUrgency : public ThreadPoolWorkQueuesTest {
 protected:
  ThreadPoolUrgency() {
    for (auto& [queue, gate] : held_) {
      queue = makeQueue();
      queue->async(gate.holdingStep());
      gate.waitUntilHolding();
    }
  }
  void queueUrgently(const std::function<void()>& step) {
    const ThreadPoolWorkQueues::Batch batch(ThreadPoolWorkQueues::Batch::Kind::kUrgent);
    server_->async([&] { step(); });
  }
  Task writing(int number) {
    return [this, number] { ran_.push_back(number); };
  }
  std::vector<int> runAll() {
    std::binary_semaphore isDone{0};
    last_->async([&] { isDone.release(); });
    held_[0].gate.open();
    isDone.acquire();
    held_[1].gate.open();
    EXPECT_TRUE(drain());
    return ran_;
  }

  const std::shared_ptr<WorkQueue> server_ =
      makeQueue(QualityOfService::kUserInteractive);
  const std::shared_ptr<WorkQueue> last_ =
      makeQueue(QualityOfService::kUtility, /*relativePriority=*/-1);
  struct Held {
    std::shared_ptr<WorkQueue> queue;
    Gate gate;
  };
  std::array<Held, ThreadPoolWorkQueues::kMostUtilityThreads> held_;
  std::vector<int> ran_;
};

TEST_F(ThreadPoolUrgency, OfABatchGetsItsQueuesBeforeOthers) {
  const auto usual = makeQueue();
  const auto urgent = makeQueue();
  usual->async(writing(2));
  queueUrgently([&] { urgent->async(writing(1)); });
  EXPECT_EQ(runAll(), (std::vector<int>{1, 2}));
}

TEST_F(ThreadPoolUrgency, OfManyLeavesOthersTheirTurns) {
  constexpr int kInARow = 16;
  const auto usual = makeQueue();
  std::vector<std::shared_ptr<WorkQueue>> urgent;
  usual->async(writing(0));
  queueUrgently([&] {
    for (int i = 1; i <= kInARow + 1; ++i) {
      urgent.push_back(makeQueue());
      urgent.back()->async(writing(i));
    }
  });
  const std::vector<int> ran = runAll();
  ASSERT_EQ(ran.size(), kInARow + 2u);
  EXPECT_EQ(std::ranges::find(ran, 0) - ran.begin(), kInARow);
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchEntersAQueueThatNobodyUses) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  EXPECT_FALSE(server->tryEnter());
  {
    const ThreadPoolWorkQueues::Batch batch;
    for (int i = 0; i < 3; ++i) {
      ASSERT_TRUE(server->tryEnter());
      EXPECT_TRUE(server->isCurrent());
      EXPECT_FALSE(server->tryEnter());
      server->leave();
      EXPECT_FALSE(server->isCurrent());
    }
  }
  EXPECT_FALSE(server->tryEnter());
  EXPECT_TRUE(drain());
  EXPECT_EQ(queues_->threadCount(), 0u);
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchEntersNoQueueOnWhichSomethingWaits) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  std::vector<int> ran;
  {
    const ThreadPoolWorkQueues::Batch batch;
    ASSERT_TRUE(server->tryEnter());
    ran.push_back(0);
    server->async([&] { ran.push_back(1); });
    server->leave();
    EXPECT_FALSE(server->tryEnter());
    server->async([&] { ran.push_back(2); });
    EXPECT_FALSE(server->tryEnter());
  }
  EXPECT_EQ(ran, (std::vector<int>{0, 1, 2}));
  const ThreadPoolWorkQueues::Batch batch;
  ASSERT_TRUE(server->tryEnter());
  server->leave();
  std::thread([&] { server->async([&] { ran.push_back(3); }); }).join();
  EXPECT_FALSE(server->tryEnter());
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchEntersNoQueueThatAThreadRuns) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  Gate gate;
  server->async(gate.holdingStep());
  gate.waitUntilHolding();
  {
    const ThreadPoolWorkQueues::Batch batch;
    EXPECT_FALSE(server->tryEnter());
  }
  gate.open();
  ASSERT_TRUE(drain());
  const ThreadPoolWorkQueues::Batch batch;
  EXPECT_TRUE(server->tryEnter());
  server->leave();
}

TEST_F(ThreadPoolWorkQueuesTest, ABatchEntersOneInteractiveQueueOnly) {
  const auto first = makeQueue(QualityOfService::kUserInteractive);
  const auto second = makeQueue(QualityOfService::kUserInteractive);
  const auto utility = makeQueue();
  const ThreadPoolWorkQueues::Batch batch;
  EXPECT_FALSE(utility->tryEnter());
  ASSERT_TRUE(first->tryEnter());
  EXPECT_FALSE(second->tryEnter());
  first->leave();
  EXPECT_FALSE(second->tryEnter());
}

TEST_F(ThreadPoolWorkQueuesTest, AnEnteredQueueHoldsOthersStepsBackUntilTheBatchEnds) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  std::thread::id thread;
  {
    const ThreadPoolWorkQueues::Batch batch;
    ASSERT_TRUE(server->tryEnter());
    std::thread([&] {
      server->async([&] { thread = std::this_thread::get_id(); });
    }).join();
    server->leave();
    EXPECT_EQ(thread, std::thread::id());
    EXPECT_FALSE(queues_->drain(steady_clock::now()));
  }
  ASSERT_TRUE(drain());
  EXPECT_EQ(thread, std::this_thread::get_id());
}

TEST_F(ThreadPoolWorkQueuesTest, AnEnteredQueueMayBeHeld) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  std::vector<int> ran;
  {
    const ThreadPoolWorkQueues::Batch batch;
    ASSERT_TRUE(server->tryEnter());
    server->suspend();
    server->leave();
    EXPECT_FALSE(server->tryEnter());
    server->async([&] { ran.push_back(2); });
  }
  EXPECT_TRUE(ran.empty());
  {
    const ThreadPoolWorkQueues::Batch batch;
    EXPECT_FALSE(server->tryEnter());
    server->resume([&] { ran.push_back(1); });
    EXPECT_FALSE(server->tryEnter());
  }
  EXPECT_EQ(ran, (std::vector<int>{1, 2}));
  const ThreadPoolWorkQueues::Batch batch;
  EXPECT_TRUE(server->tryEnter());
  server->leave();
}

// Steps that are queued while a queue is entered, and others between, at any length.
TEST_F(ThreadPoolWorkQueuesTest, AnEnteredQueueQueuesStepsInTheirOrder) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  const auto first = makeQueue();
  const auto second = makeQueue();
  std::vector<int> ran;
  int count = 0;
  int entered = 0;
  const auto queueNext = [&] {
    const int number = count++;
    first->async([&ran, number] { ran.push_back(number); });
    if (number % 5 == 0) second->async([] {});
  };
  for (int round = 0; round < 50; ++round) {
    const ThreadPoolWorkQueues::Batch batch;
    for (int i = 0; i < round * 3; ++i) {
      if (i % 11 == 10) {
        server->async(queueNext);
      } else if (server->tryEnter()) {
        ++entered;
        queueNext();
        server->leave();
      } else {
        server->async(queueNext);
      }
      // From the thread itself, on no queue.
      if (i % 7 == 6) queueNext();
    }
  }
  ASSERT_TRUE(drain());
  EXPECT_GT(entered, 100);
  ASSERT_EQ(ran.size(), static_cast<std::size_t>(count));
  EXPECT_TRUE(std::is_sorted(ran.begin(), ran.end()));
}

// Threads that queue on an entered queue, and wait for what they queued.
TEST_F(ThreadPoolWorkQueuesTest, AnEnteredQueueRunsOneStepAtATime) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  int runs = 0;  // Of the queue.
  std::atomic<bool> isOver{false};
  std::vector<std::thread> others;
  std::atomic<int> queued{0};
  for (int i = 0; i < 2; ++i) {
    others.emplace_back([&] {
      while (!isOver) {
        std::binary_semaphore ran{0};
        server->async([&] {
          ++runs;
          ran.release();
        });
        ++queued;
        ran.acquire();
      }
    });
  }
  for (int i = 0; i < 3000; ++i) {
    const ThreadPoolWorkQueues::Batch batch;
    for (int j = 0; j < 5; ++j) {
      if (server->tryEnter()) {
        server->assertCurrent();
        ++runs;
        server->leave();
      } else {
        server->async([&] { ++runs; });
      }
      ++queued;
    }
  }
  isOver = true;
  for (std::thread& thread : others) thread.join();
  ASSERT_TRUE(drain());
  EXPECT_EQ(runs, queued);
}

TEST_F(ThreadPoolWorkQueuesTest, WaitsForWhatABatchHasNotHandedOver) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  const auto session = makeQueue();
  Gate gate;
  bool ran = false;
  std::thread reader([&] {
    const ThreadPoolWorkQueues::Batch batch;
    server->async([&] {
      session->async([&ran] { ran = true; });
      gate.holdingStep()();
    });
  });
  gate.waitUntilHolding();
  EXPECT_FALSE(queues_->drain(steady_clock::now()));
  gate.open();
  EXPECT_TRUE(drain());
  reader.join();
  EXPECT_TRUE(ran);
}

// What a batch has gathered when the threads have ended is dropped, not lost.
TEST_F(ThreadPoolWorkQueuesTest, ABatchDropsWhatNobodyWillRun) {
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  std::vector<std::shared_ptr<WorkQueue>> sessions;
  for (int i = 0; i < 100; ++i) sessions.push_back(makeQueue());
  bool ran = false;
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  {
    const ThreadPoolWorkQueues::Batch batch;
    server->async([&, held = std::move(held)]() mutable {
      std::thread([this] { queues_.reset(); }).join();
      for (const auto& session : sessions) session->async([&ran, held] { ran = true; });
    });
  }
  EXPECT_TRUE(watch.expired());
  EXPECT_FALSE(ran);
}

TEST_F(ThreadPoolWorkQueuesTest, RunsFourBackgroundStepsAtOnce) {
  Gate gate;
  ConcurrentQueue& background = queues_->backgroundQueue();
  for (std::size_t i = 0; i < ThreadPoolWorkQueues::kMostBackgroundThreads; ++i) {
    background.asyncAfter(std::chrono::nanoseconds(0), gate.holdingStep());
  }
  for (std::size_t i = 0; i < ThreadPoolWorkQueues::kMostBackgroundThreads; ++i) {
    gate.waitUntilHolding();
  }
  for (std::size_t i = 0; i < ThreadPoolWorkQueues::kMostBackgroundThreads; ++i) {
    gate.open();
  }
  EXPECT_TRUE(drain());
}

TEST_F(ThreadPoolWorkQueuesTest, GivesEachClassItsNiceness) {
  const int own = getpriority(PRIO_PROCESS, 0);
  std::map<QualityOfService, int> nicenesses;
  for (const auto quality : {QualityOfService::kUserInteractive,
                             QualityOfService::kUtility, QualityOfService::kBackground}) {
    makeQueue(quality)->async([&nicenesses, quality] {
      nicenesses[quality] = getpriority(PRIO_PROCESS, static_cast<id_t>(gettid()));
    });
    ASSERT_TRUE(drain());
  }
  const auto expectNiceness = [&](QualityOfService quality, int wanted) {
    // Only a privileged process may be less nice than its parent.
    const int other = own > wanted ? own : wanted;
    EXPECT_THAT(nicenesses[quality], testing::AnyOf(wanted, other));
  };
  expectNiceness(QualityOfService::kUserInteractive, -5);
  expectNiceness(QualityOfService::kUtility, 5);
  expectNiceness(QualityOfService::kBackground, 10);
}

TEST_F(ThreadPoolWorkQueuesTest, NamesItsThreads) {
  std::string name(16, '\0');
  makeQueue()->async(
      [&name] { pthread_getname_np(pthread_self(), name.data(), name.size()); });
  ASSERT_TRUE(drain());
  EXPECT_STREQ(name.c_str(), "ostrel-util-1");
}

TEST_F(ThreadPoolWorkQueuesTest, TakesNoSignals) {
  bool isBlocked = false;
  makeQueue()->async([&isBlocked] {
    sigset_t blocked;
    pthread_sigmask(SIG_SETMASK, nullptr, &blocked);
    isBlocked = sigismember(&blocked, SIGTERM) == 1 && sigismember(&blocked, SIGINT) == 1;
  });
  ASSERT_TRUE(drain());
  EXPECT_TRUE(isBlocked);
}

TEST_F(ThreadPoolWorkQueuesTest, RunsQueuesOfALowerPriorityAfterTheOthers) {
  Gate gate;
  std::mutex mutex;
  std::vector<std::string> seen;
  const auto note = [&](const char* what) {
    return [&, what] {
      const std::lock_guard lock(mutex);
      seen.push_back(what);
    };
  };
  std::vector<std::shared_ptr<WorkQueue>> blocked;
  for (std::size_t i = 0; i < ThreadPoolWorkQueues::kMostUtilityThreads; ++i) {
    blocked.push_back(makeQueue());
    blocked.back()->async(gate.holdingStep());
    gate.waitUntilHolding();
  }
  const auto low = makeQueue(QualityOfService::kUtility, /*relativePriority=*/-1);
  const auto normal = makeQueue();
  const auto other = makeQueue();
  low->async(note("low"));
  normal->async(note("normal"));
  other->async(note("other"));
  gate.open();  // One thread works all three off.
  while (true) {
    const std::lock_guard lock(mutex);
    if (seen.size() == 3) break;
  }
  for (std::size_t i = 1; i < blocked.size(); ++i) gate.open();
  ASSERT_TRUE(drain());
  EXPECT_EQ(seen, (std::vector<std::string>{"normal", "other", "low"}));
}

// Queues itself again until it is told to end.
struct Endless {
  std::shared_ptr<WorkQueue> queue;
  std::atomic<bool>* isEnding;

  void operator()() {
    if (*isEnding) return;
    for (int i = 0; i < 1000; ++i) queue->async([] {});
    queue->async(Endless{queue, isEnding});
  }
};

TEST_F(ThreadPoolWorkQueuesTest, LetsOtherQueuesTakeTurnsWithBusyOnes) {
  std::atomic<bool> isEnding{false};
  for (std::size_t i = 0; i < ThreadPoolWorkQueues::kMostUtilityThreads + 1; ++i) {
    const auto busy = makeQueue();
    busy->async(Endless{busy, &isEnding});
  }
  std::binary_semaphore ran{0};
  makeQueue()->async([&ran] { ran.release(); });
  ran.acquire();  // Never, were the busy ones to keep their threads.
  isEnding = true;
  EXPECT_TRUE(drain());
}

// How often the calling thread has gone to sleep so far.
long sleepsOfThisThread() {
  std::ifstream status("/proc/thread-self/status");
  std::string line;
  const std::string key = "voluntary_ctxt_switches:";
  while (std::getline(status, line)) {
    if (line.starts_with(key)) return std::stol(line.substr(key.size()));
  }
  return -1;
}

/// A thread takes several queues from a long line at once. Here the first step holds its
/// thread up until all the others have run, which must not wait for it.
class ThreadPoolWorkQueuesHeldUp : public ThreadPoolWorkQueuesTest {
 protected:
  void SetUp() override {
    for (std::size_t i = 0; i < kThreads; ++i) {
      add(gate_.holdingStep());
      gate_.waitUntilHolding();
    }
    add([this] {
      wasInTime_ = othersRan_.try_acquire_for(std::chrono::seconds(20));
      isOver_ = true;
    });
    for (int i = 0; i < kOthers; ++i) {
      add([this] {
        if (++count_ == kOthers) othersRan_.release();
      });
    }
  }

  WorkQueue& add(Task step) {
    all_.push_back(makeQueue());
    all_.back()->async(std::move(step));
    return *all_.back();
  }

  void expectThatOthersRun() {
    for (std::size_t i = 0; i < kThreads; ++i) gate_.open();
    ASSERT_TRUE(drain());
    EXPECT_TRUE(wasInTime_);
  }

  static constexpr std::size_t kThreads = ThreadPoolWorkQueues::kMostUtilityThreads;
  static constexpr int kOthers = 200;
  std::atomic<bool> isOver_{false};

 private:
  Gate gate_;
  std::vector<std::shared_ptr<WorkQueue>> all_;
  std::atomic<int> count_{0};
  std::binary_semaphore othersRan_{0};
  std::atomic<bool> wasInTime_{false};
};

TEST_F(ThreadPoolWorkQueuesHeldUp, LeavesWhatItTookAheadToAnotherThread) {
  expectThatOthersRun();
}

TEST_F(ThreadPoolWorkQueuesHeldUp, DoesSoThoughMoreAndMoreComes) {
  std::function<void(WorkQueue&)> goOn = [&](WorkQueue& queue) {
    queue.async([&] {
      if (!isOver_) goOn(queue);
    });
  };
  for (int i = 0; i < kOthers; ++i) goOn(add([] {}));
  expectThatOthersRun();
}

TEST_F(ThreadPoolWorkQueuesTest, WakesNobodyForStepsOfAQueueThatRunsAlready) {
  Gate gate;
  const auto queue = makeQueue();
  long before = 0;
  long after = 0;
  pid_t firstThread = 0;
  bool isOneThread = true;
  queue->async(gate.holdingStep());
  gate.waitUntilHolding();
  queue->async([&] {
    before = sleepsOfThisThread();
    firstThread = gettid();
  });
  for (int i = 0; i < 100000; ++i) {
    queue->async([&] { isOneThread = isOneThread && gettid() == firstThread; });
  }
  queue->async([&] { after = sleepsOfThisThread(); });
  EXPECT_EQ(queues_->threadCount(), 1u);
  gate.open();
  ASSERT_TRUE(drain());
  EXPECT_TRUE(isOneThread);
  ASSERT_GE(before, 0);
  EXPECT_LE(after - before, 5);  // A page fault may put it to sleep.
}

TEST_F(ThreadPoolWorkQueuesTest, GivesUpDrainingAtTheDeadline) {
  Gate gate;
  makeQueue()->async(gate.holdingStep());
  gate.waitUntilHolding();
  EXPECT_FALSE(queues_->drain(steady_clock::now()));
  gate.open();
  EXPECT_TRUE(drain());
}

TEST_F(ThreadPoolWorkQueuesTest, DrainsWhatStepsOfOneClassQueueOnAnother) {
  std::atomic<int> count{0};
  const auto server = makeQueue(QualityOfService::kUserInteractive);
  const auto session = makeQueue(QualityOfService::kUtility);
  for (int i = 0; i < 1000; ++i) {
    server->async([&] {
      session->async([&] {
        queues_->backgroundQueue().asyncAfter(std::chrono::nanoseconds(0),
                                              [&] { ++count; });
      });
    });
  }
  ASSERT_TRUE(drain());
  EXPECT_EQ(count, 1000);
}

TEST_F(ThreadPoolWorkQueuesTest, RunsWhatIsQueuedBeforeItEnds) {
  std::atomic<int> count{0};
  const auto queue = makeQueue();
  for (int i = 0; i < 10000; ++i) queue->async([&count] { ++count; });
  queues_.reset();
  EXPECT_EQ(count, 10000);
}

TEST_F(ThreadPoolWorkQueuesTest, DropsStepsThatAreQueuedAfterItsEnd) {
  bool ran = false;
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  const auto queue = makeQueue();
  queue->async([] {});
  queues_.reset();
  queue->async([&ran, held = std::move(held)] { ran = true; });
  EXPECT_TRUE(watch.expired());
  EXPECT_FALSE(ran);
}

TEST_F(ThreadPoolWorkQueuesTest, MayEndInsideAStepOfItsOwn) {
  std::binary_semaphore ended{0};
  const auto queue = makeQueue();
  queue->async([this, &ended] {
    queues_.reset();
    ended.release();
  });
  ended.acquire();
  EXPECT_EQ(queues_, nullptr);
}

TEST_F(ThreadPoolWorkQueuesTest, KeepsItsTimerThread) {
  std::binary_semaphore ran{0};
  queues_->backgroundQueue().asyncAfter(std::chrono::milliseconds(1),
                                        [&ran] { ran.release(); });
  ran.acquire();
}

TEST_F(ThreadPoolWorkQueuesTest, RunsTheRestOfATurnBeforeWhatCameMeanwhile) {
  constexpr int kSteps = 1000;  // Several turns.
  Gate gate;
  const auto queue = makeQueue();
  const auto other = makeQueue();
  std::vector<int> ran;
  queue->async(gate.holdingStep());
  gate.waitUntilHolding();
  for (int i = 0; i < kSteps; ++i) {
    queue->async([&, i] {
      ran.push_back(i);
      if (i % 100 == 0) queue->async([&ran, i] { ran.push_back(kSteps + i); });
      other->async([] {});
    });
  }
  gate.open();
  ASSERT_TRUE(drain());
  EXPECT_EQ(ran.size(), kSteps + 10u);
  EXPECT_TRUE(std::is_sorted(ran.begin(), ran.end()));
}

TEST_F(ThreadPoolWorkQueuesTest, HoldsNoReferenceToAnIdleQueue) {
  const auto queue = makeQueue();
  queue->async([] {});
  ASSERT_TRUE(drain());
  EXPECT_EQ(queue.use_count(), 1);
}

}  // namespace
}  // namespace ostrel
