#include "platform/linux/store/StoreOperation.h"

namespace ostrel {

std::size_t StoreOperation::payloadBytes() const {
  if (const auto* message = std::get_if<SessionMessage>(&what)) {
    return message->payload.owner().size();
  }
  if (const auto* message = std::get_if<LoneMessage>(&what)) {
    return message->sessionInfo.owner().size() + message->userInfo.owner().size() +
           message->payload.owner().size();
  }
  if (const auto* event = std::get_if<AnalyticsEvent>(&what)) {
    return event->name.size() + (event->payload ? event->payload->owner().size() : 0);
  }
  if (const auto* event = std::get_if<PowerEvent>(&what)) {
    return event->name.size() + event->event.owner().size() +
           (event->attachment ? event->attachment->owner().size() : 0);
  }
  return 0;
}

}  // namespace ostrel
