#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/ChannelReportingService.h"
#include "platform/fake/EventLog.h"

namespace ostrel {

/// Counters that the test sets, by group and subgroup. A look-up finds those of
/// every group that fits; no name asked for fits any, also one set without. Two
/// channels of one name count as two and are sampled as the later.
///
/// Samples are {channel name: value}. Events, a missing name shown as "*":
/// "channels.copyChannelsInGroup GROUP SUBGROUP", "channels.createSubscription
/// GROUP SUBGROUP", "channels.createSamples GROUP SUBGROUP",
/// "channels.createSamplesDelta", "channels.iterate".
class FakeChannelReportingService final : public ChannelReportingService {
 public:
  using Name = std::optional<std::string>;
  using Counters = std::vector<std::pair<std::string, std::int64_t>>;

  /// What a call hands back in place of its result.
  struct Fault {
    bool givesValue = false;  // The value as well.
    std::optional<ErrorObject> error;
  };

  explicit FakeChannelReportingService(SharedEventLog events);

  Outcome<std::shared_ptr<ChannelCollection>> copyChannelsInGroup(
      const Name& groupName, const Name& subGroupName) override;
  Subscribed createSubscription(const ChannelCollection& channels) override;
  Outcome<Dictionary> createSamples(const ChannelSubscription& subscription,
                                    const Dictionary& subscribedChannels) override;
  /// Without `earlier`, the values of `later`.
  Outcome<Dictionary> createSamplesDelta(const std::optional<Dictionary>& earlier,
                                         const Dictionary& later) override;
  void iterate(const Dictionary& samples, const ChannelCallback& callback) override;

  /// Replaces the channels; an empty list is a group that is there but empty. A
  /// group never set is not found: neither a value nor an error. A subscription
  /// sees the counters that its groups have when it is sampled.
  void setCounters(Name group, Name subgroup, Counters counters);
  /// For calls that ask for exactly these names, until set again with none.
  void setLookupFault(Name group, Name subgroup, std::optional<Fault> fault);
  void setSamplesFault(Name group, Name subgroup, std::optional<Fault> fault);
  void setDeltaFault(std::optional<Fault> fault);

 private:
  using Group = std::pair<Name, Name>;

  std::optional<Counters> countersOf(const Group& asked) const;  // Under the lock.

  const SharedEventLog events_;
  mutable std::mutex mutex_;
  std::map<Group, Counters> counters_;
  std::map<Group, Fault> lookupFaults_;
  std::map<Group, Fault> samplesFaults_;
  std::optional<Fault> deltaFault_;
};

}  // namespace ostrel
