#include "platform/SmallMutex.h"

#include <gtest/gtest.h>

#include <memory>
#include <mutex>
#include <thread>
#include <vector>

namespace ostrel {
namespace {

TEST(SmallMutex, IsFourBytes) { EXPECT_EQ(sizeof(SmallMutex), 4u); }

TEST(SmallMutex, LetsNobodyInWhileItIsHeld) {
  SmallMutex mutex;
  mutex.lock();
  EXPECT_FALSE(mutex.try_lock());
  mutex.unlock();
  EXPECT_TRUE(mutex.try_lock());
  mutex.unlock();
}

TEST(SmallMutex, LetsOneThreadInAtATime) {
  constexpr int kThreads = 4;
  constexpr int kRounds = 20000;
  SmallMutex mutex;
  int count = 0;
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&] {
      for (int round = 0; round < kRounds; ++round) {
        const std::lock_guard lock(mutex);
        ++count;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(count, kThreads * kRounds);
}

TEST(SmallMutex, WakesEveryThreadThatSleepsOnIt) {
  constexpr int kThreads = 8;
  SmallMutex mutex;
  int count = 0;
  std::vector<std::thread> threads;
  mutex.lock();
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&] {
      const std::lock_guard lock(mutex);
      ++count;
      // Long enough for the others to fall asleep again.
      for (int yields = 0; yields < 1000; ++yields) std::this_thread::yield();
    });
  }
  for (int yields = 0; yields < 1000; ++yields) std::this_thread::yield();
  mutex.unlock();
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(count, kThreads);
}

TEST(SmallMutex, MayBeDestroyedByTheNextHolder) {
  for (int round = 0; round < 500; ++round) {
    struct Shared {
      SmallMutex mutex;
      int holders = 0;
    };
    auto* const shared = new Shared;
    const auto useOnce = [shared] {
      shared->mutex.lock();
      const bool isLast = ++shared->holders == 2;
      shared->mutex.unlock();
      if (isLast) delete shared;
    };
    std::thread other(useOnce);
    useOnce();
    other.join();
  }
}

}  // namespace
}  // namespace ostrel
