#include <cstring>
#include <fstream>

#include "platform/fake/FakeChannelReportingService.h"
#include "platform/linux/ChannelFile.h"
#include "platform/linux/ChannelFileFormat.h"
#include "platform/linux/MappedChannelReporting.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using Counters = std::vector<std::pair<std::string, std::int64_t>>;
using testing::ElementsAre;
using testing::Pair;

struct ChannelsInMemory {
  void publish(const std::string& group, const std::string& subgroup,
               const Counters& counters) {
    service.setCounters(group, subgroup, counters);
  }
  FakeChannelReportingService service{std::make_shared<EventLog>()};
};

struct ChannelsInFiles {
  void publish(const std::string& group, const std::string& subgroup,
               const Counters& counters) {
    channels::Header header{};
    std::memcpy(header.magic, channels::kMagic, sizeof header.magic);
    header.version = channels::kVersion;
    header.capacity = static_cast<std::uint32_t>(counters.size());
    header.count = header.capacity;
    group.copy(header.group, sizeof header.group - 1);
    subgroup.copy(header.subgroup, sizeof header.subgroup - 1);
    std::string bytes(reinterpret_cast<const char*>(&header), sizeof header);
    for (const auto& [name, value] : counters) {
      channels::Record record{};
      name.copy(record.name, sizeof record.name - 1);
      record.value = value;
      bytes.append(reinterpret_cast<const char*>(&record), sizeof record);
    }
    directory.write(channels::fileName(group, subgroup), bytes);
  }

  testing_support::TemporaryDirectory directory;
  MappedChannelReporting service{{std::make_shared<ChannelFileFinder>(directory.path())}};
};

template <typename Subject>
class ChannelReportingContract : public testing::Test {
 protected:
  using Name = std::optional<std::string>;

  // How many channels a look-up finds; an absent collection has none.
  std::int32_t countIn(const Name& group, const Name& subgroup) {
    const auto found = subject_.service.copyChannelsInGroup(group, subgroup);
    EXPECT_FALSE(found.error);
    return found.value ? (*found.value)->channelCount() : 0;
  }

  ChannelReportingService::Subscribed subscribe(const Name& group, const Name& subgroup) {
    const auto found = subject_.service.copyChannelsInGroup(group, subgroup);
    if (!found.value) {
      ADD_FAILURE() << "nothing to subscribe to";
      return {};
    }
    return subject_.service.createSubscription(**found.value);
  }

  Dictionary sample(const ChannelReportingService::Subscribed& subscribed) {
    auto samples = subject_.service.createSamples(*subscribed.subscription,
                                                  subscribed.subscribedChannels);
    EXPECT_FALSE(samples.error);
    EXPECT_TRUE(samples.value);
    return samples.value.value_or(Dictionary());
  }

  Dictionary delta(const std::optional<Dictionary>& earlier, const Dictionary& later) {
    auto moved = subject_.service.createSamplesDelta(earlier, later);
    EXPECT_FALSE(moved.error);
    EXPECT_TRUE(moved.value);
    return moved.value.value_or(Dictionary());
  }

  std::map<std::string, std::int64_t> channelsOf(const Dictionary& samples) {
    std::map<std::string, std::int64_t> seen;
    subject_.service.iterate(samples, [&](const auto& channel) {
      const bool isNew =
          seen.emplace(channel.channelName(), channel.simpleIntegerValue()).second;
      EXPECT_TRUE(isNew) << "one call for each channel";
      return 0;
    });
    return seen;
  }

  Subject subject_;
};
using Subjects = testing::Types<ChannelsInMemory, ChannelsInFiles>;
TYPED_TEST_SUITE(ChannelReportingContract, Subjects);

TYPED_TEST(ChannelReportingContract, FindsNothingWhereNothingIsPublished) {
  EXPECT_EQ(this->countIn("Speaker", std::nullopt), 0);
  EXPECT_EQ(this->countIn(std::nullopt, "QDL"), 0);
}

TYPED_TEST(ChannelReportingContract, CountsTheChannelsOfAGroup) {
  this->subject_.publish("Speaker", "Left", {{"xruns", 1}, {"resets", 2}});
  this->subject_.publish("Haptics", "Stats", {{"plays", 3}});
  EXPECT_EQ(this->countIn("Speaker", "Left"), 2);
  EXPECT_EQ(this->countIn("Haptics", "Stats"), 1);
  EXPECT_EQ(this->countIn("Haptics", "Other"), 0);
}

TYPED_TEST(ChannelReportingContract, TakesNoNameForAnyName) {
  this->subject_.publish("Speaker", "Left", {{"a", 1}});
  this->subject_.publish("Speaker", "QDL", {{"b", 1}, {"c", 1}});
  this->subject_.publish("Haptics", "QDL", {{"d", 1}});
  EXPECT_EQ(this->countIn("Speaker", std::nullopt), 3);
  EXPECT_EQ(this->countIn(std::nullopt, "QDL"), 3);
  EXPECT_EQ(this->countIn(std::nullopt, std::nullopt), 4);
}

TYPED_TEST(ChannelReportingContract, SamplesEachChannelWithItsValue) {
  this->subject_.publish("Speaker", "Left", {{"xruns", 7}, {"level", -3}});
  const auto samples = this->sample(this->subscribe("Speaker", std::nullopt));
  EXPECT_THAT(this->channelsOf(samples),
              ElementsAre(Pair("level", -3), Pair("xruns", 7)));
}

TYPED_TEST(ChannelReportingContract, SeesValuesThatAreLaterThanTheSubscription) {
  this->subject_.publish("Speaker", "Left", {{"xruns", 7}});
  const auto subscribed = this->subscribe("Speaker", "Left");
  const auto before = this->sample(subscribed);
  this->subject_.publish("Speaker", "Left", {{"xruns", 12}});
  const auto after = this->sample(subscribed);
  EXPECT_THAT(this->channelsOf(before), ElementsAre(Pair("xruns", 7)));
  EXPECT_THAT(this->channelsOf(after), ElementsAre(Pair("xruns", 12)));
}

TYPED_TEST(ChannelReportingContract, TellsHowFarEachChannelMoved) {
  this->subject_.publish("Speaker", "Left", {{"up", 7}, {"down", 7}, {"same", 7}});
  const auto subscribed = this->subscribe("Speaker", "Left");
  const auto before = this->sample(subscribed);
  this->subject_.publish("Speaker", "Left", {{"up", 12}, {"down", 1}, {"same", 7}});
  const auto moved = this->channelsOf(this->delta(before, this->sample(subscribed)));
  EXPECT_EQ(moved.at("up"), 5);
  EXPECT_EQ(moved.at("down"), -6);
  EXPECT_EQ(moved.at("same"), 0);
}

TYPED_TEST(ChannelReportingContract, TakesAChannelWithoutEarlierSamplesAsAbsolute) {
  this->subject_.publish("Speaker", "Left", {{"old", 7}});
  const auto subscribed = this->subscribe("Speaker", "Left");
  const auto before = this->sample(subscribed);
  this->subject_.publish("Speaker", "Left", {{"old", 8}, {"new", 4}});
  const auto after = this->sample(subscribed);
  EXPECT_EQ(this->channelsOf(this->delta(before, after)).at("new"), 4);
  EXPECT_THAT(this->channelsOf(this->delta(std::nullopt, after)),
              ElementsAre(Pair("new", 4), Pair("old", 8)));
}

TYPED_TEST(ChannelReportingContract, StopsIteratingWhenToldTo) {
  this->subject_.publish("Speaker", "Left", {{"a", 1}, {"b", 2}, {"c", 3}});
  const auto samples = this->sample(this->subscribe("Speaker", "Left"));
  int calls = 0;
  this->subject_.service.iterate(samples, [&](const auto&) { return ++calls == 2; });
  EXPECT_EQ(calls, 2);
}

TYPED_TEST(ChannelReportingContract, IteratesEmptySamplesWithoutACall) {
  this->subject_.service.iterate(Dictionary(), [](const auto&) {
    ADD_FAILURE();
    return 0;
  });
}

}  // namespace
}  // namespace ostrel
