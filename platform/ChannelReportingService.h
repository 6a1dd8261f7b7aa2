#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Outcome.h"
#include "platform/Value.h"

namespace ostrel {

/// The channels that a look-up found. Opaque but for its count.
class ChannelCollection {
 public:
  virtual ~ChannelCollection() = default;
  virtual std::int32_t channelCount() const = 0;
};

/// A live subscription to the channels of a collection. Opaque.
class ChannelSubscription {
 public:
  virtual ~ChannelSubscription() = default;
};

/// Counters that drivers publish, in groups and subgroups. The layout of
/// samples is the service's own. All operations from any thread; each is
/// bounded in time, and one that overruns hands back an error.
class ChannelReportingService {
 public:
  struct Subscribed {
    std::shared_ptr<ChannelSubscription> subscription;
    Dictionary subscribedChannels;
  };

  /// One channel during an iteration.
  class Channel {
   public:
    virtual ~Channel() = default;
    virtual std::string_view channelName() const = 0;
    virtual std::int64_t simpleIntegerValue() const = 0;
  };

  /// Returns 0 to go on.
  using ChannelCallback = std::function<int(const Channel&)>;

  virtual ~ChannelReportingService() = default;

  /// No group matches any group, no subgroup any subgroup.
  virtual Outcome<std::shared_ptr<ChannelCollection>> copyChannelsInGroup(
      const std::optional<std::string>& groupName,
      const std::optional<std::string>& subGroupName) = 0;

  virtual Subscribed createSubscription(const ChannelCollection& channels) = 0;

  virtual Outcome<Dictionary> createSamples(const ChannelSubscription& subscription,
                                            const Dictionary& subscribedChannels) = 0;

  /// How far each channel of `later` moved since `earlier`.
  virtual Outcome<Dictionary> createSamplesDelta(const std::optional<Dictionary>& earlier,
                                                 const Dictionary& later) = 0;

  /// Calls `callback` once per channel, on the calling thread, until it returns
  /// other than 0.
  virtual void iterate(const Dictionary& samples, const ChannelCallback& callback) = 0;
};

}  // namespace ostrel
