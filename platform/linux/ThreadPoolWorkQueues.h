#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <deque>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/WorkQueue.h"
#include "platform/linux/Limits.h"
#include "platform/linux/QueuedSteps.h"
#include "platform/linux/TimerThread.h"

namespace ostrel {

/// Serial queues over a few shared threads: one pool for each quality of
/// service, its threads made when they are first needed and as nice as the
/// class asks. Threads take no signals.
///
/// A burst of steps for one queue costs one wake-up. When nothing is queued,
/// nothing wakes up. A step must not throw.
class ThreadPoolWorkQueues final : public WorkQueueFactory {
 public:
  /// While it lives, the first idle interactive queue that the calling thread
  /// queues on or enters is this thread's: it runs at the batch's end, and may be
  /// entered until something is queued. So a thread that turns a batch of input into
  /// steps hands nothing over: a batch costs neither a wake-up nor a change of threads,
  /// and a request is answered by the thread that read it. At most one a thread; not on
  /// a queue.
  class Batch;

  static constexpr std::size_t kMostInteractiveThreads = limits::kInteractiveThreads;
  static constexpr std::size_t kMostUtilityThreads = limits::kUtilityThreads;
  static constexpr std::size_t kMostBackgroundThreads = limits::kBackgroundThreads;

  explicit ThreadPoolWorkQueues(std::shared_ptr<TimerThread> timers);
  /// Waits up to 2 s for what is queued, then ends the threads; a step that runs
  /// is waited for. Steps queued later are dropped. May run inside a step, and
  /// does not wait then.
  ~ThreadPoolWorkQueues() override;
  ThreadPoolWorkQueues(const ThreadPoolWorkQueues&) = delete;
  ThreadPoolWorkQueues& operator=(const ThreadPoolWorkQueues&) = delete;

  std::shared_ptr<WorkQueue> makeSerialQueue(std::string_view label,
                                             QualityOfService qualityOfService,
                                             int relativePriority) override;
  ConcurrentQueue& backgroundQueue() override;

  /// Waits until every queue has run all of its steps; true when that came
  /// before `deadline`. Steps that wait for their delay, and those of suspended
  /// queues, do not count. Called on none of the queues.
  bool drain(std::chrono::steady_clock::time_point deadline);

  /// How many threads the pools have now.
  std::size_t threadCount() const;

 private:
  struct Shared;
  struct QueueKind;
  struct Gathered;
  class Background;
  class Hand;
  class Pool;
  class Strand;
  using Line = std::deque<std::shared_ptr<Strand>>;

  static thread_local Batch* currentBatch_;
  static thread_local Hand* ownHand_;

  const std::shared_ptr<Shared> shared_;
  const std::array<std::shared_ptr<Pool>, 3> pools_;  // By quality of service.
  const std::unique_ptr<Background> background_;

  std::mutex kindsMutex_;
  std::vector<std::shared_ptr<const QueueKind>> kinds_;  // Few: labels are.
};

class ThreadPoolWorkQueues::Batch {
 public:
  /// `kUrgent`: other idle queues that it queues on go before those that wait for a
  /// thread of their pool.
  enum class Kind { kUsual, kUrgent };

  explicit Batch(Kind kind = Kind::kUsual);
  ~Batch();
  Batch(const Batch&) = delete;
  Batch& operator=(const Batch&) = delete;

 private:
  friend class ThreadPoolWorkQueues;

  bool takes() const { return strand_ == nullptr && !isRunning_; }
  /// Whether the strand is the batch's or has become so.
  bool has(Strand& strand);
  void take(std::shared_ptr<Strand> strand);
  /// Other pools' threads find a whole batch when they wake up.
  void wakeLater(std::shared_ptr<Pool> pool) { poolsToWake_.push_back(std::move(pool)); }
  /// Takes a step for a strand, to be handed over with the next ones.
  void hold(Strand& strand, QueuedStep* step);
  /// Queues what it holds.
  void letGo();
  /// Takes a strand for its pool, to be handed over with others.
  void gather(std::shared_ptr<Strand> strand);
  void handOver(Gathered& gathered);

  const bool isUrgent_;
  bool isRunning_ = false;
  std::shared_ptr<Strand> held_;  // Whose steps these are.
  StepList heldSteps_;
  int heldCount_ = 0;
  std::shared_ptr<Strand> strand_;
  std::shared_ptr<Pool> pool_;
  std::vector<std::shared_ptr<Pool>> poolsToWake_;
  std::vector<std::unique_ptr<Gathered>> gathered_;
};

}  // namespace ostrel
