#include "Statistics/OstrelReportingTallyraBridge.h"

#include "Statistics/OstrelReportingUtility.h"
#include "platform/AnalyticsSink.h"

namespace ostrel {

void OstrelReportingTallyraBridge::handleEvent(const OstrelReportingPlatform& platform,
                                               const Dictionary* payload,
                                               MessageCategory category, MessageType type,
                                               const Dictionary& userInfo) {
  platform.analyticsSink->sendEventLazy(
      messageNames(category, type).event,
      [message = payload != nullptr ? *payload : Dictionary(), userInfo] {
        return message.with("HostApplicationDisplayID", HostApplicationID(userInfo));
      });
}

}  // namespace ostrel
