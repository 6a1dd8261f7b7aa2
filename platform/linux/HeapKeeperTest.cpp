#include "platform/linux/HeapKeeper.h"

#include <gtest/gtest.h>

#include <deque>
#include <memory>
#include <utility>

namespace ostrel {
namespace {

/// When free memory is given back, told by a count in place of a heap.
class HeapKeeping : public testing::Test {
 protected:
  void work(std::size_t rounds) {
    for (std::size_t i = 0; i < rounds; ++i) keeper_->noteWork();
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
                        [this] { ++timesGivenBack_; }});
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

}  // namespace
}  // namespace ostrel
