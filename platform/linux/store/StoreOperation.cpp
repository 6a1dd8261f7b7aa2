#include "platform/linux/store/StoreOperation.h"

namespace ostrel {

std::size_t StoreOperation::bytes() const {
  const std::size_t own = sizeof *this;
  if (const auto* message = std::get_if<SessionMessage>(&what)) {
    return own + message->payload.owner().size();
  }
  if (const auto* message = std::get_if<LoneMessage>(&what)) {
    return own + message->sessionInfo.owner().size() + message->userInfo.owner().size() +
           message->payload.owner().size();
  }
  if (const auto* event = std::get_if<AnalyticsEvent>(&what)) {
    return own + event->name.size() +
           (event->payload ? event->payload->owner().size() : 0);
  }
  if (const auto* event = std::get_if<PowerEvent>(&what)) {
    return own + event->name.size() + event->event.owner().size() +
           (event->attachment ? event->attachment->owner().size() : 0);
  }
  return own;
}

}  // namespace ostrel
