#pragma once

#include <string_view>

#include "platform/Task.h"
#include "platform/Value.h"

namespace ostrel {

class AnalyticsSink {
 public:
  /// Makes the event's payload. Called at most once, on any thread, and only if
  /// the sink wants the event. Holds what makes the payload of a message inside.
  using PayloadProvider = OneShot<Dictionary, 2 * sizeof(Dictionary)>;

  virtual ~AnalyticsSink() = default;

  /// Sends the event `name`, which is valid during the call. Never blocks; the caller
  /// does not learn whether the event was taken. Any thread.
  virtual void sendEventLazy(std::string_view name, PayloadProvider provider) = 0;
};

}  // namespace ostrel
