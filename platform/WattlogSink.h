#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

#include "platform/Value.h"

namespace ostrel {

class WattlogSink {
 public:
  virtual ~WattlogSink() = default;

  /// Logs a registered power event. Fire and forget; never blocks. Any thread.
  virtual void logRegisteredEvent(std::int32_t clientID, std::string_view name,
                                  const Dictionary& event,
                                  const std::optional<Dictionary>& attachment) = 0;
};

}  // namespace ostrel
