#include "platform/linux/TimerThread.h"

#include <condition_variable>
#include <map>
#include <mutex>
#include <utility>

#include "platform/linux/Threads.h"

namespace ostrel {

// Outlives the object when that ends inside an action.
struct TimerThread::State {
  std::mutex mutex;
  std::condition_variable changed;
  bool isEnding = false;
  std::uint64_t lastNumber = 0;
  std::map<TimerID, Task> timers;

  void run() {
    std::unique_lock lock(mutex);
    while (!isEnding) {
      if (timers.empty()) {
        changed.wait(lock);
        continue;
      }
      const Time due = timers.begin()->first.due;
      if (std::chrono::steady_clock::now() < due) {
        changed.wait_until(lock, due);
        continue;
      }
      auto timer = timers.extract(timers.begin());
      lock.unlock();
      timer.mapped()();
      timer = {};
      lock.lock();
    }
  }
};

TimerThread::TimerThread()
    : state_(std::make_shared<State>()),
      thread_(startThread("ostrel-timer", /*niceness=*/0,
                          [state = state_] { state->run(); })) {}

TimerThread::~TimerThread() {
  std::map<TimerID, Task> dropped;  // Destroyed without the lock.
  {
    const std::lock_guard lock(state_->mutex);
    state_->isEnding = true;
    dropped.swap(state_->timers);
    state_->changed.notify_one();
  }
  if (thread_.get_id() == std::this_thread::get_id()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

TimerThread::TimerID TimerThread::scheduleAfter(std::chrono::nanoseconds delay,
                                                Task action) {
  const Time now = std::chrono::steady_clock::now();
  const Time due = delay > Time::max() - now ? Time::max() : now + delay;
  const std::lock_guard lock(state_->mutex);
  const TimerID timer{due, ++state_->lastNumber};
  const auto place = state_->timers.emplace(timer, std::move(action)).first;
  if (place == state_->timers.begin()) state_->changed.notify_one();
  return timer;
}

bool TimerThread::cancel(TimerID timer) {
  std::map<TimerID, Task>::node_type dropped;  // Destroyed without the lock.
  const std::lock_guard lock(state_->mutex);
  dropped = state_->timers.extract(timer);
  return !dropped.empty();
}

}  // namespace ostrel
