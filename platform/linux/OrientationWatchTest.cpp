#include "platform/linux/OrientationWatch.h"

#include <gtest/gtest.h>
#include <poll.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "platform/linux/LinuxOrientationService.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using Code = OrientationSource::Code;

/// Hands on what a test says, until the stop.
class ScriptedOrientation final : public OrientationSource {
 public:
  struct Shared {
    std::mutex mutex;
    std::condition_variable changed;
    const Report* report = nullptr;
    int runs = 0;
    bool isConfigured = true;
  };

  explicit ScriptedOrientation(std::shared_ptr<Shared> shared)
      : shared_(std::move(shared)) {}

  bool isConfigured() const override { return shared_->isConfigured; }
  void run(int stopDescriptor, const Report& report) override {
    {
      const std::lock_guard lock(shared_->mutex);
      shared_->report = &report;
      ++shared_->runs;
      shared_->changed.notify_all();
    }
    waitForStop(stopDescriptor, std::chrono::minutes(1));
    const std::lock_guard lock(shared_->mutex);
    shared_->report = nullptr;
    shared_->changed.notify_all();
  }

 private:
  const std::shared_ptr<Shared> shared_;
};

class OrientationWatchObservers : public testing::Test {
 protected:
  // Says `code` in the source's name, on this thread: the watch does not care.
  void say(Code code) {
    std::unique_lock lock(shared_->mutex);
    shared_->changed.wait(lock, [&] { return shared_->report != nullptr; });
    (*shared_->report)(code);
  }
  void waitUntilStopped() {
    std::unique_lock lock(shared_->mutex);
    shared_->changed.wait(lock, [&] { return shared_->report == nullptr; });
  }
  OrientationWatch::Callback appendTo(std::vector<Code>& codes) {
    return [&codes](Code code) { codes.push_back(code); };
  }

  const std::shared_ptr<ScriptedOrientation::Shared> shared_ =
      std::make_shared<ScriptedOrientation::Shared>();
  std::vector<Code> first_;
  std::vector<Code> second_;
  OrientationWatch watch_{"test", std::make_unique<ScriptedOrientation>(shared_)};
};

TEST_F(OrientationWatchObservers, BeyondTheLimitTakeThePlaceOfTheOldest) {
  constexpr std::size_t kMost = 3;
  OrientationWatch watch("test", std::make_unique<ScriptedOrientation>(shared_), kMost);
  std::vector<std::weak_ptr<int>> kept;
  const auto add = [&](const std::string& id) {
    auto mark = std::make_shared<int>();
    kept.push_back(mark);
    watch.add(id, [mark = std::move(mark)](Code) {});
  };
  const auto keptNow = [&] {
    std::string now;
    for (const auto& each : kept) now += each.expired() ? '-' : '+';
    return now;
  };
  for (const char* id : {"a", "b"}) add(id);
  EXPECT_EQ(keptNow(), "++");
  add("c");
  EXPECT_EQ(keptNow(), "+++");
  add("d");
  EXPECT_EQ(keptNow(), "-+++");
  watch.remove("c");
  add("b");  // Again: it is the youngest now.
  EXPECT_EQ(keptNow(), "---++");
  add("e");
  EXPECT_EQ(keptNow(), "---+++");
  add("f");
  EXPECT_EQ(keptNow(), "----+++");
}

TEST_F(OrientationWatchObservers, AreToldChangesOnly) {
  watch_.add("a", appendTo(first_));
  say(1);
  say(1);
  EXPECT_TRUE(first_.empty());
  say(2);
  say(2);
  say(1);
  EXPECT_EQ(first_, (std::vector<Code>{2, 1}));
}

TEST_F(OrientationWatchObservers, AreAllTold) {
  watch_.add("a", appendTo(first_));
  say(1);
  watch_.add("b", appendTo(second_));
  say(2);
  EXPECT_EQ(first_, (std::vector<Code>{2}));
  EXPECT_EQ(second_, (std::vector<Code>{2}));
}

TEST_F(OrientationWatchObservers, ReplaceOneOfTheSameId) {
  watch_.add("a", appendTo(first_));
  watch_.add("a", appendTo(second_));
  say(1);
  say(2);
  EXPECT_TRUE(first_.empty());
  EXPECT_EQ(second_, (std::vector<Code>{2}));
}

TEST_F(OrientationWatchObservers, AreNotToldAfterTheyWereRemoved) {
  watch_.add("a", appendTo(first_));
  watch_.add("b", appendTo(second_));
  say(1);
  watch_.remove("a");
  watch_.remove("unknown");
  say(2);
  EXPECT_TRUE(first_.empty());
  EXPECT_EQ(second_, (std::vector<Code>{2}));
}

TEST_F(OrientationWatchObservers, StartAndStopTheSource) {
  EXPECT_EQ(shared_->runs, 0);
  watch_.add("a", appendTo(first_));
  say(1);
  watch_.remove("a");
  waitUntilStopped();
  watch_.add("a", appendTo(first_));
  say(2);  // What holds now.
  EXPECT_TRUE(first_.empty());
  say(3);
  EXPECT_EQ(first_, (std::vector<Code>{3}));
}

TEST_F(OrientationWatchObservers, CostNoThreadWithoutASource) {
  shared_->isConfigured = false;
  watch_.add("a", appendTo(first_));
  watch_.remove("a");
  EXPECT_EQ(shared_->runs, 0);
}

TEST_F(OrientationWatchObservers, MayComeAndGoWithinACallback) {
  watch_.add("a", [this](Code code) {
    first_.push_back(code);
    watch_.remove("a");
    watch_.add("b", appendTo(second_));
  });
  say(1);
  say(2);
  EXPECT_EQ(first_, (std::vector<Code>{2}));
}

TEST_F(OrientationWatchObservers, MayEndWhenTheyAreRemoved) {
  // The end of an observer removes another, as the end of a session may.
  const std::shared_ptr<void> guard(nullptr, [this](void*) { watch_.remove("b"); });
  watch_.add("b", appendTo(second_));
  watch_.add("a", [guard](Code) {});
  watch_.remove("a");
  watch_.add("a", appendTo(first_));
}

TEST_F(OrientationWatchObservers, AreSparedAFlood) {
  watch_.add("a", appendTo(first_));
  const auto begin = std::chrono::steady_clock::now();
  constexpr std::size_t kFlood = 10000;
  for (std::size_t i = 0; i < kFlood; ++i) say(static_cast<Code>(1 + i % 2));
  const std::chrono::duration<double> time = std::chrono::steady_clock::now() - begin;
  EXPECT_GE(first_.size(),
            static_cast<std::size_t>(OrientationWatch::kMostChangesPerSecond - 1));
  EXPECT_LE(static_cast<double>(first_.size()),
            OrientationWatch::kMostChangesPerSecond * (1.1 + time.count()));
}

TEST_F(OrientationWatchObservers, ComeAndGoOnManyThreads) {
  std::atomic<bool> isDone = false;
  std::thread source([&] {
    for (Code code = 0; !isDone; ++code) {
      const std::lock_guard lock(shared_->mutex);
      if (shared_->report != nullptr) (*shared_->report)(code);
    }
  });
  std::atomic<int> calls = 0;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 2000; ++i) {
        const std::string id = std::to_string(t) + std::to_string(i % 3);
        watch_.add(id, [&calls](Code) { ++calls; });
        watch_.remove(id);
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  isDone = true;
  source.join();
}

TEST(LinuxOrientationService, NamesEveryCode) {
  const LinuxOrientationService service;
  EXPECT_EQ(service.orientationName(0), "undefined");
  EXPECT_EQ(service.orientationName(1), "normal");
  EXPECT_EQ(service.orientationName(2), "bottom-up");
  EXPECT_EQ(service.orientationName(3), "left-up");
  EXPECT_EQ(service.orientationName(4), "right-up");
  EXPECT_EQ(service.orientationName(16), "normal");
  EXPECT_EQ(service.orientationName(17), "90");
  EXPECT_EQ(service.orientationName(18), "180");
  EXPECT_EQ(service.orientationName(19), "270");
  EXPECT_EQ(service.orientationName(20), "flipped");
  EXPECT_EQ(service.orientationName(23), "flipped-270");
  for (const Code code : {INT32_MIN, -1, 5, 15, 24, INT32_MAX}) {
    EXPECT_EQ(service.orientationName(code), "unknown") << code;
  }
}

}  // namespace
}  // namespace ostrel
