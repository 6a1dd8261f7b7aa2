#include "platform/linux/DeadlineRunner.h"

#include <condition_variable>
#include <deque>
#include <mutex>
#include <system_error>
#include <thread>

#include "platform/linux/Threads.h"

namespace ostrel {

// A helper holds the state, so that one that hangs may outlive the runner.
struct DeadlineRunner::State {
  enum class Step { kWaiting, kRunning, kOverrunning, kDone };
  struct Job {
    std::function<void()> call;
    Step step = Step::kWaiting;
  };

  explicit State(std::size_t most) : mostThreads(most) {}

  // True when somebody will take a job.
  bool hasHelper(const std::shared_ptr<State>& self) {
    if (idle > jobs.size()) return true;
    if (threads == mostThreads) return false;
    try {
      startThread("deadline", /*niceness=*/0, [self] { self->help(); }).detach();
    } catch (const std::system_error&) {
      return false;
    }
    ++threads;
    ++idle;
    return true;
  }

  void help() {
    std::unique_lock lock(mutex);
    for (;;) {
      changed.wait_for(lock, kIdleTime, [this] { return isStopping || !jobs.empty(); });
      if (jobs.empty()) break;
      const std::shared_ptr<Job> job = std::move(jobs.front());
      jobs.pop_front();
      --idle;
      job->step = Step::kRunning;
      lock.unlock();
      job->call();
      job->call = nullptr;
      lock.lock();
      if (job->step == Step::kOverrunning) --overrunning;
      job->step = Step::kDone;
      ++idle;
      changed.notify_all();
    }
    --threads;
    --idle;
    changed.notify_all();
  }

  const std::size_t mostThreads;

  std::mutex mutex;  // Guards all below and the steps of the jobs.
  std::condition_variable changed;
  std::deque<std::shared_ptr<Job>> jobs;
  std::size_t threads = 0;
  std::size_t idle = 0;
  std::size_t overrunning = 0;
  bool isStopping = false;
};

DeadlineRunner::DeadlineRunner(std::size_t mostThreads)
    : state_(std::make_shared<State>(mostThreads)) {}

DeadlineRunner::~DeadlineRunner() {
  std::unique_lock lock(state_->mutex);
  state_->isStopping = true;
  state_->changed.notify_all();
  state_->changed.wait(lock, [this] { return state_->threads == state_->overrunning; });
}

DeadlineRunner::Result DeadlineRunner::run(std::function<void()> call,
                                           std::chrono::nanoseconds timeout) {
  State& state = *state_;
  std::unique_lock lock(state.mutex);
  if (!state.hasHelper(state_)) return Result::kNotRun;
  const auto job = std::make_shared<State::Job>();
  job->call = std::move(call);
  state.jobs.push_back(job);
  state.changed.notify_all();
  state.changed.wait_for(lock, timeout, [&] { return job->step == State::Step::kDone; });
  switch (job->step) {
    case State::Step::kDone:
      return Result::kDone;
    case State::Step::kWaiting:
      std::erase(state.jobs, job);
      return Result::kNotRun;
    default:
      job->step = State::Step::kOverrunning;
      ++state.overrunning;
      return Result::kOverrun;
  }
}

std::size_t DeadlineRunner::overrunning() const {
  const std::lock_guard lock(state_->mutex);
  return state_->overrunning;
}

}  // namespace ostrel
