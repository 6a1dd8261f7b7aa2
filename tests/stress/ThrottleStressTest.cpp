#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <mutex>
#include <set>
#include <thread>
#include <vector>

#include "Statistics/Service/OstrelReportingBlockThrottle.h"
#include "platform/linux/ThreadRunLoop.h"

namespace ostrel {
namespace {

constexpr int kCallers = 16;
constexpr int kMessagesPerCaller = 500;
constexpr int kSharedKeys = 8;

/// What the worker delivered. Shared with blocks, which may outlive the test.
struct Delivered {
  std::array<std::atomic<int>, kCallers * kMessagesPerCaller> own{};
  std::array<std::atomic<int>, kSharedKeys> shared{};
  std::mutex mutex;
  std::set<std::thread::id> threads;

  void noteThread() {
    const std::lock_guard lock(mutex);
    threads.insert(std::this_thread::get_id());
  }
};

// Every caller adds messages that nobody else adds, and messages that all add.
TEST(ThrottleStress, DeliversEachMessageOfSixteenCallersOnOneThread) {
  const auto throttle =
      OstrelReportingBlockThrottle::init(std::make_shared<ThreadRunLoopFactory>());
  const auto delivered = std::make_shared<Delivered>();
  const auto add = [&](std::string name, std::function<void()> note) {
    throttle->addMessageBlock(
        [delivered, note = std::move(note)] {
          delivered->noteThread();
          note();
        },
        ReporterID{1}, {{"name", name}, {"_throttle_seconds", 0.01}}, MessageCategory{1},
        MessageType{0});
  };

  std::vector<std::thread> callers;
  for (int caller = 0; caller < kCallers; ++caller) {
    callers.emplace_back([&, caller] {
      for (int i = 0; i < kMessagesPerCaller; ++i) {
        const int own = caller * kMessagesPerCaller + i;
        const int shared = i % kSharedKeys;
        add("own " + std::to_string(own), [delivered, own] { ++delivered->own[own]; });
        add("shared " + std::to_string(shared),
            [delivered, shared] { ++delivered->shared[shared]; });
      }
    });
  }
  for (std::thread& caller : callers) caller.join();
  for (int i = 0; i < 10; ++i) throttle->waitForCompletion();

  for (const std::atomic<int>& count : delivered->own) ASSERT_EQ(count, 1);
  for (const std::atomic<int>& count : delivered->shared) {
    EXPECT_GE(count, 1);
    EXPECT_LE(count, kCallers * kMessagesPerCaller / kSharedKeys + kCallers);
  }
  EXPECT_EQ(delivered->threads.size(), 1u);
  EXPECT_EQ(delivered->threads.count(std::this_thread::get_id()), 0u);
  throttle->setShouldKeepRunning(false);
}

}  // namespace
}  // namespace ostrel
