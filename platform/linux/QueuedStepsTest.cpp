#include "platform/linux/QueuedSteps.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>

#include <memory>
#include <thread>
#include <vector>

namespace ostrel {
namespace {

using testing::ElementsAre;

class StepListTest : public testing::Test {
 protected:
  QueuedStep* step(int number) {
    return QueuedStep::make([this, number] { ran_.push_back(number); });
  }
  void runAll() {
    while (!list_.empty()) list_.runFirst();
  }

  std::vector<int> ran_;
  StepList list_;
};

TEST_F(StepListTest, RunsStepsInTheirOrder) {
  list_.append(step(1));
  list_.append(step(2));
  list_.prepend(step(0));
  list_.append(step(3));
  runAll();
  EXPECT_THAT(ran_, ElementsAre(0, 1, 2, 3));
}

TEST_F(StepListTest, TakesSteps) {
  list_.prepend(step(2));
  list_.append(step(3));
  StepList other;
  list_.prepend(other);
  other.append(step(0));
  other.append(step(1));
  list_.prepend(other);
  EXPECT_TRUE(other.empty());
  list_.append(step(4));
  runAll();
  EXPECT_THAT(ran_, ElementsAre(0, 1, 2, 3, 4));
}

TEST_F(StepListTest, TakesStepsWhenItHasNone) {
  StepList other;
  other.append(step(0));
  list_.prepend(other);
  list_.append(step(1));
  runAll();
  EXPECT_THAT(ran_, ElementsAre(0, 1));
}

TEST_F(StepListTest, TakesStepsBehindItsOwn) {
  StepList other;
  list_.append(other);
  other.append(step(0));
  other.append(step(1));
  list_.append(other);
  EXPECT_TRUE(other.empty());
  other.append(step(2));
  list_.append(other);
  list_.append(other);
  list_.append(step(3));
  runAll();
  EXPECT_THAT(ran_, ElementsAre(0, 1, 2, 3));
}

TEST_F(StepListTest, IsUsedAgainAfterItsEnd) {
  list_.append(step(0));
  runAll();
  list_.append(step(1));
  list_.append(step(2));
  runAll();
  EXPECT_THAT(ran_, ElementsAre(0, 1, 2));
}

TEST_F(StepListTest, MayGrowWhileItsFirstStepRuns) {
  list_.append(QueuedStep::make([this] { list_.append(step(1)); }));
  runAll();
  EXPECT_THAT(ran_, ElementsAre(1));
}

TEST_F(StepListTest, DropsWhatIsLeft) {
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  {
    StepList list;
    list.append(step(0));
    list.append(QueuedStep::make([held = std::move(held)] {}));
    list.dropFirst();
    EXPECT_FALSE(watch.expired());
  }
  EXPECT_TRUE(watch.expired());
  EXPECT_TRUE(ran_.empty());
}

// More than is kept, made on one thread and ended on another, and back.
TEST(QueuedStep, GoesRoundBetweenThreads) {
  constexpr std::size_t kSteps = 3 * QueuedStep::kMostKept;
  for (int round = 0; round < 3; ++round) {
    StepList list;
    std::size_t count = 0;
    std::thread([&] {
      for (std::size_t i = 0; i < kSteps; ++i) {
        list.append(QueuedStep::make([&count] { ++count; }));
      }
    }).join();
    std::thread([&] {
      while (!list.empty()) list.runFirst();
    }).join();
    EXPECT_EQ(count, kSteps);
  }
}

/// Ends steps when its thread ends, after what the thread keeps of their memory.
struct LastSteps {
  StepList list;
  std::size_t* count = nullptr;
  ~LastSteps() {
    if (count == nullptr) return;
    while (!list.empty()) list.runFirst();
    list.append(QueuedStep::make([count = count] { ++*count; }));
    list.runFirst();
  }
};

TEST(QueuedStep, IsFreedByAThreadThatKeepsNoneAnyMore) {
  constexpr std::size_t kThreads = 200;
  constexpr std::size_t kSteps = 60;
  std::size_t count = 0;
  const std::size_t before = ::mallinfo2().uordblks;
  for (std::size_t i = 0; i < kThreads; ++i) {
    std::thread([&] {
      // Made first, so that it ends last.
      thread_local LastSteps last;
      last.count = &count;
      for (std::size_t j = 0; j < kSteps; ++j) {
        last.list.append(QueuedStep::make([&count] { ++count; }));
      }
    }).join();
  }
  EXPECT_EQ(count, kThreads * (kSteps + 1));
  EXPECT_LT(::mallinfo2().uordblks, before + kThreads * kSteps * sizeof(QueuedStep) / 4);
}

}  // namespace
}  // namespace ostrel
