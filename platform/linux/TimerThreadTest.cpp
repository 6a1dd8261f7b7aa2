#include "platform/linux/TimerThread.h"

#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <semaphore>
#include <vector>

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::steady_clock;

TEST(TimerThread, RunsAnActionNotBeforeItsTime) {
  TimerThread timers;
  std::binary_semaphore ran{0};
  const auto before = steady_clock::now();
  steady_clock::time_point at;
  timers.scheduleAfter(milliseconds(20), [&] {
    at = steady_clock::now();
    ran.release();
  });
  ran.acquire();
  EXPECT_GE(at - before, milliseconds(20));
}

TEST(TimerThread, RunsActionsInTheOrderOfTheirTimes) {
  TimerThread timers;
  std::binary_semaphore ran{0};
  std::vector<int> seen;
  timers.scheduleAfter(milliseconds(60), [&] {
    seen.push_back(3);
    ran.release();
  });
  timers.scheduleAfter(milliseconds(40), [&] { seen.push_back(2); });
  timers.scheduleAfter(milliseconds(20), [&] { seen.push_back(1); });
  ran.acquire();
  EXPECT_EQ(seen, (std::vector<int>{1, 2, 3}));
}

TEST(TimerThread, RunsAnActionThatIsOverdueSoon) {
  TimerThread timers;
  std::counting_semaphore<> ran{0};
  timers.scheduleAfter(nanoseconds(0), [&] { ran.release(); });
  timers.scheduleAfter(nanoseconds::min(), [&] { ran.release(); });
  ran.acquire();
  ran.acquire();
}

TEST(TimerThread, TakesTheLongestDelayThereIs) {
  TimerThread timers;
  std::binary_semaphore ran{0};
  const auto never = timers.scheduleAfter(nanoseconds::max(), [] { FAIL(); });
  timers.scheduleAfter(milliseconds(1), [&] { ran.release(); });
  ran.acquire();
  EXPECT_TRUE(timers.cancel(never));
}

TEST(TimerThread, CancelsWhatHasNotRun) {
  TimerThread timers;
  std::binary_semaphore ran{0};
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  const auto timer =
      timers.scheduleAfter(milliseconds(20), [held = std::move(held)] { FAIL(); });
  EXPECT_TRUE(timers.cancel(timer));
  EXPECT_TRUE(watch.expired());
  EXPECT_FALSE(timers.cancel(timer));
  timers.scheduleAfter(milliseconds(40), [&] { ran.release(); });
  ran.acquire();
}

TEST(TimerThread, SaysThatWhatHasRunCannotBeCancelled) {
  TimerThread timers;
  std::binary_semaphore ran{0};
  const auto timer = timers.scheduleAfter(milliseconds(1), [&] { ran.release(); });
  ran.acquire();
  EXPECT_FALSE(timers.cancel(timer));
  EXPECT_FALSE(timers.cancel({}));
}

TEST(TimerThread, TakesTimersFromItsActions) {
  TimerThread timers;
  std::binary_semaphore ran{0};
  timers.scheduleAfter(milliseconds(1), [&] {
    timers.scheduleAfter(milliseconds(1), [&] { ran.release(); });
  });
  ran.acquire();
}

TEST(TimerThread, DropsAtItsEndWhatHasNotRun) {
  auto held = std::make_shared<int>(0);
  const std::weak_ptr<int> watch = held;
  {
    TimerThread timers;
    timers.scheduleAfter(std::chrono::hours(1), [held = std::move(held)] { FAIL(); });
  }
  EXPECT_TRUE(watch.expired());
}

TEST(TimerThread, MayEndInsideAnAction) {
  std::binary_semaphore ended{0};
  auto timers = std::make_unique<TimerThread>();
  timers->scheduleAfter(milliseconds(1), [&] {
    timers.reset();
    ended.release();
  });
  ended.acquire();
  EXPECT_EQ(timers, nullptr);
}

TEST(TimerThread, CancelsTenThousandTimers) {
  TimerThread timers;
  std::vector<TimerThread::TimerID> ids;
  std::atomic<int> count{0};
  std::binary_semaphore ran{0};
  for (int i = 0; i < 10000; ++i) {
    ids.push_back(timers.scheduleAfter(std::chrono::seconds(9), [&] { ++count; }));
  }
  for (const auto& id : ids) ASSERT_TRUE(timers.cancel(id));
  timers.scheduleAfter(milliseconds(1), [&] { ran.release(); });
  ran.acquire();
  EXPECT_EQ(count, 0);
}

}  // namespace
}  // namespace ostrel
