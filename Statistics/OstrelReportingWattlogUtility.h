#pragma once

#include <string_view>

#include "Statistics/OstrelReportingTypes.h"
#include "platform/OstrelReportingPlatform.h"
#include "platform/Value.h"

namespace ostrel {

/// Mirrors how long the haptic engine ran into the power log. Keeps no state.
class OstrelReportingWattlogUtility {
 public:
  OstrelReportingWattlogUtility() = delete;

  /// Payloads without this key are none of its business.
  static constexpr std::string_view kEngineOnTimeKey = "EngineOnTime";

  /// Logs a "Mediora_Haptics" event when `payload` (none: nothing happens) has
  /// an "EngineOnTime"; ignores every other message silently. A payload without
  /// "ostrelreporting_timestamp" is logged all the same, with an error logged.
  /// Category and type do not matter.
  ///
  /// `userInfo` is the session's as it is now: the bridge needs nothing else of
  /// the session, and so does not know it. Any thread.
  static void handleEvent(const OstrelReportingPlatform& platform,
                          const Dictionary* payload, MessageCategory category,
                          MessageType type, const Dictionary& userInfo);
};

}  // namespace ostrel
