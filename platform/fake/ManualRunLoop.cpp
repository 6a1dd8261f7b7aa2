// A thread waits by giving its turn back to the test's thread; a timer of the
// manual clock gives it the next one. So every piece of work is bounded by two
// hand-overs, and nothing runs at the same time as anything else.
#include "platform/fake/ManualRunLoop.h"

#include <algorithm>
#include <condition_variable>
#include <map>
#include <mutex>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "platform/fake/FakeUse.h"

namespace ostrel {
namespace {

// Unwinds a thread whose factory goes.
struct EndOfThread {};

constexpr std::chrono::nanoseconds atLeastZero(std::chrono::nanoseconds duration) {
  return std::max(duration, std::chrono::nanoseconds::zero());
}

}  // namespace

/// Whose turn it is.
class ManualRunLoopFactory::Turns {
 public:
  /// Starts a thread that runs `body` from its first turn on; returns its number.
  std::size_t start(std::function<void(std::size_t thread)> body) {
    const std::lock_guard lock(mutex_);
    const std::size_t thread = threads_.size() + 1;
    threads_.emplace_back(
        [this, thread, body = std::move(body)] { runThread(thread, body); });
    numbers_[threads_.back().get_id()] = thread;
    return thread;
  }

  /// The number of the calling thread; 0 for one that was not started here.
  std::size_t current() const {
    const std::lock_guard lock(mutex_);
    const auto entry = numbers_.find(std::this_thread::get_id());
    return entry != numbers_.end() ? entry->second : 0;
  }

  /// Gives `thread` its turn and waits until it gives it back. Called by the
  /// test's thread.
  void give(std::size_t thread) {
    std::unique_lock lock(mutex_);
    if (isEnding_ || finished_.count(thread) != 0) return;
    turn_ = thread;
    changed_.notify_all();
    changed_.wait(lock, [this] { return turn_ == 0; });
  }

  /// Called by a started thread: gives the turn back and waits for the next.
  void giveBack() {
    std::unique_lock lock(mutex_);
    const std::size_t thread = numbers_.at(std::this_thread::get_id());
    if (!isEnding_) {
      turn_ = 0;
      changed_.notify_all();
    }
    changed_.wait(lock, [&] { return turn_ == thread || isEnding_; });
    if (isEnding_) throw EndOfThread();
  }

  /// Ends every thread.
  void end() {
    std::vector<std::thread> threads;
    {
      const std::lock_guard lock(mutex_);
      isEnding_ = true;
      changed_.notify_all();
      threads.swap(threads_);
    }
    for (std::thread& thread : threads) thread.join();
  }

 private:
  void runThread(std::size_t thread, const std::function<void(std::size_t)>& body) {
    try {
      {
        std::unique_lock lock(mutex_);
        changed_.wait(lock, [&] { return turn_ == thread || isEnding_; });
        if (isEnding_) return;
      }
      body(thread);
    } catch (const EndOfThread&) {
      return;
    }
    const std::lock_guard lock(mutex_);
    finished_.insert(thread);
    turn_ = 0;
    changed_.notify_all();
  }

  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::thread> threads_;
  std::map<std::thread::id, std::size_t> numbers_;
  std::set<std::size_t> finished_;
  std::size_t turn_ = 0;  // 0: the test's thread.
  bool isEnding_ = false;
};

class ManualRunLoopFactory::Loop final : public RunLoop,
                                         public std::enable_shared_from_this<Loop> {
 public:
  Loop(std::shared_ptr<ManualClock> clock, std::shared_ptr<Turns> turns,
       std::size_t thread)
      : clock_(std::move(clock)), turns_(std::move(turns)), thread_(thread) {}

  void add(const std::shared_ptr<RunLoopTimer>& timer) override;
  void run() override;

  /// Gives the loop's thread a turn at `due`, at the next `advance` if that is
  /// past. Whoever waits must bear a turn too many.
  void wakeAt(std::chrono::nanoseconds due) const {
    clock_->scheduleAt(due, [turns = turns_, thread = thread_] { turns->give(thread); });
  }

 private:
  std::shared_ptr<Timer> next() const;

  const std::shared_ptr<ManualClock> clock_;
  const std::shared_ptr<Turns> turns_;
  const std::size_t thread_;
  std::vector<std::shared_ptr<Timer>> timers_;  // As they were added.
};

class ManualRunLoopFactory::Timer final : public RunLoopTimer {
 public:
  Timer(std::shared_ptr<ManualClock> clock, std::chrono::nanoseconds delay, Task action)
      : clock_(std::move(clock)),
        due_(clock_->monotonicNow() + atLeastZero(delay)),
        action_(std::move(action)) {}

  void setFireDate(std::chrono::nanoseconds delay) override {
    if (!isValid()) return;
    due_ = clock_->monotonicNow() + atLeastZero(delay);
    if (const std::shared_ptr<Loop> loop = loop_.lock()) loop->wakeAt(due_);
  }

  void invalidate() override {
    if (!isValid()) return;
    action_ = {};
    if (const std::shared_ptr<Loop> loop = loop_.lock()) {
      loop->wakeAt(clock_->monotonicNow());
    }
  }

  void fire() { std::exchange(action_, {})(); }

  bool isValid() const { return static_cast<bool>(action_); }
  std::chrono::nanoseconds due() const { return due_; }
  bool isAdded() const { return isAdded_; }
  void setLoop(std::weak_ptr<Loop> loop) {
    loop_ = std::move(loop);
    isAdded_ = true;
  }

 private:
  const std::shared_ptr<ManualClock> clock_;
  std::chrono::nanoseconds due_;
  Task action_;  // Empty once fired or invalid.
  std::weak_ptr<Loop> loop_;
  bool isAdded_ = false;
};

void ManualRunLoopFactory::Loop::add(const std::shared_ptr<RunLoopTimer>& timer) {
  checkFakeUse(turns_->current() == thread_, "a run loop is used on its own thread");
  const auto added = std::static_pointer_cast<Timer>(timer);
  if (added->isAdded() || !added->isValid()) return;
  added->setLoop(weak_from_this());
  timers_.push_back(added);
}

void ManualRunLoopFactory::Loop::run() {
  checkFakeUse(turns_->current() == thread_, "a run loop is used on its own thread");
  while (const std::shared_ptr<Timer> timer = next()) {
    if (timer->due() > clock_->monotonicNow()) {
      wakeAt(timer->due());
      turns_->giveBack();
      continue;
    }
    std::erase(timers_, timer);
    timer->fire();
  }
  timers_.clear();  // Those left are invalid.
}

std::shared_ptr<ManualRunLoopFactory::Timer> ManualRunLoopFactory::Loop::next() const {
  std::shared_ptr<Timer> first;
  for (const std::shared_ptr<Timer>& timer : timers_) {
    if (!timer->isValid()) continue;
    if (first == nullptr || timer->due() < first->due()) first = timer;
  }
  return first;
}

ManualRunLoopFactory::ManualRunLoopFactory(std::shared_ptr<ManualClock> clock)
    : clock_(std::move(clock)), turns_(std::make_shared<Turns>()) {}

ManualRunLoopFactory::~ManualRunLoopFactory() { endThreads(); }

void ManualRunLoopFactory::endThreads() { turns_->end(); }

void ManualRunLoopFactory::startThread(std::string_view,
                                       std::function<void(RunLoop&)> body) {
  const std::size_t thread = turns_->start(
      [clock = clock_, turns = turns_, body = std::move(body)](std::size_t number) {
        body(*std::make_shared<Loop>(clock, turns, number));
      });
  clock_->scheduleAt(clock_->monotonicNow(),
                     [turns = turns_, thread] { turns->give(thread); });
}

std::shared_ptr<RunLoopTimer> ManualRunLoopFactory::makeTimer(
    std::chrono::nanoseconds delay, Task action) {
  return std::make_shared<Timer>(clock_, delay, std::move(action));
}

void ManualRunLoopFactory::sleep(std::chrono::nanoseconds duration) {
  const std::size_t thread = turns_->current();
  if (thread == 0) {
    clock_->advance(atLeastZero(duration));
    return;
  }
  const std::chrono::nanoseconds due = clock_->monotonicNow() + atLeastZero(duration);
  clock_->scheduleAt(due, [turns = turns_, thread] { turns->give(thread); });
  while (clock_->monotonicNow() < due) turns_->giveBack();
}

}  // namespace ostrel
