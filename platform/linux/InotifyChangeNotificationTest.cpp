#include "platform/linux/InotifyChangeNotification.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <condition_variable>
#include <fstream>
#include <sstream>

#include "platform/linux/Burden.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using testing_support::TemporaryDirectory;

/// Runs steps where they are queued and lets the test wait for them.
class CountingQueue final : public WorkQueue {
 public:
  void async(Task step) override {
    const std::lock_guard lock(mutex_);
    step();
    ++count_;
    changed_.notify_all();
  }
  void suspend() override {}
  void resume(Task) override {}
  bool isCurrent() const override { return false; }
  const std::string& label() const override { return label_; }

  int count() {
    const std::lock_guard lock(mutex_);
    return count_;
  }
  /// Waits until there were `count` steps or more; false when that takes a minute.
  bool waitFor(int count) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, std::chrono::minutes(1),
                             [&] { return count_ >= count; });
  }

 private:
  const std::string label_ = "test";
  std::mutex mutex_;
  std::condition_variable changed_;
  int count_ = 0;
};

class InotifyChangeNotificationPosts : public testing::Test {
 protected:
  std::string file(std::string_view name = "com.example.a") const {
    return directory_ / "notify/" + std::string(name);
  }
  void write(const std::string& path) { std::ofstream(path) << "x"; }

  int add(std::string_view name, const std::shared_ptr<CountingQueue>& queue) {
    const auto registration =
        notification_.registerDispatch(name, queue, [this](int token) {
          const std::lock_guard lock(mutex_);
          tokens_.push_back(token);
        });
    EXPECT_EQ(registration.status, 0);
    return registration.token;
  }
  std::vector<int> tokens() {
    const std::lock_guard lock(mutex_);
    return tokens_;
  }

  const TemporaryDirectory directory_;
  const std::shared_ptr<CountingQueue> queue_ = std::make_shared<CountingQueue>();
  std::mutex mutex_;
  std::vector<int> tokens_;
  InotifyChangeNotification notification_{directory_ / "notify"};
};

TEST_F(InotifyChangeNotificationPosts, CarryTheTokenOfTheirName) {
  const auto other = std::make_shared<CountingQueue>();
  const int first = add("com.example.a", queue_);
  const int second = add("com.example.b", other);
  EXPECT_NE(first, second);
  write(file("com.example.b"));
  ASSERT_TRUE(other->waitFor(1));
  EXPECT_EQ(tokens(), std::vector<int>{second});
  EXPECT_EQ(queue_->count(), 0);
}

TEST_F(InotifyChangeNotificationPosts, AreMadeByWritingReplacingAndTouching) {
  add("com.example.a", queue_);
  write(file());
  EXPECT_TRUE(queue_->waitFor(1));
  write(file("temporary"));
  std::filesystem::rename(file("temporary"), file());
  EXPECT_TRUE(queue_->waitFor(2));
  ::utimensat(AT_FDCWD, file().c_str(), nullptr, 0);
  EXPECT_TRUE(queue_->waitFor(3));
}

TEST_F(InotifyChangeNotificationPosts, ThatComeTogetherArriveAsFew) {
  add("com.example.a", queue_);
  const auto begin = std::chrono::steady_clock::now();
  for (int i = 0; i < 2000; ++i) write(file());
  // The last one arrives too: at the end of the interval, as the second or later.
  EXPECT_TRUE(queue_->waitFor(2));
  const auto intervals = (std::chrono::steady_clock::now() - begin) /
                         InotifyChangeNotification::kShortestInterval;
  EXPECT_LE(queue_->count(), 2 + intervals);
}

/// Runs steps where they are queued, and has none of what came of them run until told.
class HeldSteps {
 public:
  void hold() {
    const std::lock_guard lock(mutex_);
    shares_.push_back(BurdenShare::current());
  }
  std::size_t count() {
    const std::lock_guard lock(mutex_);
    return shares_.size();
  }
  bool waitFor(std::size_t count) {
    return testing_support::eventually([&] { return this->count() >= count; });
  }
  void run() {
    const std::lock_guard lock(mutex_);
    for (BurdenShare& share : shares_) share = BurdenShare();
  }

 private:
  std::mutex mutex_;
  std::vector<BurdenShare> shares_;
};

TEST_F(InotifyChangeNotificationPosts, AreFewerWhileWhatCameOfEarlierOnesWaits) {
  constexpr auto kMost = InotifyChangeNotification::kMostUnderWay;
  HeldSteps steps;
  notification_.registerDispatch("com.example.a", queue_, [&](int) { steps.hold(); });
  std::chrono::steady_clock::time_point last;
  for (std::size_t i = 1; i <= kMost; ++i) {
    last = std::chrono::steady_clock::now();
    write(file());
    ASSERT_TRUE(steps.waitFor(i));
  }
  // It arrives all the same, late.
  write(file());
  ASSERT_TRUE(steps.waitFor(kMost + 1));
  EXPECT_GE(std::chrono::steady_clock::now() - last,
            InotifyChangeNotification::kIntervalBehind);
  EXPECT_EQ(steps.count(), static_cast<std::size_t>(kMost) + 1);
}

TEST_F(InotifyChangeNotificationPosts, AreAsOftenAgainOnceThatHasRun) {
  constexpr auto kMost = InotifyChangeNotification::kMostUnderWay;
  HeldSteps steps;
  notification_.registerDispatch("com.example.a", queue_, [&](int) { steps.hold(); });
  const auto begin = std::chrono::steady_clock::now();
  for (std::size_t i = 1; i <= 2 * kMost; ++i) {
    write(file());
    ASSERT_TRUE(steps.waitFor(i));
    steps.run();
  }
  EXPECT_LT(std::chrono::steady_clock::now() - begin,
            kMost * InotifyChangeNotification::kIntervalBehind);
}

TEST_F(InotifyChangeNotificationPosts, GoOnInADirectoryThatWasRemadeByOthers) {
  add("com.example.a", queue_);
  std::filesystem::remove_all(directory_ / "notify");
  std::filesystem::create_directory(directory_ / "notify");
  // Whether it is watched again already or not: this post is seen.
  write(file());
  EXPECT_TRUE(queue_->waitFor(1));
  write(file());
  EXPECT_TRUE(queue_->waitFor(2));
}

TEST_F(InotifyChangeNotificationPosts, GoOnInADirectoryThatWasReplaced) {
  add("com.example.a", queue_);
  std::filesystem::create_directory(directory_ / "new");
  write(directory_ / "new/com.example.a");
  std::filesystem::rename(directory_ / "notify", directory_ / "old");
  std::filesystem::rename(directory_ / "new", directory_ / "notify");
  EXPECT_TRUE(queue_->waitFor(1));
}

TEST_F(InotifyChangeNotificationPosts, FindADirectoryThatNobodyRemakes) {
  add("com.example.a", queue_);
  std::filesystem::remove_all(directory_ / "notify");
  const auto end = std::chrono::steady_clock::now() + std::chrono::minutes(1);
  while (!std::filesystem::exists(directory_ / "notify")) {
    ASSERT_LT(std::chrono::steady_clock::now(), end);
    std::this_thread::yield();
  }
  write(file());
  EXPECT_TRUE(queue_->waitFor(1));
}

TEST_F(InotifyChangeNotificationPosts, MayComeFromWhoMayWriteTheDirectoryAbove) {
  ASSERT_EQ(::chmod(directory_.path().c_str(), 0770), 0);
  add("com.example.a", queue_);
  struct stat status {};
  ASSERT_EQ(::stat((directory_ / "notify").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0770u);
}

TEST_F(InotifyChangeNotificationPosts, AreRefusedForANameOfNoFile) {
  for (const std::string& name : {std::string(), std::string("a/b"),
                                  std::string("a\0b", 3), std::string(256, 'x')}) {
    const auto registration = notification_.registerDispatch(name, queue_, [](int) {});
    EXPECT_EQ(registration.status, EINVAL) << name;
  }
}

TEST_F(InotifyChangeNotificationPosts, AreRefusedWithoutADirectory) {
  InotifyChangeNotification notification(directory_.write("file", "") + "/notify");
  EXPECT_NE(notification.registerDispatch("a", queue_, [](int) {}).status, 0);
}

// How often the notifications' thread went to sleep.
long switches() {
  long sum = 0;
  for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
    std::ifstream comm(task.path() / "comm");
    std::string name;
    std::getline(comm, name);
    if (name != "notifications") continue;
    std::ifstream status(task.path() / "status");
    for (std::string line; std::getline(status, line);) {
      if (line.rfind("voluntary_ctxt_switches:", 0) == 0) {
        sum += std::stol(line.substr(line.find('\t')));
      }
    }
  }
  return sum;
}

TEST_F(InotifyChangeNotificationPosts, CostFewWakeUpsHoweverManyThereAre) {
  add("com.example.a", queue_);
  write(file());
  ASSERT_TRUE(queue_->waitFor(1));
  const long before = switches();
  const auto begin = std::chrono::steady_clock::now();
  // Those that nobody listens to as well.
  for (int i = 0; i < 5000; ++i) {
    ::utimensat(AT_FDCWD, file().c_str(), nullptr, 0);
    if (i % 50 == 0) write(file(std::to_string(i)));
  }
  // It looks a hundred times a second, and sleeps twice for each look at most.
  const std::chrono::duration<double> took = std::chrono::steady_clock::now() - begin;
  EXPECT_LE(static_cast<double>(switches() - before), 200 * took.count() + 20);
}

TEST_F(InotifyChangeNotificationPosts, CostNoWakeUpWhileThereAreNone) {
  add("com.example.a", queue_);
  write(file());
  ASSERT_TRUE(queue_->waitFor(1));
  // The thread may still be on its way to sleep: wait until it stays there.
  long before = switches();
  int quietIntervals = 0;
  for (int i = 0; i < 100 && quietIntervals < 3; ++i) {
    std::this_thread::sleep_for(InotifyChangeNotification::kShortestInterval);
    const long now = switches();
    quietIntervals = now == before ? quietIntervals + 1 : 0;
    before = now;
  }
  EXPECT_EQ(quietIntervals, 3);
  EXPECT_GT(before, 0);  // It was counted at all.
}

}  // namespace
}  // namespace ostrel
