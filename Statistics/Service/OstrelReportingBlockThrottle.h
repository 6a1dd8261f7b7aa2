#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"
#include "Statistics/Support/AtomicProperty.h"
#include "Statistics/Support/Monitored.h"
#include "platform/RunLoop.h"
#include "platform/Value.h"

namespace ostrel {

/// Seconds as clients give them; may be below 0 or not finite.
using ThrottleTime = std::chrono::duration<double>;

/// A block that waits, and the timer that it waits for. Any thread.
class OstrelReportingBlockThrottleTimerWrapper {
 public:
  using Block = std::function<void()>;

  explicit OstrelReportingBlockThrottleTimerWrapper(Block block)
      : block_(std::move(block)) {}

  Block block() const { return block_.get(); }
  void setBlock(Block block) { block_.set(std::move(block)); }
  std::shared_ptr<RunLoopTimer> timer() const { return timer_.get(); }
  void setTimer(std::shared_ptr<RunLoopTimer> timer) { timer_.set(std::move(timer)); }

  /// Puts the timer's date at now + `duration`, whether that is sooner or later
  /// than it was.
  void sleepFor(ThrottleTime duration);

 private:
  AtomicProperty<Block> block_;
  AtomicProperty<std::shared_ptr<RunLoopTimer>> timer_;
};

/// Delays blocks that deliver messages, and folds those of equal messages into
/// one: while a block waits, a newer one for an equal message takes its place
/// and the wait starts over.
///
/// Blocks run on one worker thread, which lives as long as the process and keeps
/// the throttle. A block that throws is forgotten as if it had not. Operations
/// from any thread.
class OstrelReportingBlockThrottle final
    : public std::enable_shared_from_this<OstrelReportingBlockThrottle> {
 public:
  using Block = OstrelReportingBlockThrottleTimerWrapper::Block;

  /// Starts the worker thread.
  static std::shared_ptr<OstrelReportingBlockThrottle> init(
      std::shared_ptr<RunLoopFactory> runLoops);

  /// Has `block` run once, no sooner than `determineSleepTime(message)` from
  /// now, unless a newer block for an equal message takes its place. Returns at
  /// once.
  void addMessageBlock(Block block, ReporterID reporterID, const Dictionary& message,
                       MessageCategory category, MessageType type);

  /// Blocks the caller until no block waits, asking every half second; gives up
  /// after 5 seconds, with that logged.
  void waitForCompletion();

  /// What two messages must share to be equal: the keys and values of the
  /// payload joined by "|", "^" in place of values that are not compared, then
  /// the reporter, the category and the type.
  static std::string buildMessageKey(const Dictionary& payload, ReporterID reporterID,
                                     MessageCategory category, MessageType type);

  /// How long a message waits: its "_throttle_seconds", or 0.5 seconds when it
  /// has none, or one that is not a number or is 5 or more; the latter two are
  /// logged. 0, a negative number and one that is not a number at all (NaN) are
  /// due at once.
  static ThrottleTime determineSleepTime(const Dictionary& payload);

  /// False ends the worker thread after its present pass; what waits then never
  /// runs. Nothing in the service says so.
  void setShouldKeepRunning(bool shouldKeepRunning) {
    shouldKeepRunning_ = shouldKeepRunning;
  }

 private:
  using TimerWrapper = OstrelReportingBlockThrottleTimerWrapper;
  using Timers = std::map<std::string, std::shared_ptr<TimerWrapper>>;
  struct Passkey {};

 public:
  OstrelReportingBlockThrottle(Passkey, std::shared_ptr<RunLoopFactory> runLoops);

 private:
  std::shared_ptr<TimerWrapper> makeTimerWrapper(Block block, ThrottleTime delay,
                                                 const std::string& key);
  void runWorker(RunLoop& runLoop);
  void attachUnscheduledTimers(RunLoop& runLoop);
  void fire(const TimerWrapper& wrapper, const std::string& key);
  std::size_t timersInFlightCount() const { return timersInFlight_.lock()->size(); }

  // Constant after construction.
  const std::shared_ptr<RunLoopFactory> runLoops_;

  // Shared, each with its own lock; no path holds both.
  std::atomic<bool> shouldKeepRunning_{true};
  Monitored<Timers> timersInFlight_;
  // Keys whose timers the worker has not added to its run loop yet.
  Monitored<std::vector<std::string>> unscheduledTimerKeys_;
};

}  // namespace ostrel
