// A message that waits is in `timersInFlight_` under its key from its first add
// until its timer has fired. Its timer's date counts from the add, but the timer
// can fire only once the worker has added it to its run loop; the worker does so
// for all new keys at once, then lets the run loop empty itself. What is added
// meanwhile waits for the whole batch, however long that folds itself on.
#include "Statistics/Service/OstrelReportingBlockThrottle.h"

#include <algorithm>
#include <cstdint>
#include <optional>
#include <set>
#include <string_view>
#include <tuple>
#include <utility>

#include "Statistics/OstrelReportingUtility.h"
#include "platform/Logging.h"

namespace ostrel {
namespace {

LogScope logScope("osrr", "reporting_rtc_verbose");

constexpr ThrottleTime kUsualDelay{0.5};
constexpr double kMostSeconds = 5.0;
constexpr std::chrono::milliseconds kWorkerSleep{100};
constexpr std::chrono::milliseconds kPollInterval{500};
constexpr int kMostPolls = 10;
constexpr int kMostSecondsToWait = 5;
constexpr std::size_t kUsualUnscheduledKeys = 6;

std::chrono::nanoseconds timerDelay(ThrottleTime time) {
  if (!(time.count() > 0)) return std::chrono::nanoseconds::zero();
  const double seconds = std::min(time.count(), kMostSeconds);
  return std::chrono::duration_cast<std::chrono::nanoseconds>(ThrottleTime(seconds));
}

// A payload key in its place: integers by value, then text by its bytes.
using KeyOrder = std::tuple<int, std::uint64_t, std::string_view>;

// None for a value that is no key.
std::optional<KeyOrder> keyOrder(ValueView key) {
  if (const auto text = key.string()) return KeyOrder{2, 0, *text};
  if (const auto number = key.unsignedInteger()) return KeyOrder{1, *number, {}};
  if (const auto number = key.signedInteger()) {
    return KeyOrder{0, static_cast<std::uint64_t>(*number), {}};
  }
  return std::nullopt;
}

std::set<KeyOrder> excludedKeys(const Dictionary& payload) {
  std::set<KeyOrder> excluded;
  for (const std::string_view key : ThrottleExcludedKeys) {
    excluded.insert({2, 0, key});
  }
  if (const auto blacklist = payload.find("_comparison_field_blacklist")) {
    if (const auto entries = blacklist->array()) {
      for (const ValueView entry : *entries) {
        if (const auto key = keyOrder(entry)) excluded.insert(*key);
      }
    }
  }
  if (payload.contains("Volume") && payload.contains("VolumeOperationTime")) {
    excluded.insert({2, 0, "Volume"});
    excluded.insert({2, 0, "VolumeOperationTime"});
  }
  return excluded;
}

}  // namespace

void OstrelReportingBlockThrottleTimerWrapper::sleepFor(ThrottleTime duration) {
  if (const std::shared_ptr<RunLoopTimer> timer = timer_.get()) {
    timer->setFireDate(timerDelay(duration));
  }
}

std::shared_ptr<OstrelReportingBlockThrottle> OstrelReportingBlockThrottle::init(
    std::shared_ptr<RunLoopFactory> runLoops) {
  registerLogScope(logScope);
  auto throttle =
      std::make_shared<OstrelReportingBlockThrottle>(Passkey(), std::move(runLoops));
  throttle->runLoops_->startThread(
      "throttle", [throttle](RunLoop& runLoop) { throttle->runWorker(runLoop); });
  return throttle;
}

OstrelReportingBlockThrottle::OstrelReportingBlockThrottle(
    Passkey, std::shared_ptr<RunLoopFactory> runLoops)
    : runLoops_(std::move(runLoops)) {
  unscheduledTimerKeys_.lock()->reserve(kUsualUnscheduledKeys);
}

void OstrelReportingBlockThrottle::addMessageBlock(Block block, ReporterID reporterID,
                                                   const Dictionary& message,
                                                   MessageCategory category,
                                                   MessageType type) {
  const std::string key = buildMessageKey(message, reporterID, category, type);
  const ThrottleTime delay = determineSleepTime(message);
  std::shared_ptr<TimerWrapper> waiting;
  {
    // Looking up and storing are one step, so that of two callers with one key
    // the second folds.
    const auto timers = timersInFlight_.lock();
    std::shared_ptr<TimerWrapper>& entry = (*timers)[key];
    waiting = entry;
    if (waiting == nullptr) entry = makeTimerWrapper(std::move(block), delay, key);
  }
  if (waiting != nullptr) {
    OSTREL_LOG_DEBUG(logScope, "Dropping duplicate message for %@", key);
    waiting->sleepFor(delay);
    waiting->setBlock(std::move(block));
    return;
  }
  unscheduledTimerKeys_.lock()->push_back(key);
}

std::shared_ptr<OstrelReportingBlockThrottleTimerWrapper>
OstrelReportingBlockThrottle::makeTimerWrapper(Block block, ThrottleTime delay,
                                               const std::string& key) {
  auto wrapper = std::make_shared<TimerWrapper>(std::move(block));
  // The timer is reachable through the wrapper alone, and its owner holds both:
  // neither may keep the other.
  wrapper->setTimer(runLoops_->makeTimer(
      timerDelay(delay),
      [self = weak_from_this(), weakWrapper = std::weak_ptr(wrapper), key] {
        const auto throttle = self.lock();
        const auto fired = weakWrapper.lock();
        if (throttle != nullptr && fired != nullptr) throttle->fire(*fired, key);
      }));
  return wrapper;
}

void OstrelReportingBlockThrottle::fire(const TimerWrapper& wrapper,
                                        const std::string& key) {
  try {
    wrapper.block()();
  } catch (...) {
    // A block answers for its own failures; the entry goes all the same.
  }
  // Kept: an equal message that was added while the block ran goes with it,
  // undelivered. [KeepsDroppingWhatIsFoldedWhileItsBlockRuns]
  std::shared_ptr<TimerWrapper> removed;  // Released after the lock.
  const auto timers = timersInFlight_.lock();
  const auto entry = timers->find(key);
  if (entry == timers->end()) return;
  removed = std::move(entry->second);
  removed->timer()->invalidate();
  timers->erase(entry);
}

void OstrelReportingBlockThrottle::runWorker(RunLoop& runLoop) {
  while (shouldKeepRunning_) {
    if (!unscheduledTimerKeys_.lock()->empty()) {
      OSTREL_LOG_DEBUG(logScope, "calling workingRunLoop run from inside thread block");
      attachUnscheduledTimers(runLoop);
      // Kept: what is added from here on waits until the whole batch has fired.
      // [KeepsThrottleBatching]
      runLoop.run();
    }
    OSTREL_LOG_DEBUG(logScope, "sleeping in thread");
    runLoops_->sleep(kWorkerSleep);
  }
}

void OstrelReportingBlockThrottle::attachUnscheduledTimers(RunLoop& runLoop) {
  std::vector<std::string> keys;
  keys.reserve(kUsualUnscheduledKeys);
  std::swap(keys, *unscheduledTimerKeys_.lock());
  for (const std::string& key : keys) {
    std::shared_ptr<TimerWrapper> wrapper;
    {
      const auto timers = timersInFlight_.lock();
      const auto entry = timers->find(key);
      if (entry != timers->end()) wrapper = entry->second;
    }
    if (wrapper != nullptr) runLoop.add(wrapper->timer());
  }
}

void OstrelReportingBlockThrottle::waitForCompletion() {
  OSTREL_LOG_INFO(logScope,
                  "waitForCompletion. timersInFlight=%u unscheduledTimerKeys=%u",
                  timersInFlightCount(), unscheduledTimerKeys_.lock()->size());
  if (timersInFlightCount() == 0) return;
  OSTREL_LOG_DEBUG(logScope,
                   "Waiting up to %u seconds for blockThrottle queue to be empty.",
                   kMostSecondsToWait);
  std::size_t left = timersInFlightCount();
  for (int i = 0; i < kMostPolls && left != 0; ++i) {
    runLoops_->sleep(kPollInterval);
    left = timersInFlightCount();
  }
  if (left == 0) return;
  OSTREL_LOG_DEFAULT(logScope,
                     "Giving up on waiting for completion after %u seconds. "
                     "timersInFlight=%u",
                     kMostSecondsToWait, left);
}

std::string OstrelReportingBlockThrottle::buildMessageKey(const Dictionary& payload,
                                                          ReporterID reporterID,
                                                          MessageCategory category,
                                                          MessageType type) {
  const std::set<KeyOrder> excluded = excludedKeys(payload);
  std::vector<std::pair<KeyOrder, DictionaryView::Entry>> entries;
  entries.reserve(payload.size());
  for (const DictionaryView::Entry entry : payload) {
    if (const auto order = keyOrder(entry.key)) entries.emplace_back(*order, entry);
  }
  std::sort(entries.begin(), entries.end(),
            [](const auto& a, const auto& b) { return a.first < b.first; });
  std::string key;
  for (const auto& [order, entry] : entries) {
    appendDescription(key, entry.key);
    key += '|';
    if (excluded.count(order) != 0) {
      key += '^';
    } else {
      appendDescription(key, entry.value);
    }
    key += '|';
  }
  key += "reporterID|";
  key += std::to_string(static_cast<std::int64_t>(reporterID));
  key += '|';
  appendCategoryName(key, category);
  key += '|';
  key += MessageTypeName(type);
  return key;
}

ThrottleTime OstrelReportingBlockThrottle::determineSleepTime(const Dictionary& payload) {
  const std::optional<Value> time = payload.get("_throttle_seconds");
  if (!time) return kUsualDelay;
  const std::optional<double> seconds = time->view().number();
  if (!seconds) {
    OSTREL_LOG_INFO(logScope, "Rejecting non Numbrel value of throttle time. {time=%@}",
                    *time);
    return kUsualDelay;
  }
  // The whole seconds count: 4.9 passes, 5 does not.
  if (*seconds >= kMostSeconds) {
    OSTREL_LOG_INFO(logScope, "Rejecting large throttle time. {time=%@, max=%f}", *time,
                    kMostSeconds);
    return kUsualDelay;
  }
  if (!(*seconds > 0)) return ThrottleTime(*seconds);  // May be beyond a float.
  return ThrottleTime(double{static_cast<float>(*seconds)});
}

}  // namespace ostrel
