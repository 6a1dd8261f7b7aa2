#include "platform/fake/RecordingSinks.h"

#include <memory>
#include <utility>

#include "platform/fake/FakeUse.h"

namespace ostrel {

RecordingAnalyticsSink::RecordingAnalyticsSink(SharedEventLog events)
    : events_(std::move(events)) {}

void RecordingAnalyticsSink::sendEventLazy(std::string_view name,
                                           PayloadProvider provider) {
  checkFakeUse(static_cast<bool>(provider), "an event has a provider");
  Event event{std::string(name), [shared = std::make_shared<PayloadProvider>(
                                      std::move(provider))] { return (*shared)(); }};
  if (events_->showsArguments()) {
    events_->add("analytics " + event.name, {event.provider().value()});
  } else {
    events_->add("analytics " + event.name);
  }
  const std::lock_guard lock(mutex_);
  sent_.push_back(std::move(event));
}

std::vector<RecordingAnalyticsSink::Event> RecordingAnalyticsSink::sent() const {
  const std::lock_guard lock(mutex_);
  return sent_;
}

std::vector<std::string> RecordingAnalyticsSink::names() const {
  std::vector<std::string> names;
  for (const Event& event : sent()) names.push_back(event.name);
  return names;
}

Dictionary RecordingAnalyticsSink::payload(std::size_t index) const {
  return sent().at(index).provider();
}

void RecordingAnalyticsSink::releaseCallbacks() {
  std::vector<Event> dropped;  // Destroyed without the lock.
  const std::lock_guard lock(mutex_);
  dropped.swap(sent_);
}

RecordingWattlogSink::RecordingWattlogSink(SharedEventLog events)
    : events_(std::move(events)) {}

void RecordingWattlogSink::logRegisteredEvent(
    std::int32_t clientID, std::string_view name, const Dictionary& event,
    const std::optional<Dictionary>& attachment) {
  events_->add("wattlog " + std::to_string(clientID) + ' ' + std::string(name),
               {event.value()});
  const std::lock_guard lock(mutex_);
  logged_.push_back({clientID, std::string(name), event, attachment});
}

std::vector<RecordingWattlogSink::Event> RecordingWattlogSink::logged() const {
  const std::lock_guard lock(mutex_);
  return logged_;
}

}  // namespace ostrel
