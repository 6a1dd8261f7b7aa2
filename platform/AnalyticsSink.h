#pragma once

#include <functional>
#include <string>

#include "platform/Value.h"

namespace ostrel {

class AnalyticsSink {
 public:
  /// Makes the event's payload. Called at most once, on any thread, and only if
  /// the sink wants the event.
  using PayloadProvider = std::function<Dictionary()>;

  virtual ~AnalyticsSink() = default;

  /// Sends the event `name`. Never blocks; the caller does not learn whether
  /// the event was taken. Any thread.
  virtual void sendEventLazy(std::string name, PayloadProvider provider) = 0;
};

}  // namespace ostrel
