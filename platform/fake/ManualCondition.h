#pragma once

#include <cstddef>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/Condition.h"
#include "platform/fake/ManualClock.h"

namespace ostrel {

/// A condition whose timeouts come from a manual clock. The waiter runs inside
/// `signal`, with the signaller's lock held, or inside the clock's `advance`.
class ManualCondition final : public Condition,
                              public std::enable_shared_from_this<ManualCondition> {
 public:
  explicit ManualCondition(std::shared_ptr<ManualClock> clock);

  void lock() OSTREL_ACQUIRE() override;
  void unlock() OSTREL_RELEASE() override;
  void wait(std::chrono::nanoseconds timeout, Waiter waiter)
      OSTREL_REQUIRES(this) override;
  void signal() OSTREL_REQUIRES(this) override;

  bool hasWaiter() const;
  /// Wakes the waiter as a signal does, though nobody signalled. There must be
  /// one. Called without the lock.
  void wakeSpuriously();
  /// Drops the waiter uncalled.
  void releaseCallbacks();

 private:
  bool isHeld() const;
  void wake(Wake reason);

  const std::shared_ptr<ManualClock> clock_;
  std::mutex lock_;  // What `lock` and `unlock` mean.

  mutable std::mutex mutex_;  // Of what follows.
  std::thread::id holder_;
  Waiter waiter_;
  ManualClock::TimerID timer_ = 0;
};

class ManualConditionFactory final : public ConditionFactory {
 public:
  explicit ManualConditionFactory(std::shared_ptr<ManualClock> clock);

  std::shared_ptr<Condition> makeCondition() override;

  /// Every condition made so far that is still alive, oldest first.
  std::vector<std::shared_ptr<ManualCondition>> conditions() const;
  std::size_t waiterCount() const;
  /// Wakes every waiter spuriously; returns how many there were.
  std::size_t wakeAllSpuriously();
  void releaseCallbacks();

 private:
  const std::shared_ptr<ManualClock> clock_;
  mutable std::mutex mutex_;
  std::vector<std::weak_ptr<ManualCondition>> conditions_;
};

}  // namespace ostrel
