#pragma once

#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/AnalyticsSink.h"
#include "platform/WattlogSink.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Keeps each event and its provider; calls none by itself, unless the events show
/// arguments. Adds "analytics NAME" to the events, its argument being the payload.
class RecordingAnalyticsSink final : public AnalyticsSink {
 public:
  struct Event {
    std::string name;
    std::function<Dictionary()> provider;
  };

  explicit RecordingAnalyticsSink(SharedEventLog events);

  void sendEventLazy(std::string_view name, PayloadProvider provider) override;

  std::vector<Event> sent() const;
  std::vector<std::string> names() const;
  /// Calls the provider of the event at `index`, counted from 0.
  Dictionary payload(std::size_t index) const;
  void releaseCallbacks();

 private:
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  std::vector<Event> sent_;
};

/// Adds "wattlog CLIENT NAME" to the events, its argument being the event.
class RecordingWattlogSink final : public WattlogSink {
 public:
  struct Event {
    std::int32_t clientID;
    std::string name;
    Dictionary event;
    std::optional<Dictionary> attachment;
  };

  explicit RecordingWattlogSink(SharedEventLog events);

  void logRegisteredEvent(std::int32_t clientID, std::string_view name,
                          const Dictionary& event,
                          const std::optional<Dictionary>& attachment) override;

  std::vector<Event> logged() const;

 private:
  const SharedEventLog events_;
  mutable std::mutex mutex_;
  std::vector<Event> logged_;
};

}  // namespace ostrel
