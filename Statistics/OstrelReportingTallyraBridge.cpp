#include "Statistics/OstrelReportingTallyraBridge.h"

#include <string>
#include <utility>

#include "Statistics/OstrelReportingUtility.h"
#include "platform/AnalyticsSink.h"

namespace ostrel {
namespace {

// Room for the longest name there is, so that a name is one allocation.
constexpr std::size_t kLongestEventName = 64;

std::string eventName(MessageCategory category, MessageType type) {
  std::string name;
  name.reserve(kLongestEventName);
  name += "com.orbisk.ostrel.";
  appendCategoryName(name, category);
  name += '.';
  name += MessageTypeName(type);
  return name;
}

}  // namespace

void OstrelReportingTallyraBridge::handleEvent(const OstrelReportingPlatform& platform,
                                               const Dictionary* payload,
                                               MessageCategory category, MessageType type,
                                               const Dictionary& userInfo) {
  platform.analyticsSink->sendEventLazy(
      eventName(category, type),
      [message = payload != nullptr ? *payload : Dictionary(), userInfo] {
        return message.with("HostApplicationDisplayID", HostApplicationID(userInfo));
      });
}

}  // namespace ostrel
