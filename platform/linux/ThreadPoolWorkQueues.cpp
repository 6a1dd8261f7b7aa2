// A serial queue is a strand: a list of steps that at most one thread of its
// pool works off at a time. A strand with steps stands in its pool's line once,
// or is run by a thread, or is suspended; otherwise it is idle, and then nothing
// but its owner holds it. Queueing on a strand that is in line or runs is a push
// under its own short lock and wakes nobody. The thread takes all steps that
// have gathered in one swap, so the lock is taken once a batch on that side.
//
// The memory of step lists belongs to the pool: an idle strand has none, and a
// strand that gets into line takes a list that another has left.
//
// Locks are taken in the order strand, pool, and no step or destructor of a step
// runs under one.
#include "platform/linux/ThreadPoolWorkQueues.h"

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <mutex>
#include <set>
#include <string>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Logging.h"
#include "platform/linux/Threads.h"

namespace ostrel {
namespace {

using Steps = std::vector<Task>;
using Emptied = std::array<Steps, 2>;  // The lists of a strand, to be used again.

/// After so many steps a strand lets the others in line go first.
constexpr int kStepsOfTurn = 128;
/// Step lists that a pool keeps for the next strands, and the longest kept.
constexpr std::size_t kMostSpares = 8;
constexpr std::size_t kLongestSpare = 512;

constexpr std::chrono::milliseconds kThreadRetry{100};
constexpr std::chrono::seconds kLastWait{2};

thread_local const WorkQueue* currentQueue = nullptr;
thread_local bool isPoolThread = false;

}  // namespace

/// What the pools have in common. Outlives the factory while a queue lives.
struct ThreadPoolWorkQueues::Shared {
  /// Strands in line or run, and steps of the background queue likewise.
  std::atomic<std::int64_t> active{0};
  std::atomic<int> drainers{0};
  std::mutex mutex;
  std::condition_variable becameIdle;
  std::set<std::string, std::less<>> labels;  // One text for all of a label.

  void begin() { active.fetch_add(1); }
  void finish() {
    if (active.fetch_sub(1) != 1 || drainers.load() == 0) return;
    const std::lock_guard lock(mutex);
    becameIdle.notify_all();
  }
};

/// The threads of one quality of service and the line of what waits for them.
class ThreadPoolWorkQueues::Pool : public std::enable_shared_from_this<Pool> {
 public:
  struct Kind {
    const char* name;
    int niceness;
    std::size_t mostThreads;
    bool isBatched;  // Its strands may be run by a `Batch`.
  };
  enum class Placed { kDropped, kQuiet, kWakes };

  Pool(const Kind& kind, std::shared_ptr<Shared> shared,
       std::shared_ptr<TimerThread> timers)
      : kind_(kind), shared_(std::move(shared)), timers_(std::move(timers)) {}

  /// Puts a strand into line; an empty `steps` may be given memory. After
  /// `kWakes` the caller calls `wakeOne`, best without a lock.
  Placed place(std::shared_ptr<Strand> strand, Steps& steps);
  void wakeOne() { wake_.notify_one(); }

  /// As `place`, for a strand that a batch runs: it gets into no line.
  Placed begin(Steps& steps);
  void runHere(std::shared_ptr<Strand> strand);
  bool isBatched() const { return kind_.isBatched; }

  void async(Task step);

  bool othersWait() const { return waiting_.load(std::memory_order_relaxed) > 0; }
  std::size_t threadCount() const;
  /// Returns when every thread has run out of work.
  void end();

 private:
  struct Line {
    std::shared_ptr<Strand> first;
    Strand* last = nullptr;
  };

  bool hasEnded() const { return isEnding_ && liveThreads_ == 0; }
  void giveMemory(Steps& steps);
  void takeMemory(Emptied& emptied);
  void append(std::shared_ptr<Strand> strand);
  std::shared_ptr<Strand> takeStrand();
  Placed callThread();
  void addThread();
  void work();
  /// Without the lock, then with it. True when the strand is in line again.
  bool runStrand(std::shared_ptr<Strand> strand, std::unique_lock<std::mutex>& lock);
  void runLoose(std::unique_lock<std::mutex>& lock);

  const Kind kind_;
  const std::shared_ptr<Shared> shared_;
  const std::shared_ptr<TimerThread> timers_;

  std::atomic<std::int64_t> waiting_{0};  // In line. Written under the lock.
  mutable std::mutex mutex_;              // Of what follows.
  std::condition_variable wake_;
  Line line_;
  Line lowLine_;  // Of the queues with a priority below 0.
  std::deque<Task> loose_;
  std::vector<Steps> spares_;
  std::vector<std::thread> threads_;
  std::size_t liveThreads_ = 0;
  std::size_t sleepers_ = 0;  // Threads asleep, less those called already.
  std::size_t calls_ = 0;     // Wake-ups that no thread has answered yet.
  bool retriesThread_ = false;
  bool isEnding_ = false;
};

/// One serial queue.
class ThreadPoolWorkQueues::Strand final : public WorkQueue,
                                           public std::enable_shared_from_this<Strand> {
 public:
  Strand(std::shared_ptr<Pool> pool, const std::string& label, bool isLow)
      : isLow_(isLow), label_(label), pool_(std::move(pool)) {}

  void async(Task step) override;
  void suspend() override;
  void resume(Task first) override;
  bool isCurrent() const override { return currentQueue == this; }
  const std::string& label() const override { return label_; }

  bool isLow() const { return isLow_; }

  /// Runs steps on the calling thread. True when there are more and others wait
  /// in line; else the strand is idle or suspended, and hands over the memory
  /// of its lists.
  bool runTurn(Emptied& emptied);

  std::shared_ptr<Strand> next;  // In line. Under the pool's lock.

 private:
  bool runSteps(Emptied& emptied);
  void placeInLine(std::unique_lock<std::mutex>& lock, Steps& steps, Task& step);

  const bool isLow_;
  const std::string& label_;  // Lives as long as the pool's `Shared`.
  const std::shared_ptr<Pool> pool_;

  // The thread's that runs the strand, from one turn to the next.
  bool suspendWasCalled_ = false;
  std::uint32_t nextIndex_ = 0;
  Steps current_;

  std::mutex mutex_;       // Of what follows.
  bool isPlaced_ = false;  // In line, or run by a thread.
  bool isSuspended_ = false;
  Steps incoming_;
  Steps firsts_;  // Of `resume`; the last goes first.
};

void ThreadPoolWorkQueues::Strand::async(Task step) {
  std::unique_lock lock(mutex_);
  if (isPlaced_ || isSuspended_) {
    incoming_.push_back(std::move(step));
    return;
  }
  placeInLine(lock, incoming_, step);
}

// Appends `step` to `steps` and puts the strand into line. Leaves `step` as it
// is, to be dropped without the lock, when the pool has ended.
void ThreadPoolWorkQueues::Strand::placeInLine(std::unique_lock<std::mutex>& lock,
                                               Steps& steps, Task& step) {
  isPlaced_ = true;
  const bool isBatched =
      currentBatch_ != nullptr && pool_->isBatched() && currentBatch_->takes();
  const Pool::Placed placed =
      isBatched ? pool_->begin(incoming_) : pool_->place(shared_from_this(), incoming_);
  if (placed == Pool::Placed::kDropped) {
    isPlaced_ = false;
    lock.unlock();
    return;
  }
  // The thread that takes the strand waits for this lock. Once it has it, the
  // strand may end.
  steps.push_back(std::move(step));
  if (isBatched) currentBatch_->take(shared_from_this(), pool_);
  if (placed == Pool::Placed::kQuiet) {
    lock.unlock();
    return;
  }
  const std::shared_ptr<Pool> pool = pool_;
  lock.unlock();
  if (currentBatch_ != nullptr) {
    currentBatch_->wakeLater(pool);
  } else {
    pool->wakeOne();
  }
}

void ThreadPoolWorkQueues::Strand::suspend() {
  assertCurrent();
  const std::lock_guard lock(mutex_);
  if (isSuspended_) {
    std::fprintf(stderr, "<2>queue \"%s\" is suspended twice\n", label_.c_str());
    std::abort();
  }
  isSuspended_ = true;
  suspendWasCalled_ = true;
}

void ThreadPoolWorkQueues::Strand::resume(Task first) {
  std::unique_lock lock(mutex_);
  if (!isSuspended_) {
    std::fprintf(stderr, "<2>queue \"%s\" is resumed without being suspended\n",
                 label_.c_str());
    std::abort();
  }
  isSuspended_ = false;
  if (isPlaced_) {  // The step that suspended it still runs.
    firsts_.push_back(std::move(first));
    return;
  }
  placeInLine(lock, firsts_, first);
}

bool ThreadPoolWorkQueues::Strand::runTurn(Emptied& emptied) {
  currentQueue = this;
  const bool hasMore = runSteps(emptied);
  currentQueue = nullptr;
  return hasMore;
}

bool ThreadPoolWorkQueues::Strand::runSteps(Emptied& emptied) {
  int stepsLeft = kStepsOfTurn;
  bool mayHaveFirsts = true;
  for (;;) {
    if (mayHaveFirsts) {
      std::unique_lock lock(mutex_);
      if (isSuspended_) {
        isPlaced_ = false;
        return false;
      }
      if (firsts_.empty()) {
        mayHaveFirsts = false;
        continue;
      }
      Task first = std::move(firsts_.back());
      firsts_.pop_back();
      lock.unlock();
      first();
      suspendWasCalled_ = false;  // It is looked at in any case.
      continue;
    }
    while (nextIndex_ < current_.size()) {
      if (stepsLeft-- == 0) {
        if (pool_->othersWait()) return true;
        stepsLeft = kStepsOfTurn;
      }
      Task& step = current_[nextIndex_++];
      step();
      step = Task();
      if (suspendWasCalled_) {
        suspendWasCalled_ = false;
        mayHaveFirsts = true;
        break;
      }
    }
    if (mayHaveFirsts) continue;
    current_.clear();
    nextIndex_ = 0;
    const std::lock_guard lock(mutex_);
    current_.swap(incoming_);
    if (current_.empty()) {
      emptied = {std::move(current_), std::move(incoming_)};
      isPlaced_ = false;
      return false;
    }
  }
}

ThreadPoolWorkQueues::Pool::Placed ThreadPoolWorkQueues::Pool::place(
    std::shared_ptr<Strand> strand, Steps& steps) {
  const std::lock_guard lock(mutex_);
  if (hasEnded()) return Placed::kDropped;
  shared_->begin();
  giveMemory(steps);
  append(std::move(strand));
  return callThread();
}

ThreadPoolWorkQueues::Pool::Placed ThreadPoolWorkQueues::Pool::begin(Steps& steps) {
  const std::lock_guard lock(mutex_);
  if (hasEnded()) return Placed::kDropped;
  shared_->begin();
  giveMemory(steps);
  return Placed::kQuiet;
}

void ThreadPoolWorkQueues::Pool::giveMemory(Steps& steps) {
  if (steps.capacity() != 0 || spares_.empty()) return;
  steps = std::move(spares_.back());
  spares_.pop_back();
}

void ThreadPoolWorkQueues::Pool::async(Task step) {
  Placed placed;
  {
    const std::lock_guard lock(mutex_);
    if (hasEnded()) return;
    shared_->begin();
    loose_.push_back(std::move(step));
    waiting_.fetch_add(1, std::memory_order_relaxed);
    placed = callThread();
  }
  if (placed == Placed::kWakes) wakeOne();
}

// Sees to it that some thread comes for what was put into line.
ThreadPoolWorkQueues::Pool::Placed ThreadPoolWorkQueues::Pool::callThread() {
  if (sleepers_ > 0) {
    --sleepers_;
    ++calls_;
    return Placed::kWakes;
  }
  if (threads_.size() < kind_.mostThreads && !isEnding_) addThread();
  return Placed::kQuiet;
}

void ThreadPoolWorkQueues::Pool::addThread() {
  const std::string name = kind_.name + std::to_string(threads_.size() + 1);
  try {
    threads_.push_back(
        startThread(name, kind_.niceness, [self = shared_from_this()] { self->work(); }));
    ++liveThreads_;
  } catch (const std::system_error&) {
    // The threads that there are go on. Without any, another try comes later.
    if (!threads_.empty() || retriesThread_) return;
    retriesThread_ = true;
    timers_->scheduleAfter(kThreadRetry, [self = shared_from_this()] {
      const std::lock_guard lock(self->mutex_);
      self->retriesThread_ = false;
      if (self->threads_.empty() && !self->isEnding_) self->addThread();
    });
  }
}

void ThreadPoolWorkQueues::Pool::append(std::shared_ptr<Strand> strand) {
  Line& line = strand->isLow() ? lowLine_ : line_;
  Strand* const added = strand.get();
  if (line.first == nullptr) {
    line.first = std::move(strand);
  } else {
    line.last->next = std::move(strand);
  }
  line.last = added;
  waiting_.fetch_add(1, std::memory_order_relaxed);
}

std::shared_ptr<ThreadPoolWorkQueues::Strand> ThreadPoolWorkQueues::Pool::takeStrand() {
  Line& line = line_.first != nullptr ? line_ : lowLine_;
  std::shared_ptr<Strand> strand = std::move(line.first);
  if (strand == nullptr) return nullptr;
  line.first = std::move(strand->next);
  if (line.first == nullptr) line.last = nullptr;
  waiting_.fetch_sub(1, std::memory_order_relaxed);
  return strand;
}

void ThreadPoolWorkQueues::Pool::work() {
  isPoolThread = true;
  std::unique_lock lock(mutex_);
  bool isLooseNext = false;  // Strands and loose steps take turns.
  for (;;) {
    isLooseNext = !isLooseNext;
    if (!loose_.empty() && isLooseNext) {
      runLoose(lock);
    } else if (auto strand = takeStrand()) {
      lock.unlock();
      runStrand(std::move(strand), lock);
    } else if (!loose_.empty()) {
      runLoose(lock);
    } else if (isEnding_) {
      --liveThreads_;
      return;
    } else {
      ++sleepers_;
      wake_.wait(lock, [this] { return calls_ > 0 || isEnding_; });
      if (calls_ > 0) {
        --calls_;
      } else {
        --sleepers_;
      }
    }
  }
}

bool ThreadPoolWorkQueues::Pool::runStrand(std::shared_ptr<Strand> strand,
                                           std::unique_lock<std::mutex>& lock) {
  Emptied emptied;
  const bool hasMore = strand->runTurn(emptied);
  if (hasMore) {
    lock.lock();
    append(std::move(strand));
    return true;
  }
  strand.reset();  // Perhaps its end.
  shared_->finish();
  for (Steps& steps : emptied) {
    if (steps.capacity() > kLongestSpare) Steps().swap(steps);
  }
  lock.lock();
  takeMemory(emptied);
  return false;
}

void ThreadPoolWorkQueues::Pool::takeMemory(Emptied& emptied) {
  for (Steps& steps : emptied) {
    if (steps.capacity() > 0 && spares_.size() < kMostSpares) {
      spares_.push_back(std::move(steps));
    }
  }
}

// A thread of the pool does the rest when other strands wait for one.
void ThreadPoolWorkQueues::Pool::runHere(std::shared_ptr<Strand> strand) {
  std::unique_lock lock(mutex_, std::defer_lock);
  if (!runStrand(std::move(strand), lock) || callThread() != Placed::kWakes) return;
  lock.unlock();
  wakeOne();
}

void ThreadPoolWorkQueues::Pool::runLoose(std::unique_lock<std::mutex>& lock) {
  Task step = std::move(loose_.front());
  loose_.pop_front();
  waiting_.fetch_sub(1, std::memory_order_relaxed);
  lock.unlock();
  step();
  step = Task();
  shared_->finish();
  lock.lock();
}

std::size_t ThreadPoolWorkQueues::Pool::threadCount() const {
  const std::lock_guard lock(mutex_);
  return liveThreads_;
}

void ThreadPoolWorkQueues::Pool::end() {
  std::vector<std::thread> threads;
  {
    const std::lock_guard lock(mutex_);
    isEnding_ = true;
    threads.swap(threads_);
  }
  wake_.notify_all();
  for (std::thread& thread : threads) {
    if (thread.get_id() == std::this_thread::get_id()) {
      thread.detach();
    } else {
      thread.join();
    }
  }
}

thread_local ThreadPoolWorkQueues::Batch* ThreadPoolWorkQueues::currentBatch_ = nullptr;

ThreadPoolWorkQueues::Batch::Batch() { currentBatch_ = this; }

ThreadPoolWorkQueues::Batch::~Batch() {
  isRunning_ = true;
  if (strand_ != nullptr) pool_->runHere(std::move(strand_));
  currentBatch_ = nullptr;
  for (const auto& pool : poolsToWake_) pool->wakeOne();
}

/// The concurrent queue: the background pool without a strand.
class ThreadPoolWorkQueues::Background final : public ConcurrentQueue {
 public:
  Background(std::shared_ptr<Pool> pool, std::shared_ptr<TimerThread> timers)
      : pool_(std::move(pool)), timers_(std::move(timers)) {}

  void asyncAfter(std::chrono::nanoseconds delay, Task step) override {
    if (delay.count() <= 0) {
      pool_->async(std::move(step));
      return;
    }
    timers_->scheduleAfter(delay, [pool = pool_, step = std::move(step)]() mutable {
      pool->async(std::move(step));
    });
  }

 private:
  const std::shared_ptr<Pool> pool_;
  const std::shared_ptr<TimerThread> timers_;
};

ThreadPoolWorkQueues::ThreadPoolWorkQueues(std::shared_ptr<TimerThread> timers)
    : shared_(std::make_shared<Shared>()),
      pools_{std::make_shared<Pool>(
                 Pool::Kind{"ostrel-ui-", /*niceness=*/-5, kMostInteractiveThreads,
                            /*isBatched=*/true},
                 shared_, timers),
             std::make_shared<Pool>(
                 Pool::Kind{"ostrel-util-", /*niceness=*/5, kMostUtilityThreads,
                            /*isBatched=*/false},
                 shared_, timers),
             std::make_shared<Pool>(
                 Pool::Kind{"ostrel-bg-", /*niceness=*/10, kMostBackgroundThreads,
                            /*isBatched=*/false},
                 shared_, timers)},
      background_(std::make_unique<Background>(
          pools_[static_cast<std::size_t>(QualityOfService::kBackground)], timers)) {}

ThreadPoolWorkQueues::~ThreadPoolWorkQueues() {
  if (!isPoolThread) drain(std::chrono::steady_clock::now() + kLastWait);
  for (const auto& pool : pools_) pool->end();
}

std::shared_ptr<WorkQueue> ThreadPoolWorkQueues::makeSerialQueue(
    std::string_view label, QualityOfService qualityOfService, int relativePriority) {
  const std::string* shared = nullptr;
  {
    const std::lock_guard lock(shared_->mutex);
    const auto known = shared_->labels.find(label);
    shared =
        known != shared_->labels.end() ? &*known : &*shared_->labels.emplace(label).first;
  }
  return std::make_shared<Strand>(pools_[static_cast<std::size_t>(qualityOfService)],
                                  *shared, relativePriority < 0);
}

ConcurrentQueue& ThreadPoolWorkQueues::backgroundQueue() { return *background_; }

bool ThreadPoolWorkQueues::drain(std::chrono::steady_clock::time_point deadline) {
  std::unique_lock lock(shared_->mutex);
  shared_->drainers.fetch_add(1);
  const bool isIdle = shared_->becameIdle.wait_until(
      lock, deadline, [this] { return shared_->active.load() == 0; });
  shared_->drainers.fetch_sub(1);
  return isIdle;
}

std::size_t ThreadPoolWorkQueues::threadCount() const {
  std::size_t count = 0;
  for (const auto& pool : pools_) count += pool->threadCount();
  return count;
}

}  // namespace ostrel
