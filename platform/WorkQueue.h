#pragma once

#include <chrono>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Task.h"
#include "platform/ThreadAnnotations.h"

namespace ostrel {

/// How soon work wants a processor. Mapped to the niceness of the threads that
/// run it.
enum class QualityOfService { kUserInteractive, kUtility, kBackground };

/// What the steps of a queue work on, and what may be far away in memory.
class Subject {
 public:
  static constexpr int kStages = 3;

  /// Asks for part of the memory that the next step will look at, and does not wait for
  /// it: the subject itself, then, once that had time to come, what it points to, and
  /// so on, `stage` from 0 to `kStages` - 1. No step of the queue runs meanwhile.
  virtual void fetchAhead(int stage) const noexcept = 0;

 protected:
  ~Subject() = default;
};

/// A serial queue: its steps run one at a time, in the order in which they were
/// queued, on any thread of the platform's. A queue costs no thread.
///
/// A queue that its owner releases still runs what was queued.
class OSTREL_CAPABILITY("work queue") WorkQueue {
 public:
  virtual ~WorkQueue() = default;

  /// What its steps work on, each of which keeps it alive. Before the first step.
  virtual void setSubject(const Subject& /*subject*/) {}

  /// Queues `step`. Any thread; never blocks, never runs the step inline.
  virtual void async(Task step) = 0;

  /// Lets the calling thread run this queue until `leave`, as a step of the queue does:
  /// for work that would be queued, and that nothing comes before. What others queue
  /// meanwhile waits. False where the thread may not do so, as on most threads, or where
  /// something is queued or runs: the work is to be queued then. Off all queues.
  virtual bool tryEnter() { return false; }
  virtual void leave() {}

  /// Holds everything that is queued back from the end of the current step
  /// until `resume`. A held queue holds no thread. Called on this queue.
  virtual void suspend() = 0;

  /// Ends a suspension: `first` runs next, before all that waits. Any thread,
  /// also while the step that called `suspend` still runs. Exactly one `resume`
  /// for each `suspend`.
  virtual void resume(Task first) = 0;

  /// Whether the calling thread is running a step of this queue.
  virtual bool isCurrent() const = 0;

  virtual const std::string& label() const = 0;

  /// Ends the process when called off this queue: a mistake in the program.
  void assertCurrent() const OSTREL_ASSERT_CAPABILITY(this);
};

/// A queue that runs several of its steps at once, in any order.
class ConcurrentQueue {
 public:
  virtual ~ConcurrentQueue() = default;

  /// Runs `step` at least `delay` from now; zero still goes through the queue
  /// and never runs inline. It cannot be cancelled. Any thread.
  virtual void asyncAfter(std::chrono::nanoseconds delay, Task step) = 0;
};

class WorkQueueFactory {
 public:
  virtual ~WorkQueueFactory() = default;

  /// A new serial queue. Queues may share a label. `relativePriority` is 0 or
  /// below; lower runs later within its class.
  virtual std::shared_ptr<WorkQueue> makeSerialQueue(std::string_view label,
                                                     QualityOfService qualityOfService,
                                                     int relativePriority) = 0;

  /// The process's one concurrent queue of background priority.
  virtual ConcurrentQueue& backgroundQueue() = 0;
};

}  // namespace ostrel
