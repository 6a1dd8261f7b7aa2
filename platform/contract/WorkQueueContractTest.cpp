#include <atomic>
#include <mutex>
#include <numeric>
#include <semaphore>

#include "platform/contract/Time.h"

namespace ostrel {
namespace {

template <typename Time>
class WorkQueueContract : public testing::Test {
 protected:
  std::shared_ptr<WorkQueue> makeQueue(
      QualityOfService qualityOfService = QualityOfService::kUtility) {
    return time_.queues().makeSerialQueue("contract", qualityOfService,
                                          /*relativePriority=*/0);
  }

  // A step that writes `text` down.
  Task note(std::string text) {
    return [this, text = std::move(text)] {
      const std::lock_guard lock(mutex_);
      notes_.push_back(text);
    };
  }

  std::vector<std::string> notes() {
    const std::lock_guard lock(mutex_);
    return notes_;
  }

  std::mutex mutex_;
  std::vector<std::string> notes_;
  Time time_;
};

using Times = testing::Types<ManualTime, RealTime>;
TYPED_TEST_SUITE(WorkQueueContract, Times);

using testing::ElementsAre;

TYPED_TEST(WorkQueueContract, RunsStepsInTheOrderInWhichTheyWereQueued) {
  const auto queue = this->makeQueue();
  std::vector<int> seen;
  for (int i = 0; i < 1000; ++i) {
    queue->async([&seen, i] { seen.push_back(i); });
  }
  ASSERT_TRUE(this->time_.settle());
  std::vector<int> expected(1000);
  std::iota(expected.begin(), expected.end(), 0);
  EXPECT_EQ(seen, expected);
}

TYPED_TEST(WorkQueueContract, RunsAStepThatAStepQueuedAfterTheLatterEnded) {
  const auto queue = this->makeQueue();
  queue->async([this, &queue] {
    queue->async(this->note("inner"));
    this->note("end of outer")();
  });
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("end of outer", "inner"));
}

TYPED_TEST(WorkQueueContract, KeepsTheOrderOfEachOfManyThreadsThatQueue) {
  constexpr int kThreads = 8;
  constexpr int kSteps = 500;
  const auto queue = this->makeQueue();
  std::vector<std::vector<int>> seen(kThreads);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&queue, &seen, t] {
      for (int i = 0; i < kSteps; ++i) {
        queue->async([&seen, t, i] { seen[t].push_back(i); });
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  ASSERT_TRUE(this->time_.settle());
  std::vector<int> expected(kSteps);
  std::iota(expected.begin(), expected.end(), 0);
  for (const auto& ofThread : seen) EXPECT_EQ(ofThread, expected);
}

TYPED_TEST(WorkQueueContract, RunsOneStepOfAQueueAtATime) {
  const auto queue = this->makeQueue();
  std::atomic<int> running{0};
  std::atomic<int> most{0};
  for (int i = 0; i < 2000; ++i) {
    queue->async([&] {
      most = std::max(most.load(), ++running);
      --running;
    });
  }
  ASSERT_TRUE(this->time_.settle());
  EXPECT_EQ(most, 1);
}

TYPED_TEST(WorkQueueContract, IsCurrentInsideItsStepsOnly) {
  const auto queue = this->makeQueue();
  const auto other = this->makeQueue();
  bool inOwn = false;
  bool inOther = true;
  queue->async([&] { inOwn = queue->isCurrent(); });
  other->async([&] { inOther = queue->isCurrent(); });
  ASSERT_TRUE(this->time_.settle());
  EXPECT_TRUE(inOwn);
  EXPECT_FALSE(inOther);
  EXPECT_FALSE(queue->isCurrent());
}

TYPED_TEST(WorkQueueContract, HasTheLabelItWasGivenAndSharesItWithOthers) {
  const auto queue = this->makeQueue();
  const auto other = this->makeQueue();
  EXPECT_EQ(queue->label(), "contract");
  EXPECT_EQ(other->label(), "contract");
}

TYPED_TEST(WorkQueueContract, ServesEveryQualityOfServiceAndPriority) {
  for (const auto quality : {QualityOfService::kUserInteractive,
                             QualityOfService::kUtility, QualityOfService::kBackground}) {
    for (const int priority : {0, -1, -15}) {
      const auto queue = this->time_.queues().makeSerialQueue("any", quality, priority);
      queue->async(this->note("ran"));
    }
  }
  ASSERT_TRUE(this->time_.settle());
  EXPECT_EQ(this->notes().size(), 9u);
}

TYPED_TEST(WorkQueueContract, RunsWhatWasQueuedAfterItsOwnerReleasedIt) {
  auto queue = this->makeQueue();
  const std::weak_ptr<WorkQueue> watch = queue;
  queue->async(this->note("first"));
  queue->async(this->note("second"));
  queue.reset();
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("first", "second"));
  EXPECT_TRUE(this->time_.reaches([&] { return watch.expired(); }));
}

TYPED_TEST(WorkQueueContract, MayLoseItsLastOwnerInsideItsOwnStep) {
  auto queue = this->makeQueue();
  const std::weak_ptr<WorkQueue> watch = queue;
  std::binary_semaphore othersAreGone{0};
  queue->async([&othersAreGone, owner = queue]() mutable {
    othersAreGone.acquire();
    owner.reset();
  });
  queue->async(this->note("after"));
  queue.reset();
  othersAreGone.release();
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("after"));
  EXPECT_TRUE(this->time_.reaches([&] { return watch.expired(); }));
}

TYPED_TEST(WorkQueueContract, DestroysAStepBeforeTheNextOneRuns) {
  const auto queue = this->makeQueue();
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  bool wasGone = false;
  queue->async([held = std::move(held)] {});
  queue->async([&] { wasGone = watch.expired(); });
  ASSERT_TRUE(this->time_.settle());
  EXPECT_TRUE(wasGone);
}

TYPED_TEST(WorkQueueContract, LetsTheEndOfAStepQueueOnTheSameQueue) {
  const auto queue = this->makeQueue();
  std::shared_ptr<void> queuesAtItsEnd(
      nullptr, [this, &queue](void*) { queue->async(this->note("queued at the end")); });
  queue->async([held = queuesAtItsEnd] {});
  queue->async(this->note("second"));
  queuesAtItsEnd.reset();
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(),
              testing::UnorderedElementsAre("second", "queued at the end"));
}

TYPED_TEST(WorkQueueContract, HoldsItsStepsBackFromTheEndOfTheSuspendingStep) {
  const auto queue = this->makeQueue();
  queue->async([this, &queue] {
    queue->suspend();
    this->note("rest of the step")();
  });
  queue->async(this->note("held"));
  ASSERT_TRUE(this->time_.settle());
  queue->async(this->note("held too"));
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("rest of the step"));
  queue->resume([] {});
  ASSERT_TRUE(this->time_.settle());
}

TYPED_TEST(WorkQueueContract, RunsTheResumingStepBeforeAllThatWaits) {
  const auto queue = this->makeQueue();
  queue->async([&queue] { queue->suspend(); });
  queue->async(this->note("waited"));
  ASSERT_TRUE(this->time_.settle());
  queue->resume(this->note("first"));
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("first", "waited"));
}

TYPED_TEST(WorkQueueContract, MayBeResumedWhileTheSuspendingStepRuns) {
  const auto queue = this->makeQueue();
  queue->async([this, &queue] {
    queue->async(this->note("waited"));
    queue->suspend();
    std::thread([&queue, first = this->note("first")]() mutable {
      queue->resume(std::move(first));
    }).join();
    this->note("suspending step")();
  });
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("suspending step", "first", "waited"));
}

TYPED_TEST(WorkQueueContract, MayBeSuspendedAgainByTheResumingStep) {
  const auto queue = this->makeQueue();
  queue->async([&queue] { queue->suspend(); });
  queue->async(this->note("waited"));
  ASSERT_TRUE(this->time_.settle());
  queue->resume([&queue] { queue->suspend(); });
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre());
  queue->resume(this->note("first"));
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("first", "waited"));
}

TYPED_TEST(WorkQueueContract, MayBeSuspendedAgainInTheStepThatWasResumed) {
  const auto queue = this->makeQueue();
  queue->async([this, &queue] {
    queue->suspend();
    queue->resume(this->note("earlier"));
    queue->suspend();
  });
  queue->async(this->note("waited"));
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre());
  queue->resume(this->note("later"));
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("later", "earlier", "waited"));
}

TYPED_TEST(WorkQueueContract, IsCurrentInTheResumingStep) {
  const auto queue = this->makeQueue();
  bool isCurrent = false;
  queue->async([&queue] { queue->suspend(); });
  ASSERT_TRUE(this->time_.settle());
  queue->resume([&] { isCurrent = queue->isCurrent(); });
  ASSERT_TRUE(this->time_.settle());
  EXPECT_TRUE(isCurrent);
}

TYPED_TEST(WorkQueueContract, HoldsNoOtherQueueBackWhileSuspended) {
  const auto queue = this->makeQueue();
  const auto other = this->makeQueue();
  queue->async([&queue] { queue->suspend(); });
  queue->async(this->note("held"));
  other->async(this->note("other"));
  ASSERT_TRUE(this->time_.settle());
  EXPECT_THAT(this->notes(), ElementsAre("other"));
  queue->resume([] {});
  ASSERT_TRUE(this->time_.settle());
}

TYPED_TEST(WorkQueueContract, DropsWhatWaitsWhenItIsReleasedSuspended) {
  auto queue = this->makeQueue();
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  queue->async([&queue] { queue->suspend(); });
  queue->async([held = std::move(held)] {});
  ASSERT_TRUE(this->time_.settle());
  EXPECT_FALSE(watch.expired());
  queue.reset();
  EXPECT_TRUE(watch.expired());
}

TYPED_TEST(WorkQueueContract, EndsTheProcessWhenSuspendedOffTheQueue) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(this->makeQueue()->suspend(), "queue");
}

TYPED_TEST(WorkQueueContract, EndsTheProcessWhenResumedWithoutASuspension) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(this->makeQueue()->resume([] {}), "resume");
}

template <typename Time>
class ConcurrentQueueContract : public testing::Test {
 protected:
  Time time_;
};
TYPED_TEST_SUITE(ConcurrentQueueContract, Times);

using std::chrono::milliseconds;
using std::chrono::nanoseconds;

TYPED_TEST(ConcurrentQueueContract, RunsEveryStepOnce) {
  std::atomic<int> count{0};
  for (int i = 0; i < 500; ++i) {
    this->time_.queues().backgroundQueue().asyncAfter(nanoseconds(0), [&] { ++count; });
  }
  ASSERT_TRUE(this->time_.settle());
  EXPECT_EQ(count, 500);
}

TYPED_TEST(ConcurrentQueueContract, NeverRunsAStepInline) {
  std::atomic<bool> ranInline{false};
  std::atomic<int> count{0};
  const auto caller = std::make_shared<std::thread::id>(std::this_thread::get_id());
  std::atomic<bool> isInCall{true};
  this->time_.queues().backgroundQueue().asyncAfter(nanoseconds(0), [&] {
    ranInline = isInCall && std::this_thread::get_id() == *caller;
    ++count;
  });
  isInCall = false;
  ASSERT_TRUE(this->time_.settle());
  EXPECT_EQ(count, 1);
  EXPECT_FALSE(ranInline);
}

TYPED_TEST(ConcurrentQueueContract, RunsADelayedStepNotBeforeItsTime) {
  const nanoseconds before = this->time_.clock().monotonicNow();
  std::atomic<std::int64_t> ranAt{0};
  this->time_.queues().backgroundQueue().asyncAfter(
      milliseconds(30), [&] { ranAt = this->time_.clock().monotonicNow().count(); });
  ASSERT_TRUE(this->time_.reaches([&] { return ranAt != 0; }));
  EXPECT_GE(nanoseconds(ranAt) - before, milliseconds(30));
}

TYPED_TEST(ConcurrentQueueContract, LetsAStepWithoutDelayPassADelayedOne) {
  std::mutex mutex;
  std::vector<int> seen;
  const auto note = [&](int what) {
    const std::lock_guard lock(mutex);
    seen.push_back(what);
  };
  ConcurrentQueue& queue = this->time_.queues().backgroundQueue();
  queue.asyncAfter(milliseconds(100), [&] { note(2); });
  queue.asyncAfter(milliseconds(0), [&] { note(1); });
  ASSERT_TRUE(this->time_.reaches([&] {
    const std::lock_guard lock(mutex);
    return seen.size() == 2;
  }));
  EXPECT_THAT(seen, testing::ElementsAre(1, 2));
}

TYPED_TEST(ConcurrentQueueContract, LeavesADelayedStepOutWhenItSettles) {
  std::atomic<bool> ran{false};
  auto held = std::make_shared<int>(0);
  this->time_.queues().backgroundQueue().asyncAfter(std::chrono::hours(1),
                                                    [&ran, held] { ran = true; });
  EXPECT_TRUE(this->time_.settle());
  EXPECT_FALSE(ran);
  EXPECT_EQ(held.use_count(), 2);
}

}  // namespace
}  // namespace ostrel
