#include "platform/linux/store/StoreOperation.h"

namespace ostrel {

// Its own bytes: a payload may share its buffer with others that came along.
std::size_t StoreOperation::payloadBytes() const {
  if (const auto* message = std::get_if<SessionMessage>(&what)) {
    return message->payload.value().bytes().size();
  }
  if (const auto* message = std::get_if<LoneMessage>(&what)) {
    return message->sessionInfo.value().bytes().size() +
           message->userInfo.value().bytes().size() +
           message->payload.value().bytes().size();
  }
  if (const auto* event = std::get_if<AnalyticsEvent>(&what)) {
    return event->name.size() +
           (event->payload ? event->payload->value().bytes().size() : 0);
  }
  if (const auto* event = std::get_if<PowerEvent>(&what)) {
    return event->name.size() + event->event.value().bytes().size() +
           (event->attachment ? event->attachment->value().bytes().size() : 0);
  }
  return 0;
}

}  // namespace ostrel
