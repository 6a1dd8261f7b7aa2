#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/ChannelReportingService.h"
#include "platform/OstrelReportingPlatform.h"
#include "platform/Value.h"

namespace ostrel {

/// One group of driver channels.
class OstrelReportingDriver {
 public:
  /// No group name stands for any group, no subgroup name for any subgroup.
  static OstrelReportingDriver driverWithGroupName(
      std::optional<std::string> groupName, std::optional<std::string> subGroupName);

  const std::optional<std::string>& groupName() const { return groupName_; }
  const std::optional<std::string>& subGroupName() const { return subGroupName_; }

  /// "group-subgroup", with "(null)" for a missing name: the driver's key in
  /// snapshots.
  std::string description() const;

 private:
  OstrelReportingDriver(std::optional<std::string> groupName,
                        std::optional<std::string> subGroupName);

  std::optional<std::string> groupName_;
  std::optional<std::string> subGroupName_;
};

/// The live subscription to the channels of one driver.
class OstrelReportingIOChannelSubscription {
 public:
  /// Not subscribed yet.
  static std::shared_ptr<OstrelReportingIOChannelSubscription> initWithDriver(
      OstrelReportingDriver driver);

  const OstrelReportingDriver& driver() const { return driver_; }

  /// None until set. Kept as long as the process: drivers go on counting.
  const std::shared_ptr<ChannelSubscription>& subscription() const {
    return subscription_;
  }
  void setSubscription(std::shared_ptr<ChannelSubscription> subscription);

  /// The service's own description of the channels; each sampling hands it
  /// back. None until set.
  const std::optional<Dictionary>& subscribedChannels() const {
    return subscribedChannels_;
  }
  void setSubscribedChannels(Dictionary subscribedChannels);

 private:
  explicit OstrelReportingIOChannelSubscription(OstrelReportingDriver driver);

  const OstrelReportingDriver driver_;
  std::shared_ptr<ChannelSubscription> subscription_;
  std::optional<Dictionary> subscribedChannels_;
};

/// The counters of all drivers at one moment: the samples of each driver that
/// could be sampled, under the driver's description.
using DriverSnapShot = std::map<std::string, Dictionary>;

/// Samples the counters that audio drivers publish. Every failure of the
/// channel service is logged with its code and leaves only that driver out.
///
/// Operations from any thread, several at once. They block as long as the
/// channel service takes.
class OstrelReportingDriverUtility {
 public:
  /// Registers the log scope and subscribes to every driver whose channels can
  /// be found now. A driver that comes later is never noticed.
  static std::shared_ptr<OstrelReportingDriverUtility> init(
      const OstrelReportingPlatform& platform);

  /// The counters now; empty when no driver could be sampled, never none.
  std::shared_ptr<const DriverSnapShot> getSnapShot() const;

  /// Channel name to how far that counter rose since `snapShot`; counters that
  /// did not rise are left out, and none is returned when all are. A driver
  /// that the snapshot lacks, or whose difference cannot be made, gives its
  /// absolute counters, as does every driver when `snapShot` is none. Of two
  /// drivers with a channel of one name, the later counts.
  std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(
      const std::shared_ptr<const DriverSnapShot>& snapShot) const;

  /// In the order in which the drivers are listed.
  const std::vector<std::shared_ptr<OstrelReportingIOChannelSubscription>>&
  ioChannelSubscriptions() const {
    return ioChannelSubscriptions_;
  }

 private:
  explicit OstrelReportingDriverUtility(
      std::shared_ptr<ChannelReportingService> channelReportingService);

  void subscribeToDriver(const OstrelReportingDriver& driver);

  Outcome<Dictionary> createSamples(
      const OstrelReportingIOChannelSubscription& subscription) const;

  /// None, with the error logged, when sampling gave an error.
  static std::optional<Dictionary> samplesUnlessError(Outcome<Dictionary> samples);

  /// What moved between `earlier` and `current`; all of `current` when that
  /// cannot be told, with an error logged.
  std::optional<Dictionary> samplesSince(const std::optional<Dictionary>& earlier,
                                         const Dictionary& current) const;

  const std::shared_ptr<ChannelReportingService> channelReportingService_;
  // Filled by `init` before the object is shared; read-only since.
  std::vector<std::shared_ptr<OstrelReportingIOChannelSubscription>>
      ioChannelSubscriptions_;
};

}  // namespace ostrel
