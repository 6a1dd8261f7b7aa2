#pragma once

#include "Statistics/OstrelReportingTypes.h"
#include "platform/OstrelReportingPlatform.h"
#include "platform/Value.h"

namespace ostrel {

/// Mirrors every message into the analytics service. Keeps no state.
class OstrelReportingTallyraBridge {
 public:
  OstrelReportingTallyraBridge() = delete;

  /// Offers the sink an event named after category and type, whose payload is
  /// `payload` (none: empty) with "HostApplicationDisplayID" set from
  /// `userInfo`. The payload is made only if the sink asks for it, then or later,
  /// on any thread.
  ///
  /// `userInfo` is the session's as it is now: the event then neither keeps the
  /// session alive nor sees what is configured later. Any thread.
  static void handleEvent(const OstrelReportingPlatform& platform,
                          const Dictionary* payload, MessageCategory category,
                          MessageType type, const Dictionary& userInfo);
};

}  // namespace ostrel
