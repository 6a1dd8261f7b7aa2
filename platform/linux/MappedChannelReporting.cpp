#include "platform/linux/MappedChannelReporting.h"

#include <atomic>
#include <cerrno>
#include <map>
#include <string>
#include <string_view>
#include <unordered_map>

#include "platform/SpreadHash.h"
#include "platform/linux/AlsaChannels.h"
#include "platform/linux/ChannelFile.h"
#include "platform/linux/SmallFile.h"

namespace ostrel {
namespace {

using Sources = std::vector<std::shared_ptr<const ChannelSource>>;

class Collection final : public ChannelCollection {
 public:
  struct Entry {
    std::shared_ptr<const ChannelSource> source;
    std::size_t channels;
  };

  explicit Collection(std::vector<Entry> sources) : entries(std::move(sources)) {}

  std::int32_t channelCount() const override {
    std::size_t count = 0;
    for (const Entry& entry : entries) count += entry.channels;
    return static_cast<std::int32_t>(count);
  }

  const std::vector<Entry> entries;
};

// The calls to one driver that run beyond their time. Shared with them.
class HangingCalls {
 public:
  // One call: it may overrun, and it is done, in whatever order that is seen.
  class Call {
   public:
    explicit Call(std::shared_ptr<HangingCalls> calls) : calls_(std::move(calls)) {}
    void isDone() {
      if (state_.exchange(State::kDone) == State::kOverrun) --calls_->count_;
    }
    void hasOverrun() {
      ++calls_->count_;
      if (state_.exchange(State::kOverrun) == State::kDone) --calls_->count_;
    }

   private:
    enum class State { kRunning, kOverrun, kDone };
    const std::shared_ptr<HangingCalls> calls_;
    std::atomic<State> state_{State::kRunning};
  };

  bool any() const { return count_ > 0; }

 private:
  std::atomic<int> count_{0};
};

class Subscription final : public ChannelSubscription {
 public:
  explicit Subscription(Sources those) : sources(std::move(those)) {}

  const Sources sources;
  const std::shared_ptr<HangingCalls> hanging = std::make_shared<HangingCalls>();
};

class SampledChannel final : public ChannelReportingService::Channel {
 public:
  SampledChannel(std::string_view name, std::int64_t value)
      : name_(name), value_(value) {}
  std::string_view channelName() const override { return name_; }
  std::int64_t simpleIntegerValue() const override { return value_; }

 private:
  const std::string_view name_;
  const std::int64_t value_;
};

ErrorObject sourcesError(int error) { return errorOfPath(error, "driver channels"); }

Outcome<std::shared_ptr<ChannelCollection>> collect(
    const MappedChannelReporting::Finders& finders,
    const std::optional<std::string>& group, const std::optional<std::string>& subgroup) {
  std::vector<Collection::Entry> entries;
  std::optional<ErrorObject> error;
  const auto note = [&](std::optional<ErrorObject> found) {
    if (!error) error = std::move(found);
  };
  std::size_t channels = 0;
  for (const auto& finder : finders) {
    auto found = finder->find(group, subgroup);
    note(std::move(found.error));
    for (auto& source : found.sources) {
      auto values = source->read();
      note(std::move(values.error));
      if (!values.value) continue;
      channels += values.value->size();
      if (channels > MappedChannelReporting::kMostChannels) {
        note(errorOfPath(EFBIG, source->identifier()));
        break;
      }
      entries.push_back({std::move(source), values.value->size()});
    }
  }
  return {std::make_shared<Collection>(std::move(entries)), std::move(error)};
}

Outcome<Dictionary> sample(const Sources& sources, const Dictionary& subscribed) {
  DictionaryBuilder samples;
  std::size_t channels = 0;
  for (const auto& source : sources) {
    if (!subscribed.contains(source->identifier())) continue;
    auto values = source->read();
    if (!values.value) return {std::nullopt, std::move(values.error)};
    channels += values.value->size();
    if (channels > MappedChannelReporting::kMostChannels) {
      return {std::nullopt, errorOfPath(EFBIG, source->identifier())};
    }
    DictionaryBuilder builder;
    for (const ChannelValue& one : *values.value) builder.set(one.name, one.value);
    samples.set(source->identifier(), builder.build());
  }
  return {samples.build(), std::nullopt};
}

using Counters = std::unordered_map<std::string_view, std::int64_t, SpreadHash>;

// None when `samples` are not of this service.
std::optional<std::map<std::string_view, Counters>> countersOf(
    const Dictionary& samples) {
  std::map<std::string_view, Counters> sources;
  for (const auto& [identifier, channels] : samples) {
    if (!identifier.string() || !channels.dictionary()) return std::nullopt;
    Counters& counters = sources[*identifier.string()];
    for (const auto& [name, value] : channels.entries()) {
      if (!name.string() || !value.signedInteger()) return std::nullopt;
      counters.emplace(*name.string(), *value.signedInteger());
    }
  }
  return sources;
}

std::int64_t movement(std::int64_t from, std::int64_t to) {
  return static_cast<std::int64_t>(static_cast<std::uint64_t>(to) -
                                   static_cast<std::uint64_t>(from));
}

}  // namespace

std::shared_ptr<MappedChannelReporting> MappedChannelReporting::ofSystem() {
  return std::make_shared<MappedChannelReporting>(
      Finders{std::make_shared<ChannelFileFinder>(ChannelFileFinder::systemDirectory()),
              std::make_shared<AlsaChannelFinder>("/proc/asound")});
}

MappedChannelReporting::MappedChannelReporting(Finders finders, Waits waits)
    : finders_(std::move(finders)), waits_(waits) {}

// The operation's result, which its thread keeps alive should it overrun.
template <typename Result>
Outcome<Result> MappedChannelReporting::bounded(
    std::function<Outcome<Result>()> operation) {
  const auto outcome = std::make_shared<Outcome<Result>>();
  const auto wait = runner_.overrunning() == 0 ? waits_.most : waits_.behindAnother;
  switch (runner_.run(
      [outcome, operation = std::move(operation)] { *outcome = operation(); }, wait)) {
    case DeadlineRunner::Result::kDone:
      return std::move(*outcome);
    case DeadlineRunner::Result::kOverrun:
      return {std::nullopt, sourcesError(ETIMEDOUT)};
    default:
      return {std::nullopt, sourcesError(EBUSY)};
  }
}

Outcome<std::shared_ptr<ChannelCollection>> MappedChannelReporting::copyChannelsInGroup(
    const std::optional<std::string>& groupName,
    const std::optional<std::string>& subGroupName) {
  return bounded<std::shared_ptr<ChannelCollection>>(
      [finders = finders_, groupName, subGroupName] {
        return collect(finders, groupName, subGroupName);
      });
}

ChannelReportingService::Subscribed MappedChannelReporting::createSubscription(
    const ChannelCollection& channels) {
  const auto& collection = static_cast<const Collection&>(channels);
  Sources sources;
  DictionaryBuilder subscribed;
  for (const Collection::Entry& entry : collection.entries) {
    sources.push_back(entry.source);
    subscribed.set(entry.source->identifier(), entry.channels);
  }
  return {std::make_shared<Subscription>(std::move(sources)), subscribed.build()};
}

Outcome<Dictionary> MappedChannelReporting::createSamples(
    const ChannelSubscription& subscription, const Dictionary& subscribedChannels) {
  const auto& those = static_cast<const Subscription&>(subscription);
  if (those.hanging->any()) return {std::nullopt, sourcesError(EBUSY)};
  const auto call = std::make_shared<HangingCalls::Call>(those.hanging);
  auto samples = bounded<Dictionary>([sources = those.sources, call, subscribedChannels] {
    auto sampled = sample(sources, subscribedChannels);
    call->isDone();
    return sampled;
  });
  if (samples.error && samples.error->code == ETIMEDOUT) call->hasOverrun();
  return samples;
}

Outcome<Dictionary> MappedChannelReporting::createSamplesDelta(
    const std::optional<Dictionary>& earlier, const Dictionary& later) {
  const auto before = countersOf(earlier.value_or(Dictionary()));
  const auto now = countersOf(later);
  if (!before || !now) return {std::nullopt, errorOfPath(EINVAL, "channel samples")};
  DictionaryBuilder delta;
  for (const auto& [identifier, counters] : *now) {
    const auto source = before->find(identifier);
    DictionaryBuilder moved;
    for (const auto& [name, value] : counters) {
      std::int64_t from = 0;
      if (source != before->end()) {
        const auto counter = source->second.find(name);
        if (counter != source->second.end()) from = counter->second;
      }
      moved.set(name, movement(from, value));
    }
    delta.set(identifier, moved.build());
  }
  return {delta.build(), std::nullopt};
}

void MappedChannelReporting::iterate(const Dictionary& samples,
                                     const ChannelCallback& callback) {
  for (const auto& [identifier, channels] : samples) {
    const auto counters = channels.dictionary();
    if (!counters) continue;
    for (const auto& [name, value] : *counters) {
      if (!name.string() || !value.signedInteger()) continue;
      const SampledChannel channel(*name.string(), *value.signedInteger());
      if (callback(channel) != 0) return;
    }
  }
}

}  // namespace ostrel
