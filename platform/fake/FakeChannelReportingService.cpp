#include "platform/fake/FakeChannelReportingService.h"

#include "platform/fake/FakeUse.h"

namespace ostrel {
namespace {

using Group = std::pair<std::optional<std::string>, std::optional<std::string>>;

class Collection final : public ChannelCollection {
 public:
  Collection(Group channels, std::int32_t count)
      : group(std::move(channels)), count_(count) {}
  std::int32_t channelCount() const override { return count_; }

  const Group group;

 private:
  const std::int32_t count_;
};

class Subscription final : public ChannelSubscription {
 public:
  explicit Subscription(Group channels) : group(std::move(channels)) {}

  const Group group;
};

class FakeChannel final : public ChannelReportingService::Channel {
 public:
  FakeChannel(std::string_view name, std::int64_t value) : name_(name), value_(value) {}
  std::string_view channelName() const override { return name_; }
  std::int64_t simpleIntegerValue() const override { return value_; }

 private:
  const std::string_view name_;
  const std::int64_t value_;
};

std::string text(const Group& group) {
  return group.first.value_or("*") + ' ' + group.second.value_or("*");
}

Dictionary samplesOf(const FakeChannelReportingService::Counters& counters) {
  DictionaryBuilder samples;
  for (const auto& [name, value] : counters) samples.set(name, Value(value));
  return samples.build();
}

template <typename Map>
std::optional<typename Map::mapped_type> lookUp(const Map& map, const Group& group) {
  const auto found = map.find(group);
  if (found == map.end()) return std::nullopt;
  return found->second;
}

template <typename Map, typename Item>
void replace(Map& map, Group group, std::optional<Item> item) {
  if (item) {
    map.insert_or_assign(std::move(group), std::move(*item));
  } else {
    map.erase(group);
  }
}

template <typename T>
Outcome<T> withFault(std::optional<T> value,
                     const std::optional<FakeChannelReportingService::Fault>& fault) {
  if (!fault) return {std::move(value), std::nullopt};
  if (!fault->givesValue) value.reset();
  return {std::move(value), fault->error};
}

}  // namespace

FakeChannelReportingService::FakeChannelReportingService(SharedEventLog events)
    : events_(std::move(events)) {}

std::optional<FakeChannelReportingService::Counters>
FakeChannelReportingService::countersOf(const Group& asked) const {
  const auto fits = [](const Name& wanted, const Name& name) {
    return !wanted || wanted == name;
  };
  std::optional<Counters> found;
  for (const auto& [group, counters] : counters_) {
    if (!fits(asked.first, group.first) || !fits(asked.second, group.second)) continue;
    if (!found) found.emplace();
    found->insert(found->end(), counters.begin(), counters.end());
  }
  return found;
}

Outcome<std::shared_ptr<ChannelCollection>>
FakeChannelReportingService::copyChannelsInGroup(const Name& groupName,
                                                 const Name& subGroupName) {
  const Group group{groupName, subGroupName};
  events_->add("channels.copyChannelsInGroup " + text(group));
  const std::lock_guard lock(mutex_);
  std::optional<std::shared_ptr<ChannelCollection>> collection;
  if (const auto counters = countersOf(group)) {
    collection =
        std::make_shared<Collection>(group, static_cast<std::int32_t>(counters->size()));
  }
  return withFault(std::move(collection), lookUp(lookupFaults_, group));
}

ChannelReportingService::Subscribed FakeChannelReportingService::createSubscription(
    const ChannelCollection& channels) {
  const auto* collection = dynamic_cast<const Collection*>(&channels);
  checkFakeUse(collection != nullptr, "the collection is this service's");
  events_->add("channels.createSubscription " + text(collection->group));
  return {std::make_shared<Subscription>(collection->group),
          Dictionary{{"channels_of", Value(text(collection->group))}}};
}

Outcome<Dictionary> FakeChannelReportingService::createSamples(
    const ChannelSubscription& subscription, const Dictionary& subscribedChannels) {
  const auto* known = dynamic_cast<const Subscription*>(&subscription);
  checkFakeUse(known != nullptr, "the subscription is this service's");
  const auto channelsOf = subscribedChannels.find("channels_of");
  checkFakeUse(channelsOf && channelsOf->string() == text(known->group),
               "the subscribed channels are those of the subscription");
  events_->add("channels.createSamples " + text(known->group));
  const std::lock_guard lock(mutex_);
  std::optional<Dictionary> samples;
  if (const auto counters = countersOf(known->group)) {
    samples = samplesOf(*counters);
  }
  return withFault(std::move(samples), lookUp(samplesFaults_, known->group));
}

Outcome<Dictionary> FakeChannelReportingService::createSamplesDelta(
    const std::optional<Dictionary>& earlier, const Dictionary& later) {
  events_->add("channels.createSamplesDelta");
  DictionaryBuilder delta;
  for (const auto& [name, value] : later) {
    const std::string_view channel = *name.string();
    const auto before = earlier ? earlier->find(channel) : std::nullopt;
    delta.set(channel,
              Value(*value.signedInteger() - (before ? *before->signedInteger() : 0)));
  }
  const std::lock_guard lock(mutex_);
  return withFault(std::optional(delta.build()), deltaFault_);
}

void FakeChannelReportingService::iterate(const Dictionary& samples,
                                          const ChannelCallback& callback) {
  events_->add("channels.iterate");
  for (const auto& [name, value] : samples) {
    if (callback(FakeChannel(*name.string(), *value.signedInteger())) != 0) return;
  }
}

void FakeChannelReportingService::setCounters(Name group, Name subgroup,
                                              Counters counters) {
  const std::lock_guard lock(mutex_);
  counters_.insert_or_assign({std::move(group), std::move(subgroup)},
                             std::move(counters));
}

void FakeChannelReportingService::setLookupFault(Name group, Name subgroup,
                                                 std::optional<Fault> fault) {
  const std::lock_guard lock(mutex_);
  replace(lookupFaults_, {std::move(group), std::move(subgroup)}, std::move(fault));
}

void FakeChannelReportingService::setSamplesFault(Name group, Name subgroup,
                                                  std::optional<Fault> fault) {
  const std::lock_guard lock(mutex_);
  replace(samplesFaults_, {std::move(group), std::move(subgroup)}, std::move(fault));
}

void FakeChannelReportingService::setDeltaFault(std::optional<Fault> fault) {
  const std::lock_guard lock(mutex_);
  deltaFault_ = std::move(fault);
}

}  // namespace ostrel
