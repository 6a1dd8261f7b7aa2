#include "Statistics/OstrelReportingWattlogUtility.h"

#include <cstdint>
#include <optional>

#include "Statistics/OstrelReportingUtility.h"
#include "platform/Logging.h"
#include "platform/WattlogSink.h"

namespace ostrel {
namespace {

constexpr std::int32_t kWattlogClientID = 28;

}  // namespace

void OstrelReportingWattlogUtility::handleEvent(const OstrelReportingPlatform& platform,
                                                const Dictionary* payload,
                                                MessageCategory, MessageType,
                                                const Dictionary& userInfo) {
  if (payload == nullptr) return;
  const std::optional<Value> engineOnTime = payload->get(kEngineOnTimeKey);
  if (!engineOnTime) return;
  DictionaryBuilder event(payload->owner().account());
  event.set("EngineOnDuration", *engineOnTime);
  // There always is one: a session without an application has "Unknown".
  event.set("ApplicationName", HostApplicationID(userInfo));
  if (const auto timestamp = payload->get("ostrelreporting_timestamp")) {
    event.set("TimestampEnd", *timestamp);
  } else {
    OSTREL_LOG_ERROR(processLogScope,
                     "failed to get OstrelReporting timestamp for wattlog");
  }
  platform.wattlogSink->logRegisteredEvent(kWattlogClientID, "Mediora_Haptics",
                                           event.build(), /*attachment=*/std::nullopt);
}

}  // namespace ostrel
