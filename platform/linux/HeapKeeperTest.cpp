#include "platform/linux/HeapKeeper.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <deque>
#include <memory>
#include <utility>

namespace ostrel {
namespace {

/// When free memory is given back, told by a count in place of a heap.
class HeapKeeping : public testing::Test {
 protected:
  void work(std::size_t rounds) {
    for (std::size_t i = 0; i < rounds; ++i) keeper_->noteWork(now_);
  }
  /// The quiet time after which the keeper looks again passes.
  void look() {
    ASSERT_FALSE(looks_.empty());
    Task look = std::move(looks_.front());
    looks_.pop_front();
    look();
  }

  std::deque<Task> looks_;
  int timesGivenBack_ = 0;
  std::shared_ptr<HeapKeeper> keeper_ = std::make_shared<HeapKeeper>(
      HeapKeeper::Calls{[this](std::chrono::milliseconds delay, Task action) {
                          EXPECT_EQ(delay, HeapKeeper::kQuiet);
                          looks_.push_back(std::move(action));
                        },
                        [this] {
                          ++timesGivenBack_;
                          resident_ = std::min(resident_, used_);
                        },
                        [this] { return resident_; }});

  void workAt(std::size_t residentBytes) {
    resident_ = residentBytes;
    now_ += HeapKeeper::kBetweenLooks;
    keeper_->noteWork(now_);
  }

  HeapKeeper::Clock::time_point now_{std::chrono::hours(1)};
  std::size_t resident_ = 0;
  std::size_t used_ = 0;  // Of that.
};

TEST_F(HeapKeeping, BeginsWithABurstAndLooksOnceForIt) {
  work(HeapKeeper::kRoundsOfBurst - 1);
  EXPECT_EQ(looks_.size(), 0u);
  work(1);
  EXPECT_EQ(looks_.size(), 1u);
  work(2 * HeapKeeper::kRoundsOfBurst);
  EXPECT_EQ(looks_.size(), 1u);
}

TEST_F(HeapKeeping, GoesOnWhileThereIsWork) {
  work(HeapKeeper::kRoundsOfBurst);
  for (int i = 0; i < 5; ++i) {
    look();
    EXPECT_EQ(looks_.size(), 1u);
    work(1);
  }
  EXPECT_EQ(timesGivenBack_, 0);
}

TEST_F(HeapKeeping, EndsOnceAllHasBeenQuiet) {
  work(HeapKeeper::kRoundsOfBurst);
  look();
  EXPECT_EQ(timesGivenBack_, 0) << "there was work";
  look();
  EXPECT_EQ(timesGivenBack_, 1);
  EXPECT_TRUE(looks_.empty());
}

TEST_F(HeapKeeping, BeginsAgainWithTheNextBurst) {
  for (int burst = 1; burst <= 3; ++burst) {
    work(HeapKeeper::kRoundsOfBurst);
    look();
    look();
    EXPECT_EQ(timesGivenBack_, burst);
  }
}

TEST_F(HeapKeeping, EndsWithTheKeeper) {
  work(HeapKeeper::kRoundsOfBurst);
  look();
  keeper_.reset();
  look();
  EXPECT_EQ(timesGivenBack_, 0);
  EXPECT_TRUE(looks_.empty());
}

TEST_F(HeapKeeping, GivesBackInABurstThatGrowsBeyondItsMost) {
  workAt(HeapKeeper::kMostResident - 1);
  workAt(HeapKeeper::kMostResident);
  EXPECT_EQ(timesGivenBack_, 0);
  workAt(HeapKeeper::kMostResident + 1);
  EXPECT_EQ(timesGivenBack_, 1);
}

TEST_F(HeapKeeping, TriesAgainWhenMuchHasComeToWhatWasUsed) {
  used_ = HeapKeeper::kMostResident + 1;
  workAt(used_ + 1);
  ASSERT_EQ(timesGivenBack_, 1);
  workAt(used_ + HeapKeeper::kGrowth);
  EXPECT_EQ(timesGivenBack_, 1) << "there was nothing to give";
  workAt(used_ + HeapKeeper::kGrowth + 1);
  EXPECT_EQ(timesGivenBack_, 2);
}

TEST_F(HeapKeeping, ExpectsLessOnceTheBurstIsSmall) {
  used_ = 2 * HeapKeeper::kMostResident;
  workAt(used_);
  ASSERT_EQ(timesGivenBack_, 1);
  workAt(HeapKeeper::kMostResident - HeapKeeper::kGrowth);
  workAt(HeapKeeper::kMostResident + 1);
  EXPECT_EQ(timesGivenBack_, 2);
}

TEST_F(HeapKeeping, LooksAtTheSizeNowAndThen) {
  workAt(0);
  resident_ = HeapKeeper::kMostResident + 1;
  now_ += HeapKeeper::kBetweenLooks - std::chrono::nanoseconds(1);
  keeper_->noteWork(now_);
  EXPECT_EQ(timesGivenBack_, 0);
  now_ += std::chrono::nanoseconds(1);
  keeper_->noteWork(now_);
  EXPECT_EQ(timesGivenBack_, 1);
}

}  // namespace
}  // namespace ostrel
