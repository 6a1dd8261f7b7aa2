#include "platform/linux/DeadlineRunner.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <thread>
#include <vector>

namespace ostrel {
namespace {

using Result = DeadlineRunner::Result;
constexpr std::chrono::minutes kLong{1};

/// Runs a call that hangs until it has begun, however slowly threads start.
Result runHanging(DeadlineRunner& runner, const std::function<void()>& call) {
  for (std::chrono::milliseconds wait{1}; wait < kLong; wait *= 2) {
    const auto result = runner.run(call, wait);
    if (result != Result::kNotRun) return result;
  }
  return Result::kNotRun;
}

TEST(DeadlineRunner, RunsACallOnAnotherThread) {
  DeadlineRunner runner(/*mostThreads=*/1);
  std::thread::id thread;
  EXPECT_EQ(runner.run([&] { thread = std::this_thread::get_id(); }, kLong),
            Result::kDone);
  EXPECT_NE(thread, std::thread::id());
  EXPECT_NE(thread, std::this_thread::get_id());
}

TEST(DeadlineRunner, UsesItsThreadAgain) {
  DeadlineRunner runner(/*mostThreads=*/8);
  std::thread::id first;
  std::thread::id second;
  runner.run([&] { first = std::this_thread::get_id(); }, kLong);
  runner.run([&] { second = std::this_thread::get_id(); }, kLong);
  EXPECT_EQ(first, second);
}

TEST(DeadlineRunner, ReturnsWhileACallHangs) {
  DeadlineRunner runner(/*mostThreads=*/1);
  std::promise<void> answer;
  EXPECT_EQ(runHanging(runner, [future = answer.get_future().share()] { future.wait(); }),
            Result::kOverrun);
  EXPECT_EQ(runner.overrunning(), 1u);
  answer.set_value();
  while (runner.overrunning() != 0) std::this_thread::yield();
  EXPECT_EQ(runner.run([] {}, kLong), Result::kDone);
}

TEST(DeadlineRunner, StartsNoMoreThreadsThanItMay) {
  DeadlineRunner runner(/*mostThreads=*/3);
  std::promise<void> answer;
  const auto future = answer.get_future().share();
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(runHanging(runner, [future] { future.wait(); }), Result::kOverrun);
  }
  EXPECT_EQ(runner.run([] {}, kLong), Result::kNotRun);
  answer.set_value();
}

TEST(DeadlineRunner, DoesNotWaitForAHangingCallAtItsEnd) {
  std::promise<void> answer;
  std::promise<void> ended;
  {
    DeadlineRunner runner(/*mostThreads=*/1);
    runHanging(runner, [future = answer.get_future().share(), &ended] {
      future.wait();
      ended.set_value();
    });
  }
  answer.set_value();
  ended.get_future().wait();
}

TEST(DeadlineRunner, ServesManyCallersAtOnce) {
  DeadlineRunner runner(/*mostThreads=*/4);
  std::atomic<int> done = 0;
  std::atomic<int> refused = 0;
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 500; ++i) {
        const auto result = runner.run([&] { ++done; }, kLong);
        if (result == Result::kNotRun) ++refused;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(done + refused, 8 * 500);
  EXPECT_GT(done, 0);
}

}  // namespace
}  // namespace ostrel
