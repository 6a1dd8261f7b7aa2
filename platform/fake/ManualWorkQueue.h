#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/WorkQueue.h"
#include "platform/fake/ManualClock.h"

namespace ostrel {

class ManualWorkQueueFactory;

/// A serial queue whose steps run when the test says so, on the test's thread.
class ManualWorkQueue final : public WorkQueue,
                              public std::enable_shared_from_this<ManualWorkQueue> {
 public:
  void async(Task step) override;
  void suspend() override;
  void resume(Task first) override;
  bool isCurrent() const override;
  const std::string& label() const override { return label_; }

  QualityOfService qualityOfService() const { return qualityOfService_; }
  int relativePriority() const { return relativePriority_; }
  bool isSuspended() const;
  /// Steps that wait, those of a suspended queue included.
  std::size_t waitingCount() const;

  /// Runs `action` here and now as if it were a step of this queue: for
  /// operations that ask to be called on the queue.
  void runAs(const std::function<void()>& action);

 private:
  friend class ManualWorkQueueFactory;
  struct Shared;
  struct Step {
    std::uint64_t order;
    Task task;
  };

  ManualWorkQueue(std::shared_ptr<Shared> shared, std::size_t number, std::string label,
                  QualityOfService qualityOfService, int relativePriority);

  void updateReady();  // With the lock held.

  const std::shared_ptr<Shared> shared_;
  const std::size_t number_;
  const std::string label_;
  const QualityOfService qualityOfService_;
  const int relativePriority_;

  // Under the lock of `shared_`.
  std::deque<Step> steps_;
  bool isSuspended_ = false;
  bool isRunning_ = false;
  std::uint64_t readyAt_ = 0;  // 0: not among the ready ones.
};

/// Makes manual queues and runs their steps, in the order in which they were
/// queued whatever the queue, one at a time. Steps may be queued from any
/// thread; only one thread runs them. Asking to run from inside a step is a
/// mistake and ends the program.
class ManualWorkQueueFactory final : public WorkQueueFactory, private ConcurrentQueue {
 public:
  /// Delayed steps wait on `clock`.
  explicit ManualWorkQueueFactory(std::shared_ptr<ManualClock> clock);
  ~ManualWorkQueueFactory() override;

  std::shared_ptr<WorkQueue> makeSerialQueue(std::string_view label,
                                             QualityOfService qualityOfService,
                                             int relativePriority) override;
  ConcurrentQueue& backgroundQueue() override { return *this; }

  /// Runs the step that was queued first; false when none can run.
  bool runOne();
  /// Runs until no step can run: what is left waits for time or is suspended.
  /// Returns how many ran.
  std::size_t runUntilIdle();

  /// For tests that choose which queue goes on: the numbers of those that can run a
  /// step, ascending. Queues count from 1 in the order of making; the background queue
  /// is 0.
  std::vector<std::size_t> readyQueues() const;
  /// How many steps of the background queue wait, delayed ones apart.
  std::size_t backgroundCount() const { return background_->waitingCount(); }
  /// Runs one step of that ready queue: its first, or of the background queue, whose
  /// steps have no order, the one at `position`.
  void runOneOf(std::size_t number, std::size_t position);

  /// Every queue made so far that is still alive, oldest first.
  std::vector<std::shared_ptr<ManualWorkQueue>> queues() const;
  /// The oldest living queue of that label; ends the program when there is none.
  std::shared_ptr<ManualWorkQueue> queue(std::string_view label) const;

  /// The delays of all steps that the background queue was given, in order.
  std::vector<std::chrono::nanoseconds> backgroundDelays() const;

  /// Drops all waiting steps unrun.
  void releaseCallbacks();

 private:
  void asyncAfter(std::chrono::nanoseconds delay, Task step) override;
  /// With the lock held; the step runs without.
  void runStepOf(std::shared_ptr<ManualWorkQueue> queue, std::size_t position,
                 std::unique_lock<std::mutex> lock);

  const std::shared_ptr<ManualClock> clock_;
  const std::shared_ptr<ManualWorkQueue::Shared> shared_;
  // Steps of the background queue that are due; they pass through a serial
  // queue, for a test runs one step at a time.
  const std::shared_ptr<ManualWorkQueue> background_;
};

}  // namespace ostrel
