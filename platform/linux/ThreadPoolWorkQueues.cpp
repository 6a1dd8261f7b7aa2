// A serial queue is a strand: a list of steps that at most one thread of its
// pool works off at a time. A strand with steps is placed: it stands in its pool's
// line once, or in a batch's that will be, or is run by a thread. Or it is
// suspended. Otherwise it is idle, and then nothing but its owner holds it and it
// holds no memory but its own. Queueing on a strand that is placed is a push under
// its own short lock and wakes nobody. The thread takes all steps that have gathered
// at once, so the lock is taken once a batch on that side.
//
// While a `Batch` runs its queue, steps that this queues on one strand after the other
// are held back and queued together, up to `kStepsHeld` of them: the strand's thread
// would otherwise take them one by one, and both threads wait for the line of the cache
// with the strand's lock each time (80 ns a message). They are queued before the batch's
// queue lets go of its turn, so that nobody can tell the difference.
//
// The strands that are placed by that gather in lines of the batch, and go into their
// pool's line together: one lock for up to `kStrandsOfBatch` of them. With a message for
// each of many sessions this is the difference between a lock that two threads always
// meet at and one that they rarely do.
//
// Where many strands wait, a thread takes several at once from the line, into its hand:
// the lock is taken once for them, and what the next ones need is fetched from memory
// while one runs. What is in a hand is nobody's yet: a thread that finds nothing else, or
// that sees another get no further, takes the other's hand over.
//
// No lock is taken under another but a hand's under its pool's, and no step or destructor
// of a step runs under one.
#include "platform/linux/ThreadPoolWorkQueues.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <mutex>
#include <set>
#include <span>
#include <string>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "platform/FetchAhead.h"
#include "platform/SmallMutex.h"
#include "platform/linux/QueuedSteps.h"
#include "platform/linux/Threads.h"

namespace ostrel {
namespace {

/// After so many steps a strand lets the others in line go first.
constexpr int kStepsOfTurn = 128;
/// A batch that has gathered so many strands hands them over.
constexpr std::size_t kStrandsOfBatch = 64;
/// So many urgent strands may go before one that is not.
constexpr int kUrgentInARow = 16;
/// So many steps for a strand wait for more.
constexpr int kStepsHeld = 64;
/// So many strands a thread takes beside the first at most: half of its part of a line.
constexpr std::size_t kStrandsInHand = 32;
constexpr std::size_t kMostThreads =
    std::max({ThreadPoolWorkQueues::kMostInteractiveThreads,
              ThreadPoolWorkQueues::kMostUtilityThreads,
              ThreadPoolWorkQueues::kMostBackgroundThreads});

constexpr std::chrono::milliseconds kThreadRetry{100};
constexpr std::chrono::seconds kLastWait{2};

thread_local const WorkQueue* currentQueue = nullptr;
thread_local bool isPoolThread = false;

}  // namespace

thread_local ThreadPoolWorkQueues::Hand* ThreadPoolWorkQueues::ownHand_ = nullptr;

/// What the pools have in common. Outlives the factory while a queue lives.
struct ThreadPoolWorkQueues::Shared {
  /// Strands that are placed, steps of the background queue likewise, and batches
  /// with strands of theirs. A thread tells of those that it has finished when it
  /// finds no other.
  std::atomic<std::int64_t> active{0};
  std::atomic<int> drainers{0};
  std::mutex mutex;
  std::condition_variable becameIdle;

  void begin(std::int64_t count) { active.fetch_add(count); }
  void finish(std::int64_t count) {
    if (active.fetch_sub(count) != count || drainers.load() == 0) return;
    const std::lock_guard lock(mutex);
    becameIdle.notify_all();
  }
};

/// What queues have in common that are made alike.
struct ThreadPoolWorkQueues::QueueKind {
  const std::string label;
  const std::shared_ptr<Pool> pool;
  const bool isLow;
};

/// Lines of strands on their way to a pool.
struct ThreadPoolWorkQueues::Gathered {
  std::shared_ptr<Pool> pool;
  bool isUrgent = false;
  std::vector<std::shared_ptr<Strand>> strands;
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
       std::shared_ptr<TimerThread> timers);

  /// Puts a strand into line. After `kWakes` the caller calls `wakeOne`. The strand
  /// is not taken when it is dropped.
  Placed place(std::shared_ptr<Strand>&& strand);
  void wakeOne();

  /// As `place`, for what a batch gathered; wakes threads itself.
  void place(Gathered& gathered);

  /// As `place`, for a strand that a batch runs: it gets into no line.
  Placed begin();
  void runHere(std::shared_ptr<Strand> strand);
  bool isBatched() const { return kind_.isBatched; }
  Shared& shared() { return *shared_; }

  void async(Task step);

  /// Whether other strands wait for the calling thread.
  bool othersWait() const;
  std::size_t threadCount() const;
  /// Returns when every thread has run out of work.
  void end();

 private:
  bool hasEnded() const { return isEnding_ && liveThreads_ == 0; }
  void append(std::shared_ptr<Strand>&& strand, bool isUrgent = false);
  std::shared_ptr<Strand> takeStrand(Hand& hand);
  bool isAnyInHand() const;
  std::shared_ptr<Strand> takeOver(Hand& hand, bool onlyStuck);
  Placed callThread();
  void addThread();
  void work(Hand& hand);
  void sleep(std::unique_lock<SmallMutex>& lock);
  /// True when the strand is in line again; else it is finished.
  bool runStrand(std::shared_ptr<Strand> strand);
  void runLoose(std::unique_lock<SmallMutex>& lock);

  const Kind kind_;
  const std::shared_ptr<Shared> shared_;
  const std::shared_ptr<TimerThread> timers_;

  std::atomic<std::int64_t> waiting_{0};      // In line. Written under the lock.
  std::vector<std::unique_ptr<Hand>> hands_;  // One for each thread that there may be.
  mutable SmallMutex mutex_;                  // Of what follows.
  Line line_;
  Line lowLine_;  // Of the queues with a priority below 0.
  Line urgentLine_;
  int urgentInARow_ = 0;
  std::deque<Task> loose_;
  std::vector<std::thread> threads_;
  std::size_t liveThreads_ = 0;
  std::size_t sleepers_ = 0;  // Threads asleep, less those to be called.
  bool retriesThread_ = false;
  bool isEnding_ = false;

  std::mutex sleepMutex_;  // Of what follows.
  std::condition_variable wake_;
  std::size_t calls_ = 0;  // Wake-ups that no thread has answered yet.
  bool mustNotSleep_ = false;
};

/// One serial queue. There are as many as sessions, so it is small.
class ThreadPoolWorkQueues::Strand final : public WorkQueue,
                                           public std::enable_shared_from_this<Strand> {
 public:
  explicit Strand(std::shared_ptr<const QueueKind> kind) : kind_(std::move(kind)) {}

  void setSubject(const Subject& subject) override { subject_ = &subject; }
  void async(Task task) override;
  bool tryEnter() override;
  void leave() override;
  void suspend() override;
  void resume(Task first) override;
  bool isCurrent() const override { return currentQueue == this; }
  const std::string& label() const override { return kind_->label; }

  bool isLow() const { return kind_->isLow; }

  void fetchAhead() const { fetchToWrite(this, sizeof *this); }
  /// The same in stages, by who alone may run it: first itself, then what it will run and
  /// the stages of its subject.
  static constexpr int kStages = 1 + Subject::kStages;
  void fetchAhead(int stage) {
    if (stage == 0) {
      fetchAhead();
      return;
    }
    if (stage == 1 && !waiting_.empty()) waiting_.first().fetchAhead();
    if (subject_ != nullptr) subject_->fetchAhead(stage - 1);
  }

  /// Runs steps on the calling thread. True when there are more and others wait
  /// in line; else the strand is idle or suspended.
  bool runTurn();

  /// Queues steps on `strand`.
  static void take(std::shared_ptr<Strand> strand, StepList& steps);

  /// Drops what waits, since nothing will run it.
  void drop();

 private:
  friend class Batch;

  bool runSteps();
  static void place(std::shared_ptr<Strand> strand);

  const std::shared_ptr<const QueueKind> kind_;
  const Subject* subject_ = nullptr;
  SmallMutex mutex_;               // Of what follows but `suspendWasCalled_`.
  bool suspendWasCalled_ = false;  // The thread's that runs the strand.
  bool isPlaced_ = false;
  bool isSuspended_ = false;
  /// Whether there is anything that nobody may get ahead of. Who runs the strand looks
  /// without the lock.
  std::atomic<bool> isBusy_{false};
  StepList waiting_;
  StepList firsts_;  // Of `resume` while the strand runs; the last goes first.
};

/// Strands that one thread is to run next. Any thread may take them over.
class alignas(64) ThreadPoolWorkQueues::Hand {
 public:
  /// While it is empty.
  void fill(std::span<std::shared_ptr<Strand>> strands) {
    const std::lock_guard lock(mutex_);
    next_ = 0;
    count_ = strands.size();
    std::move(strands.begin(), strands.end(), strands_.begin());
    isEmpty_.store(strands.empty(), std::memory_order_relaxed);
  }

  /// The thread's own. None when it is empty.
  std::shared_ptr<Strand> take() {
    turns_.store(turns_.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
    if (isEmpty()) return nullptr;
    const std::lock_guard lock(mutex_);
    if (next_ == count_) return nullptr;
    std::shared_ptr<Strand> strand = std::move(strands_[next_++]);
    if (next_ == count_) isEmpty_.store(true, std::memory_order_relaxed);
    int stage = Strand::kStages;
    for (std::size_t i = next_; i < count_ && stage > 0; ++i) {
      strands_[i]->fetchAhead(--stage);
    }
    return strand;
  }

  /// Moves all to `strands`, which has room for `kStrandsInHand`. How many.
  std::size_t takeAll(std::span<std::shared_ptr<Strand>> strands) {
    const std::lock_guard lock(mutex_);
    const std::size_t count = count_ - next_;
    const auto first = strands_.begin() + static_cast<std::ptrdiff_t>(next_);
    std::move(first, first + static_cast<std::ptrdiff_t>(count), strands.begin());
    next_ = count_;
    isEmpty_.store(true, std::memory_order_relaxed);
    return count;
  }

  bool isEmpty() const { return isEmpty_.load(std::memory_order_relaxed); }
  /// Changes when the thread gets on to another strand.
  std::uint32_t turns() const { return turns_.load(std::memory_order_relaxed); }

  /// Those of other threads when this one last looked; the thread's own.
  std::array<std::uint32_t, kMostThreads> seenTurns{};

 private:
  SmallMutex mutex_;
  std::atomic<bool> isEmpty_{true};
  std::atomic<std::uint32_t> turns_{0};
  std::size_t next_ = 0;
  std::size_t count_ = 0;
  std::array<std::shared_ptr<Strand>, kStrandsInHand> strands_;
};

ThreadPoolWorkQueues::Pool::Pool(const Kind& kind, std::shared_ptr<Shared> shared,
                                 std::shared_ptr<TimerThread> timers)
    : kind_(kind), shared_(std::move(shared)), timers_(std::move(timers)) {
  for (std::size_t i = 0; i < kind.mostThreads; ++i) {
    hands_.push_back(std::make_unique<Hand>());
  }
}

void ThreadPoolWorkQueues::Strand::async(Task task) {
  QueuedStep* const step = QueuedStep::make(std::move(task));
  Batch* const batch = currentBatch_;
  if (batch != nullptr && batch->isRunning_ && !isCurrent()) {
    batch->hold(*this, step);
    return;
  }
  if (batch != nullptr) batch->letGo();
  {
    const std::lock_guard lock(mutex_);
    waiting_.append(step);
    isBusy_.store(true, std::memory_order_relaxed);
    if (isPlaced_ || isSuspended_) return;
    isPlaced_ = true;
  }
  place(shared_from_this());
}

void ThreadPoolWorkQueues::Strand::take(std::shared_ptr<Strand> strand, StepList& steps) {
  {
    const std::lock_guard lock(strand->mutex_);
    strand->waiting_.append(steps);
    strand->isBusy_.store(true, std::memory_order_relaxed);
    if (strand->isPlaced_ || strand->isSuspended_) return;
    strand->isPlaced_ = true;
  }
  place(std::move(strand));
}

void ThreadPoolWorkQueues::Strand::place(std::shared_ptr<Strand> strand) {
  Pool& pool = *strand->kind_->pool;
  Batch* const batch = currentBatch_;
  if (batch != nullptr && batch->isRunning_) {
    batch->gather(std::move(strand));
    return;
  }
  Pool::Placed placed;
  if (batch != nullptr && pool.isBatched() && batch->takes()) {
    placed = pool.begin();
    if (placed != Pool::Placed::kDropped) {
      batch->take(std::move(strand));
      return;
    }
  } else {
    // The strand may end as soon as it is in line.
    const std::shared_ptr<const QueueKind> kind = strand->kind_;
    placed = pool.place(std::move(strand));
    if (placed == Pool::Placed::kWakes) {
      if (batch != nullptr) {
        batch->wakeLater(kind->pool);
      } else {
        kind->pool->wakeOne();
      }
    }
  }
  if (placed == Pool::Placed::kDropped) strand->drop();
}

// Whoever has queued something, so that this thread could know, is seen by it: then the
// work is queued too. Else it is as if the work had been queued and run at once.
bool ThreadPoolWorkQueues::Strand::tryEnter() {
  Batch* const batch = currentBatch_;
  if (batch == nullptr || batch->isRunning_) return false;
  if (isBusy_.load(std::memory_order_relaxed) || !batch->has(*this)) return false;
  batch->isRunning_ = true;
  currentQueue = this;
  return true;
}

void ThreadPoolWorkQueues::Strand::leave() {
  currentQueue = nullptr;
  currentBatch_->isRunning_ = false;
  suspendWasCalled_ = false;
}

void ThreadPoolWorkQueues::Strand::drop() {
  StepList dropped;
  const std::lock_guard lock(mutex_);
  isPlaced_ = false;
  isBusy_.store(isSuspended_, std::memory_order_relaxed);
  dropped.swap(waiting_);
}

void ThreadPoolWorkQueues::Strand::suspend() {
  assertCurrent();
  const std::lock_guard lock(mutex_);
  if (isSuspended_) {
    std::fprintf(stderr, "<2>queue \"%s\" is suspended twice\n", label().c_str());
    std::abort();
  }
  isSuspended_ = true;
  isBusy_.store(true, std::memory_order_relaxed);
  suspendWasCalled_ = true;
}

void ThreadPoolWorkQueues::Strand::resume(Task first) {
  QueuedStep* const step = QueuedStep::make(std::move(first));
  {
    const std::lock_guard lock(mutex_);
    if (!isSuspended_) {
      std::fprintf(stderr, "<2>queue \"%s\" is resumed without being suspended\n",
                   label().c_str());
      std::abort();
    }
    isSuspended_ = false;
    if (isPlaced_) {  // The step that suspended it still runs.
      firsts_.prepend(step);
      return;
    }
    waiting_.prepend(step);
    isPlaced_ = true;
  }
  place(shared_from_this());
}

bool ThreadPoolWorkQueues::Strand::runTurn() {
  currentQueue = this;
  const bool hasMore = runSteps();
  currentQueue = nullptr;
  return hasMore;
}

bool ThreadPoolWorkQueues::Strand::runSteps() {
  StepList steps;
  int stepsLeft = kStepsOfTurn;
  Batch* const batch = currentBatch_;
  for (;;) {
    if (batch != nullptr) batch->letGo();
    {
      const std::lock_guard lock(mutex_);
      waiting_.prepend(steps);
      if (stepsLeft < 0) return true;
      waiting_.prepend(firsts_);
      isBusy_.store(isSuspended_ || !waiting_.empty(), std::memory_order_relaxed);
      if (isSuspended_ || waiting_.empty()) {
        isPlaced_ = false;
        return false;
      }
      steps.swap(waiting_);
    }
    while (!steps.empty()) {
      if (stepsLeft-- == 0) {
        if (kind_->pool->othersWait()) break;
        stepsLeft = kStepsOfTurn - 1;
      }
      steps.runFirst();
      // Read only: who queues steps meanwhile uses what lies beside it.
      if (suspendWasCalled_) {
        suspendWasCalled_ = false;
        break;
      }
    }
  }
}

ThreadPoolWorkQueues::Pool::Placed ThreadPoolWorkQueues::Pool::place(
    std::shared_ptr<Strand>&& strand) {
  const std::lock_guard lock(mutex_);
  if (hasEnded()) return Placed::kDropped;
  shared_->begin(/*count=*/1);
  append(std::move(strand));
  return callThread();
}

void ThreadPoolWorkQueues::Pool::append(std::shared_ptr<Strand>&& strand, bool isUrgent) {
  Line& line = strand->isLow() ? lowLine_ : isUrgent ? urgentLine_ : line_;
  line.push_back(std::move(strand));
  waiting_.fetch_add(1, std::memory_order_relaxed);
}

void ThreadPoolWorkQueues::Pool::place(Gathered& gathered) {
  std::size_t wakes = 0;
  // Ends of steps may gather anew.
  std::vector<std::shared_ptr<Strand>> strands;
  strands.swap(gathered.strands);
  {
    const std::lock_guard lock(mutex_);
    if (!hasEnded()) {
      shared_->begin(static_cast<std::int64_t>(strands.size()));
      for (auto threads = std::min(strands.size(), kind_.mostThreads); threads != 0;
           --threads) {
        if (callThread() == Placed::kWakes) ++wakes;
      }
      for (auto& strand : strands) append(std::move(strand), gathered.isUrgent);
      strands.clear();
    }
  }
  // What is left has nobody to run it.
  for (const auto& strand : strands) strand->drop();
  for (; wakes != 0; --wakes) wakeOne();
}

ThreadPoolWorkQueues::Pool::Placed ThreadPoolWorkQueues::Pool::begin() {
  const std::lock_guard lock(mutex_);
  if (hasEnded()) return Placed::kDropped;
  shared_->begin(/*count=*/1);
  return Placed::kQuiet;
}

void ThreadPoolWorkQueues::Pool::async(Task step) {
  Placed placed;
  {
    const std::lock_guard lock(mutex_);
    if (hasEnded()) return;
    shared_->begin(/*count=*/1);
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
    return Placed::kWakes;
  }
  if (threads_.size() < kind_.mostThreads && !isEnding_) addThread();
  return Placed::kQuiet;
}

void ThreadPoolWorkQueues::Pool::addThread() {
  const std::string name = kind_.name + std::to_string(threads_.size() + 1);
  try {
    Hand& hand = *hands_[threads_.size()];
    threads_.push_back(startThread(
        name, kind_.niceness, [self = shared_from_this(), &hand] { self->work(hand); }));
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

bool ThreadPoolWorkQueues::Pool::othersWait() const {
  return waiting_.load(std::memory_order_relaxed) > 0 ||
         (ownHand_ != nullptr && !ownHand_->isEmpty());
}

// With the lock. The others that the thread takes with the first are in its hand.
std::shared_ptr<ThreadPoolWorkQueues::Strand> ThreadPoolWorkQueues::Pool::takeStrand(
    Hand& hand) {
  // Where nobody waits behind them, any number may go.
  if (line_.empty() && lowLine_.empty()) urgentInARow_ = 0;
  const bool isUrgent = !urgentLine_.empty() && urgentInARow_ < kUrgentInARow;
  Line& line = isUrgent ? urgentLine_ : line_.empty() ? lowLine_ : line_;
  if (line.empty()) return nullptr;
  std::shared_ptr<Strand> strand = std::move(line.front());
  line.pop_front();
  urgentInARow_ = isUrgent ? urgentInARow_ + 1 : 0;
  // Of those of low priority others might have to go first soon.
  Line& more = isUrgent ? urgentLine_ : line_;
  const std::size_t most =
      isUrgent ? static_cast<std::size_t>(kUrgentInARow - urgentInARow_) : kStrandsInHand;
  const std::size_t others =
      std::min({more.size() / (2 * kind_.mostThreads), most, kStrandsInHand});
  if (others != 0) {
    std::array<std::shared_ptr<Strand>, kStrandsInHand> taken;
    for (std::size_t i = 0; i < others; ++i) {
      taken[i] = std::move(more.front());
      more.pop_front();
    }
    hand.fill({taken.data(), others});
    if (isUrgent) urgentInARow_ += static_cast<int>(others);
  }
  waiting_.fetch_sub(static_cast<std::int64_t>(1 + others), std::memory_order_relaxed);
  return strand;
}

bool ThreadPoolWorkQueues::Pool::isAnyInHand() const {
  return std::any_of(hands_.begin(), hands_.end(),
                     [](const auto& hand) { return !hand->isEmpty(); });
}

// Without the lock. What another thread has in its hand comes into this one's, but for
// the first; `onlyStuck`: of a thread that has got no further since the last call.
std::shared_ptr<ThreadPoolWorkQueues::Strand> ThreadPoolWorkQueues::Pool::takeOver(
    Hand& hand, bool onlyStuck) {
  for (std::size_t i = 0; i < hands_.size(); ++i) {
    Hand& other = *hands_[i];
    if (&other == &hand || other.isEmpty()) continue;
    const std::uint32_t turns = other.turns();
    if (std::exchange(hand.seenTurns[i], turns) != turns && onlyStuck) continue;
    std::array<std::shared_ptr<Strand>, kStrandsInHand> taken;
    // With the lock, since on their way they are in no hand: a thread that looked then
    // would go to sleep, and leave them to this one however long its next step takes.
    const std::lock_guard lock(mutex_);
    const std::size_t count = other.takeAll(taken);
    if (count == 0) continue;
    hand.fill({&taken[1], count - 1});
    return std::move(taken[0]);
  }
  return nullptr;
}

void ThreadPoolWorkQueues::Pool::work(Hand& hand) {
  isPoolThread = true;
  ownHand_ = &hand;
  std::int64_t finished = 0;
  bool isLooseNext = false;  // Strands and loose steps take turns.
  const auto run = [&](std::shared_ptr<Strand> strand) {
    if (!runStrand(std::move(strand))) ++finished;
  };
  for (;;) {
    while (auto strand = hand.take()) run(std::move(strand));
    if (auto strand = takeOver(hand, /*onlyStuck=*/true)) {
      run(std::move(strand));
      continue;
    }
    std::unique_lock lock(mutex_);
    isLooseNext = !isLooseNext;
    if (!loose_.empty() && isLooseNext) {
      runLoose(lock);
      ++finished;
    } else if (auto strand = takeStrand(hand)) {
      lock.unlock();
      run(std::move(strand));
    } else if (!loose_.empty()) {
      runLoose(lock);
      ++finished;
    } else if (isAnyInHand()) {
      lock.unlock();
      if (auto other = takeOver(hand, /*onlyStuck=*/false)) run(std::move(other));
    } else if (finished != 0) {
      lock.unlock();
      shared_->finish(std::exchange(finished, 0));
    } else if (isEnding_) {
      --liveThreads_;
      return;
    } else {
      sleep(lock);
    }
  }
}

void ThreadPoolWorkQueues::Pool::sleep(std::unique_lock<SmallMutex>& lock) {
  ++sleepers_;
  lock.unlock();
  bool wasCalled = true;
  {
    std::unique_lock asleep(sleepMutex_);
    wake_.wait(asleep, [this] { return calls_ > 0 || mustNotSleep_; });
    if (calls_ > 0) {
      --calls_;
    } else {
      wasCalled = false;
    }
  }
  lock.lock();
  if (!wasCalled && sleepers_ > 0) --sleepers_;
}

void ThreadPoolWorkQueues::Pool::wakeOne() {
  {
    const std::lock_guard lock(sleepMutex_);
    ++calls_;
  }
  wake_.notify_one();
}

bool ThreadPoolWorkQueues::Pool::runStrand(std::shared_ptr<Strand> strand) {
  if (!strand->runTurn()) return false;  // With the reference perhaps its end.
  const std::lock_guard lock(mutex_);
  append(std::move(strand));
  return true;
}

// A thread of the pool does the rest when other strands wait for one.
void ThreadPoolWorkQueues::Pool::runHere(std::shared_ptr<Strand> strand) {
  if (!runStrand(std::move(strand))) {
    shared_->finish(/*count=*/1);
    return;
  }
  std::unique_lock lock(mutex_);
  const Placed placed = callThread();
  lock.unlock();
  if (placed == Placed::kWakes) wakeOne();
}

void ThreadPoolWorkQueues::Pool::runLoose(std::unique_lock<SmallMutex>& lock) {
  Task step = std::move(loose_.front());
  loose_.pop_front();
  waiting_.fetch_sub(1, std::memory_order_relaxed);
  lock.unlock();
  step();
  step = Task();
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
  {
    const std::lock_guard lock(sleepMutex_);
    mustNotSleep_ = true;
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

ThreadPoolWorkQueues::Batch::Batch(Kind kind) : isUrgent_(kind == Kind::kUrgent) {
  currentBatch_ = this;
}

ThreadPoolWorkQueues::Batch::~Batch() {
  isRunning_ = true;
  if (strand_ != nullptr) pool_->runHere(std::move(strand_));
  currentBatch_ = nullptr;
  for (const auto& gathered : gathered_) handOver(*gathered);
  for (const auto& pool : poolsToWake_) pool->wakeOne();
}

void ThreadPoolWorkQueues::Batch::hold(Strand& strand, QueuedStep* step) {
  if (held_.get() != &strand) {
    strand.fetchAhead();
    letGo();
    held_ = strand.shared_from_this();
  }
  heldSteps_.append(step);
  if (++heldCount_ == kStepsHeld) letGo();
}

void ThreadPoolWorkQueues::Batch::letGo() {
  if (held_ == nullptr) return;
  heldCount_ = 0;
  Strand::take(std::move(held_), heldSteps_);
}

bool ThreadPoolWorkQueues::Batch::has(Strand& strand) {
  if (strand_ != nullptr) return strand_.get() == &strand;
  if (!strand.kind_->pool->isBatched()) return false;
  {
    const std::lock_guard lock(strand.mutex_);
    if (strand.isPlaced_ || strand.isSuspended_) return false;
    strand.isPlaced_ = true;
  }
  if (strand.kind_->pool->begin() == Pool::Placed::kDropped) {
    strand.drop();
    return false;
  }
  take(strand.shared_from_this());
  return true;
}

void ThreadPoolWorkQueues::Batch::take(std::shared_ptr<Strand> strand) {
  pool_ = strand->kind_->pool;
  strand_ = std::move(strand);
}

void ThreadPoolWorkQueues::Batch::gather(std::shared_ptr<Strand> strand) {
  const std::shared_ptr<Pool>& pool = strand->kind_->pool;
  const auto found =
      std::find_if(gathered_.begin(), gathered_.end(),
                   [&](const auto& gathered) { return gathered->pool == pool; });
  Gathered& gathered = found != gathered_.end()
                           ? **found
                           : *gathered_.emplace_back(std::make_unique<Gathered>());
  if (gathered.pool == nullptr) gathered.pool = pool;
  gathered.isUrgent = isUrgent_;
  if (gathered.strands.empty()) pool->shared().begin(/*count=*/1);
  gathered.strands.push_back(std::move(strand));
  if (gathered.strands.size() == kStrandsOfBatch) handOver(gathered);
}

void ThreadPoolWorkQueues::Batch::handOver(Gathered& gathered) {
  if (gathered.strands.empty()) return;
  gathered.pool->place(gathered);
  gathered.pool->shared().finish(/*count=*/1);
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
                 Pool::Kind{"ostrel-ui-", kInteractiveNiceness, kMostInteractiveThreads,
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
  const auto& pool = pools_[static_cast<std::size_t>(qualityOfService)];
  const bool isLow = relativePriority < 0;
  const std::lock_guard lock(kindsMutex_);
  const auto known = std::find_if(kinds_.begin(), kinds_.end(), [&](const auto& kind) {
    return kind->pool == pool && kind->isLow == isLow && kind->label == label;
  });
  if (known != kinds_.end()) return std::make_shared<Strand>(*known);
  kinds_.push_back(
      std::make_shared<const QueueKind>(QueueKind{std::string(label), pool, isLow}));
  return std::make_shared<Strand>(kinds_.back());
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
