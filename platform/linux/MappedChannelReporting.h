#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <utility>
#include <vector>

#include "platform/ChannelReportingService.h"
#include "platform/linux/ChannelSource.h"
#include "platform/linux/DeadlineRunner.h"
#include "platform/linux/Limits.h"

namespace ostrel {

/// Driver counters from channel files (`docs/channels.md`) and other sources.
///
/// An operation that touches a source takes `Waits::most` at most, or
/// `Waits::behindAnother` while another one hangs, so that a caller who samples
/// every driver in a row waits for 250 ms at most. Beyond it the error is
/// ETIMEDOUT, and EBUSY from then on until the source answers. Errors are of the
/// domain "POSIX".
///
/// Samples are a dictionary of sources, each a dictionary of channel names and
/// values. A channel that the earlier samples do not hold counts as having been
/// 0 then; a counter that wraps around has moved by what it counted.
class MappedChannelReporting final : public ChannelReportingService {
 public:
  struct Waits {
    std::chrono::milliseconds most = limits::kDriverWait;
    std::chrono::milliseconds behindAnother{10};
  };
  /// Operations that may hang at a time, one a driver.
  static constexpr std::size_t kMostHanging = limits::kHangingDrivers;
  /// Of one subscription. A report of that many is a payload that is allowed.
  static constexpr std::size_t kMostChannels = limits::kDriverChannels;

  using Finders = std::vector<std::shared_ptr<const ChannelFinder>>;

  /// The channel files in the runtime directory, and the sound cards.
  static std::shared_ptr<MappedChannelReporting> ofSystem();

  explicit MappedChannelReporting(Finders finders)
      : MappedChannelReporting(std::move(finders), Waits()) {}
  MappedChannelReporting(Finders finders, Waits waits);

  Outcome<std::shared_ptr<ChannelCollection>> copyChannelsInGroup(
      const std::optional<std::string>& groupName,
      const std::optional<std::string>& subGroupName) override;
  Subscribed createSubscription(const ChannelCollection& channels) override;
  Outcome<Dictionary> createSamples(const ChannelSubscription& subscription,
                                    const Dictionary& subscribedChannels) override;
  Outcome<Dictionary> createSamplesDelta(const std::optional<Dictionary>& earlier,
                                         const Dictionary& later) override;
  void iterate(const Dictionary& samples, const ChannelCallback& callback) override;

 private:
  template <typename Result>
  Outcome<Result> bounded(std::function<Outcome<Result>()> operation);

  const Finders finders_;
  const Waits waits_;
  DeadlineRunner runner_{kMostHanging};
};

}  // namespace ostrel
