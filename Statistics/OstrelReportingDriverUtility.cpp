#include "Statistics/OstrelReportingDriverUtility.h"

#include <cstdint>
#include <utility>

#include "platform/Logging.h"

namespace ostrel {
namespace {

LogScope logScope("osrd", "reporting_driver_verbose");

struct DriverRow {
  const char* groupName;
  const char* subGroupName;
};

// The order decides whose value counts when channels share a name.
constexpr DriverRow kDriverTable[] = {
    {"OrbiskVX3QDL", nullptr},
    {"Speaker", nullptr},
    {nullptr, "QDL"},
    {"Haptics", "Stats"},
};

std::optional<std::string> nameOrNone(const char* name) {
  if (name == nullptr) return std::nullopt;
  return name;
}

}  // namespace

OstrelReportingDriver OstrelReportingDriver::driverWithGroupName(
    std::optional<std::string> groupName, std::optional<std::string> subGroupName) {
  return OstrelReportingDriver(std::move(groupName), std::move(subGroupName));
}

OstrelReportingDriver::OstrelReportingDriver(std::optional<std::string> groupName,
                                             std::optional<std::string> subGroupName)
    : groupName_(std::move(groupName)), subGroupName_(std::move(subGroupName)) {}

std::string OstrelReportingDriver::description() const {
  constexpr std::string_view kNull = "(null)";
  std::string text(groupName_ ? std::string_view(*groupName_) : kNull);
  text += '-';
  text += subGroupName_ ? std::string_view(*subGroupName_) : kNull;
  return text;
}

std::shared_ptr<OstrelReportingIOChannelSubscription>
OstrelReportingIOChannelSubscription::initWithDriver(OstrelReportingDriver driver) {
  return std::shared_ptr<OstrelReportingIOChannelSubscription>(
      new OstrelReportingIOChannelSubscription(std::move(driver)));
}

OstrelReportingIOChannelSubscription::OstrelReportingIOChannelSubscription(
    OstrelReportingDriver driver)
    : driver_(std::move(driver)) {}

void OstrelReportingIOChannelSubscription::setSubscription(
    std::shared_ptr<ChannelSubscription> subscription) {
  subscription_ = std::move(subscription);
}

void OstrelReportingIOChannelSubscription::setSubscribedChannels(
    Dictionary subscribedChannels) {
  subscribedChannels_ = std::move(subscribedChannels);
}

std::shared_ptr<OstrelReportingDriverUtility> OstrelReportingDriverUtility::init(
    const OstrelReportingPlatform& platform) {
  registerLogScope(logScope);
  OSTREL_LOG_INFO(logScope, "creating chanreporting driver utility");
  std::shared_ptr<OstrelReportingDriverUtility> utility(
      new OstrelReportingDriverUtility(platform.channelReportingService));
  for (const DriverRow& row : kDriverTable) {
    utility->subscribeToDriver(OstrelReportingDriver::driverWithGroupName(
        nameOrNone(row.groupName), nameOrNone(row.subGroupName)));
  }
  return utility;
}

OstrelReportingDriverUtility::OstrelReportingDriverUtility(
    std::shared_ptr<ChannelReportingService> channelReportingService)
    : channelReportingService_(std::move(channelReportingService)) {}

void OstrelReportingDriverUtility::subscribeToDriver(
    const OstrelReportingDriver& driver) {
  const Outcome<std::shared_ptr<ChannelCollection>> channels =
      channelReportingService_->copyChannelsInGroup(driver.groupName(),
                                                    driver.subGroupName());
  if (channels.error) {
    OSTREL_LOG_ERROR(logScope, "error %li getting channels for driver %@-%@",
                     channels.error->code, driver.groupName(), driver.subGroupName());
  }
  if (!channels.value || *channels.value == nullptr) return;
  const ChannelCollection& collection = **channels.value;
  if (collection.channelCount() < 1) {
    OSTREL_LOG_INFO(logScope, "couldn't find any channels for driver group %@-%@",
                    driver.groupName(), driver.subGroupName());
  } else {
    const auto subscription =
        OstrelReportingIOChannelSubscription::initWithDriver(driver);
    ChannelReportingService::Subscribed subscribed =
        channelReportingService_->createSubscription(collection);
    subscription->setSubscription(std::move(subscribed.subscription));
    subscription->setSubscribedChannels(std::move(subscribed.subscribedChannels));
    ioChannelSubscriptions_.push_back(subscription);
  }
  // Kept: the line of a subscription doubles a word, and is written for a group
  // without channels too. [KeepsMisspeltLogTexts]
  OSTREL_LOG_DEFAULT(logScope, "subscribed to group group %@-%@", driver.groupName(),
                     driver.subGroupName());
}

std::shared_ptr<const DriverSnapShot> OstrelReportingDriverUtility::getSnapShot() const {
  auto snapShot = std::make_shared<DriverSnapShot>();
  for (const auto& subscription : ioChannelSubscriptions_) {
    OSTREL_LOG_INFO(logScope, "sampling driver");
    if (const std::optional<Dictionary> samples =
            samplesUnlessError(createSamples(*subscription))) {
      snapShot->insert_or_assign(subscription->driver().description(), *samples);
    }
  }
  return snapShot;
}

std::optional<Dictionary>
OstrelReportingDriverUtility::getDriverStatisticsRelativeToSnapShot(
    const std::shared_ptr<const DriverSnapShot>& snapShot) const {
  DictionaryBuilder statistics;
  for (const auto& subscription : ioChannelSubscriptions_) {
    OSTREL_LOG_INFO(logScope, "getting latest samples");
    Outcome<Dictionary> latest = createSamples(*subscription);
    OSTREL_LOG_INFO(logScope, "done getting latest samples");
    const std::optional<Dictionary> current = samplesUnlessError(std::move(latest));
    if (!current) continue;
    std::optional<Dictionary> working = current;
    if (snapShot != nullptr) {
      const auto entry = snapShot->find(subscription->driver().description());
      working = samplesSince(
          entry != snapShot->end() ? std::optional(entry->second) : std::nullopt,
          *current);
    }
    if (!working) continue;
    channelReportingService_->iterate(
        *working, [&](const ChannelReportingService::Channel& channel) {
          const std::int64_t value = channel.simpleIntegerValue();
          if (value >= 1) statistics.set(channel.channelName(), value);
          return 0;
        });
  }
  if (statistics.empty()) return std::nullopt;
  return statistics.build();
}

Outcome<Dictionary> OstrelReportingDriverUtility::createSamples(
    const OstrelReportingIOChannelSubscription& subscription) const {
  return channelReportingService_->createSamples(*subscription.subscription(),
                                                 *subscription.subscribedChannels());
}

std::optional<Dictionary> OstrelReportingDriverUtility::samplesUnlessError(
    Outcome<Dictionary> samples) {
  if (samples.error) {
    OSTREL_LOG_ERROR(logScope, "ChanrepCreateSamples error %li", samples.error->code);
    return std::nullopt;
  }
  return std::move(samples.value);
}

std::optional<Dictionary> OstrelReportingDriverUtility::samplesSince(
    const std::optional<Dictionary>& earlier, const Dictionary& current) const {
  Outcome<Dictionary> delta =
      channelReportingService_->createSamplesDelta(earlier, current);
  if (delta.error) {
    OSTREL_LOG_ERROR(logScope, "ChanrepCreateSamplesDelta error %li", delta.error->code);
    // Kept: where a difference cannot be made, absolute counters stand for it,
    // unmarked. [KeepsAbsoluteCountersWhenDeltaFails]
    return current;
  }
  return std::move(delta.value);
}

}  // namespace ostrel
