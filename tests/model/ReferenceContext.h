// What the parts of the reference share: queues that the test runs, and the log.
#pragma once

#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"
#include "platform/Logging.h"
#include "tests/model/Surroundings.h"

namespace ostrel::reference {

using Step = std::function<void()>;

/// Queues by number: 0 is the background queue, whose steps have no order; the others
/// are serial. A step runs when the test says so.
class Queues {
 public:
  /// A new serial queue.
  std::size_t make();
  void add(std::size_t queue, Step step);
  /// The queue runs nothing until it is released.
  void hold(std::size_t queue) { queues_[queue].isHeld = true; }
  /// `first` runs before all that waits.
  void release(std::size_t queue, Step first);

  /// Those that can run a step, ascending.
  std::vector<std::size_t> ready() const;
  std::size_t backgroundCount() const { return queues_[0].steps.size(); }
  void run(std::size_t queue, std::size_t position);
  /// Drops all steps.
  void clear();

 private:
  struct Queue {
    std::deque<Step> steps;
    bool isHeld = false;
  };
  std::deque<Queue> queues_{1};
};

/// One wait for backends: a condition variable whose only waiter is a step.
struct BackendWait {
  std::function<void(bool isTimeout)> waiter;  // None: nobody waits.
  ManualClock::TimerID timer = 0;

  void begin(ManualClock& clock, std::function<void(bool isTimeout)> next);
  /// Lost when nobody waits.
  void wake(ManualClock& clock, bool isTimeout);
};

struct Context {
  explicit Context(Surroundings& surroundings) : around(surroundings) {}

  template <typename... Arguments>
  void log(LogLevel level, std::string_view scope, std::string_view text,
           const Arguments&... arguments) const {
    if (level == LogLevel::kDebug && !verboseScopes.contains(scope)) return;
    write(level, scope, format(text, arguments...));
  }
  /// Whether this is an internal build; asked once.
  bool isInternalBuild();

  Surroundings& around;
  Queues queues;
  std::set<std::string, std::less<>> verboseScopes;
  std::vector<std::weak_ptr<BackendWait>> waits;

 private:
  void write(LogLevel level, std::string_view scope, const std::string& text) const;

  std::optional<bool> isInternalBuild_;
};

/// The value under "HostApplicationDisplayID", or "Unknown".
Value hostApplicationID(const Dictionary& userInfo);
std::string serviceTypeName(ServiceType type);
std::string categoryName(MessageCategory category);
std::string messageTypeName(MessageType type);

}  // namespace ostrel::reference
