#pragma once

#include <chrono>
#include <functional>
#include <memory>

#include "platform/ThreadAnnotations.h"

namespace ostrel {

/// A condition variable with its lock, whose waiter is a callback: waiting
/// holds no thread. At most one waiter at a time.
class OSTREL_CAPABILITY("condition") Condition {
 public:
  enum class Wake { kSignalled, kTimedOut };
  using Waiter = std::function<void(Wake)>;

  virtual ~Condition() = default;

  virtual void lock() OSTREL_ACQUIRE() = 0;
  virtual void unlock() OSTREL_RELEASE() = 0;

  /// Calls `waiter` once: at the next `signal`, or when `timeout` has passed on
  /// the monotonic clock. Called with the lock held. The waiter runs on any
  /// thread, possibly while the signaller still holds the lock, so it must not
  /// take the lock itself; a wake may be spurious.
  virtual void wait(std::chrono::nanoseconds timeout, Waiter waiter)
      OSTREL_REQUIRES(this) = 0;

  /// Wakes the waiter; without one the signal is lost. Called with the lock
  /// held.
  virtual void signal() OSTREL_REQUIRES(this) = 0;
};

class ConditionFactory {
 public:
  virtual ~ConditionFactory() = default;

  virtual std::shared_ptr<Condition> makeCondition() = 0;
};

}  // namespace ostrel
