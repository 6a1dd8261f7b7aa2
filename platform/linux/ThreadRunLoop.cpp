// A loop and its timers share one lock, the loop's. A timer belongs to no loop
// until it is added; its own lock guards which loop it has, and is taken before
// that loop's.
#include "platform/linux/ThreadRunLoop.h"

#include <pthread.h>

#include <algorithm>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <utility>

namespace ostrel {
namespace {

using SteadyTime = std::chrono::steady_clock::time_point;

SteadyTime dueAfter(std::chrono::nanoseconds delay) {
  const SteadyTime now = std::chrono::steady_clock::now();
  const auto longest = SteadyTime::max() - now;
  return now + std::clamp<std::chrono::nanoseconds>(
                   delay, std::chrono::nanoseconds::zero(), longest);
}

class ThreadTimer;

/// What a loop and its timers share.
struct Timetable {
  using Key = std::pair<SteadyTime, std::uint64_t>;

  std::mutex mutex;
  std::condition_variable changed;
  std::map<Key, std::shared_ptr<ThreadTimer>> timers;
  std::uint64_t lastNumber = 0;
};

class ThreadTimer final : public RunLoopTimer {
 public:
  ThreadTimer(SteadyTime due, Task action) : due_(due), action_(std::move(action)) {}

  void setFireDate(std::chrono::nanoseconds delay) override {
    const std::lock_guard lock(mutex_);
    const SteadyTime due = dueAfter(delay);
    if (timetable_ == nullptr) {
      due_ = due;
      return;
    }
    const std::lock_guard timetableLock(timetable_->mutex);
    auto entry = timetable_->timers.extract({due_, number_});
    if (entry.empty()) return;
    due_ = due;
    entry.key() = {due_, number_};
    timetable_->timers.insert(std::move(entry));
    timetable_->changed.notify_one();
  }

  void invalidate() override {
    std::shared_ptr<ThreadTimer> self;  // Released after the locks.
    Task action;
    const std::lock_guard lock(mutex_);
    action = std::exchange(action_, {});
    if (timetable_ == nullptr) return;
    const std::lock_guard timetableLock(timetable_->mutex);
    auto entry = timetable_->timers.extract({due_, number_});
    if (entry.empty()) return;
    self = std::move(entry.mapped());
    timetable_->changed.notify_one();
  }

  static void addTo(const std::shared_ptr<Timetable>& timetable,
                    const std::shared_ptr<ThreadTimer>& timer) {
    const std::lock_guard lock(timer->mutex_);
    if (timer->timetable_ != nullptr || !timer->action_) return;
    timer->timetable_ = timetable;
    const std::lock_guard timetableLock(timetable->mutex);
    timer->number_ = ++timetable->lastNumber;
    timetable->timers.emplace(Timetable::Key{timer->due_, timer->number_}, timer);
  }

  void fire() {
    Task action;
    {
      const std::lock_guard lock(mutex_);
      action = std::exchange(action_, {});
    }
    if (action) action();
  }

 private:
  std::mutex mutex_;
  SteadyTime due_;
  Task action_;                           // Empty once fired or invalid.
  std::shared_ptr<Timetable> timetable_;  // None until added.
  std::uint64_t number_ = 0;
};

class ThreadRunLoop final : public RunLoop {
 public:
  ThreadRunLoop() = default;
  ThreadRunLoop(const ThreadRunLoop&) = delete;
  ThreadRunLoop& operator=(const ThreadRunLoop&) = delete;

  // Timers that never fired hold the timetable, and it them.
  ~ThreadRunLoop() override {
    std::map<Timetable::Key, std::shared_ptr<ThreadTimer>> timers;
    const std::lock_guard lock(timetable_->mutex);
    timers.swap(timetable_->timers);
  }

  void add(const std::shared_ptr<RunLoopTimer>& timer) override {
    ThreadTimer::addTo(timetable_, std::static_pointer_cast<ThreadTimer>(timer));
  }

  void run() override {
    while (const std::shared_ptr<ThreadTimer> timer = waitForNext()) timer->fire();
  }

 private:
  // None when no timer is left.
  std::shared_ptr<ThreadTimer> waitForNext() {
    std::unique_lock lock(timetable_->mutex);
    while (!timetable_->timers.empty()) {
      const auto first = timetable_->timers.begin();
      const SteadyTime due = first->first.first;
      if (due <= std::chrono::steady_clock::now()) {
        return std::move(timetable_->timers.extract(first).mapped());
      }
      timetable_->changed.wait_until(lock, due);
    }
    return nullptr;
  }

  const std::shared_ptr<Timetable> timetable_ = std::make_shared<Timetable>();
};

}  // namespace

void ThreadRunLoopFactory::startThread(std::string_view name,
                                       std::function<void(RunLoop&)> body) {
  constexpr std::size_t kLongestName = 15;
  std::thread([name = std::string(name.substr(0, kLongestName)), body = std::move(body)] {
    pthread_setname_np(pthread_self(), name.c_str());
    ThreadRunLoop loop;
    body(loop);
  }).detach();
}

std::shared_ptr<RunLoopTimer> ThreadRunLoopFactory::makeTimer(
    std::chrono::nanoseconds delay, Task action) {
  return std::make_shared<ThreadTimer>(dueAfter(delay), std::move(action));
}

void ThreadRunLoopFactory::sleep(std::chrono::nanoseconds duration) {
  std::this_thread::sleep_for(duration);
}

}  // namespace ostrel
