#include "platform/linux/MappedChannelReporting.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <fstream>
#include <future>
#include <map>
#include <thread>

#include "platform/linux/ChannelFile.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

/// Values that a test sets, and a gate that makes a reader hang.
class ScriptedSource final : public ChannelSource {
 public:
  ScriptedSource(std::string identifier, std::vector<ChannelValue> those)
      : values(std::move(those)), identifier_(std::move(identifier)) {}

  const std::string& identifier() const override { return identifier_; }
  Outcome<std::vector<ChannelValue>> read() const override {
    ++reads;
    if (gate.valid()) gate.wait();
    if (error != 0) return {std::nullopt, ErrorObject{"POSIX", error, "scripted"}};
    return {values, std::nullopt};
  }

  std::vector<ChannelValue> values;
  int error = 0;
  std::shared_future<void> gate;
  mutable std::atomic<int> reads = 0;

 private:
  const std::string identifier_;
};

/// Finds the sources of one group, by name.
class ScriptedFinder final : public ChannelFinder {
 public:
  Found find(const std::optional<std::string>& group,
             const std::optional<std::string>&) const override {
    Found found;
    found.error = error;
    if (const auto of = groups.find(group.value_or("")); of != groups.end()) {
      found.sources.assign(of->second.begin(), of->second.end());
    }
    return found;
  }

  std::map<std::string, std::vector<std::shared_ptr<ScriptedSource>>> groups;
  std::optional<ErrorObject> error;
};

class MappedChannelReportingSources : public testing::Test {
 protected:
  /// With time enough for a machine that is busy, unless told otherwise.
  explicit MappedChannelReportingSources(
      MappedChannelReporting::Waits waits = {std::chrono::minutes(1),
                                             std::chrono::minutes(1)})
      : service_({finder_}, waits) {}

  std::shared_ptr<ScriptedSource> add(const std::string& group,
                                      const std::string& identifier,
                                      std::vector<ChannelValue> values) {
    auto source = std::make_shared<ScriptedSource>(identifier, std::move(values));
    finder_->groups[group].push_back(source);
    return source;
  }

  ChannelReportingService::Subscribed subscribe(const std::string& group) {
    const auto found = service_.copyChannelsInGroup(group, std::nullopt);
    EXPECT_TRUE(found.value.has_value());
    return service_.createSubscription(**found.value);
  }
  Outcome<Dictionary> sample(const ChannelReportingService::Subscribed& subscribed) {
    return service_.createSamples(*subscribed.subscription,
                                  subscribed.subscribedChannels);
  }
  std::map<std::string, std::int64_t> valuesOf(const Dictionary& samples) {
    std::map<std::string, std::int64_t> values;
    service_.iterate(samples, [&](const ChannelReportingService::Channel& channel) {
      values[std::string(channel.channelName())] = channel.simpleIntegerValue();
      return 0;
    });
    return values;
  }
  std::map<std::string, std::int64_t> deltaOf(const std::optional<Dictionary>& earlier,
                                              const Dictionary& later) {
    return valuesOf(*service_.createSamplesDelta(earlier, later).value);
  }

  using Values = std::map<std::string, std::int64_t>;
  const std::shared_ptr<ScriptedFinder> finder_ = std::make_shared<ScriptedFinder>();
  MappedChannelReporting service_;
};

TEST_F(MappedChannelReportingSources, AreCountedByChannels) {
  add("A", "1", {{"x", 1}, {"y", 2}});
  add("A", "2", {{"z", 3}});
  EXPECT_EQ((*service_.copyChannelsInGroup("A", std::nullopt).value)->channelCount(), 3);
  EXPECT_EQ((*service_.copyChannelsInGroup("B", std::nullopt).value)->channelCount(), 0);
}

TEST_F(MappedChannelReportingSources, AreSampledAsTheyAreNow) {
  const auto source = add("A", "1", {{"x", 1}, {"y", INT64_MIN}});
  add("A", "2", {{"z", INT64_MAX}});
  const auto subscribed = subscribe("A");
  EXPECT_EQ(valuesOf(*sample(subscribed).value),
            (Values{{"x", 1}, {"y", INT64_MIN}, {"z", INT64_MAX}}));
  source->values = {{"x", 5}, {"new", 6}};
  EXPECT_EQ(valuesOf(*sample(subscribed).value),
            (Values{{"x", 5}, {"new", 6}, {"z", INT64_MAX}}));
}

TEST_F(MappedChannelReportingSources, MoveByTheDifference) {
  const auto source = add("A", "1", {{"up", 10}, {"down", 10}, {"same", 10}});
  const auto subscribed = subscribe("A");
  const auto earlier = *sample(subscribed).value;
  source->values = {{"up", 15}, {"down", 9}, {"same", 10}, {"new", 4}};
  EXPECT_EQ(deltaOf(earlier, *sample(subscribed).value),
            (Values{{"up", 5}, {"down", -1}, {"same", 0}, {"new", 4}}));
}

TEST_F(MappedChannelReportingSources, OfOneChannelNameAreToldApart) {
  const auto first = add("A", "1", {{"x", 10}});
  const auto second = add("A", "2", {{"x", 100}});
  const auto subscribed = subscribe("A");
  const auto earlier = *sample(subscribed).value;
  first->values = {{"x", 11}};
  second->values = {{"x", 102}};
  std::vector<std::int64_t> moved;
  const auto delta = service_.createSamplesDelta(earlier, *sample(subscribed).value);
  service_.iterate(*delta.value, [&](const ChannelReportingService::Channel& channel) {
    moved.push_back(channel.simpleIntegerValue());
    return 0;
  });
  EXPECT_EQ(moved, (std::vector<std::int64_t>{1, 2}));
}

TEST_F(MappedChannelReportingSources, ThatWrapAroundHaveMovedByWhatTheyCounted) {
  const auto source = add("A", "1", {{"x", INT64_MAX - 1}, {"y", INT64_MIN}});
  const auto subscribed = subscribe("A");
  const auto earlier = *sample(subscribed).value;
  source->values = {{"x", INT64_MIN + 1}, {"y", INT64_MAX}};
  EXPECT_EQ(deltaOf(earlier, *sample(subscribed).value), (Values{{"x", 3}, {"y", -1}}));
}

TEST_F(MappedChannelReportingSources, MoveFromZeroWithoutEarlierSamples) {
  add("A", "1", {{"x", 7}});
  EXPECT_EQ(deltaOf(std::nullopt, *sample(subscribe("A")).value), (Values{{"x", 7}}));
}

TEST_F(MappedChannelReportingSources, AreNotComparedWithWhatIsNoSample) {
  add("A", "1", {{"x", 7}});
  const auto later = *sample(subscribe("A")).value;
  const auto delta = service_.createSamplesDelta(Dictionary{{"1", Value("text")}}, later);
  EXPECT_FALSE(delta.value.has_value());
  EXPECT_EQ(delta.error->code, EINVAL);
}

TEST_F(MappedChannelReportingSources, EndAnIterationThatHasSeenEnough) {
  add("A", "1", {{"x", 1}, {"y", 2}, {"z", 3}});
  int calls = 0;
  service_.iterate(
      *sample(subscribe("A")).value,
      [&](const ChannelReportingService::Channel&) { return ++calls == 2 ? 1 : 0; });
  EXPECT_EQ(calls, 2);
}

TEST_F(MappedChannelReportingSources, ThatFailGiveTheirError) {
  const auto source = add("A", "1", {{"x", 1}});
  const auto subscribed = subscribe("A");
  source->error = EBADMSG;
  const auto samples = sample(subscribed);
  EXPECT_FALSE(samples.value.has_value());
  EXPECT_EQ(samples.error->code, EBADMSG);
  source->error = 0;
  EXPECT_TRUE(sample(subscribed).value.has_value());
}

TEST_F(MappedChannelReportingSources, ThatFailAtTheLookUpAreLeftOutWithAnError) {
  add("A", "1", {{"x", 1}})->error = EBADMSG;
  add("A", "2", {{"y", 1}});
  const auto found = service_.copyChannelsInGroup("A", std::nullopt);
  EXPECT_EQ((*found.value)->channelCount(), 1);
  EXPECT_EQ(found.error->code, EBADMSG);
}

TEST_F(MappedChannelReportingSources, HaveTheMostChannelsInAll) {
  constexpr auto kMost = MappedChannelReporting::kMostChannels;
  const auto source = add("A", "1", std::vector<ChannelValue>(kMost - 1, {"x", 1}));
  add("A", "2", {{"y", 1}});
  const auto subscribed = subscribe("A");
  EXPECT_TRUE(sample(subscribed).value.has_value());
  source->values.push_back({"x", 1});
  EXPECT_EQ(sample(subscribed).error->code, EFBIG);
  const auto found = service_.copyChannelsInGroup("A", std::nullopt);
  EXPECT_EQ(found.error->code, EFBIG);
  EXPECT_EQ((*found.value)->channelCount(), static_cast<std::int32_t>(kMost));
}

/// Four drivers, one source each, whose readers can be made to hang.
class MappedChannelReportingHanging : public MappedChannelReportingSources {
 protected:
  static constexpr milliseconds kWait{500};
  static constexpr milliseconds kWaitBehindAnother{100};

  MappedChannelReportingHanging()
      : MappedChannelReportingSources({kWait, kWaitBehindAnother}) {}
  void SetUp() override {
    for (const char* group : {"A", "B", "C", "D"}) {
      sources_.push_back(add(group, group, {{group, 1}}));
      subscribed_.push_back(subscribe(group));
    }
  }
  void TearDown() override { release(); }

  void hang(std::size_t index) { sources_[index]->gate = gate_; }
  void release() {
    if (!isReleased_) answer_.set_value();
    isReleased_ = true;
  }

  /// Samples every driver in a row, as a session's start does.
  milliseconds sampleAll(std::vector<std::int64_t>& errors) {
    const auto begin = steady_clock::now();
    for (const auto& subscribed : subscribed_) {
      const auto samples = sample(subscribed);
      errors.push_back(samples.error ? samples.error->code : 0);
    }
    return std::chrono::duration_cast<milliseconds>(steady_clock::now() - begin);
  }

  std::vector<std::shared_ptr<ScriptedSource>> sources_;
  std::vector<ChannelReportingService::Subscribed> subscribed_;
  std::promise<void> answer_;
  const std::shared_future<void> gate_ = answer_.get_future().share();
  bool isReleased_ = false;
};

TEST(MappedChannelReportingWaits, HoldACallerOfFourDriversForAQuarterSecondAtMost) {
  const MappedChannelReporting::Waits waits;
  EXPECT_LT(waits.most + 3 * waits.behindAnother, milliseconds(250));
}

TEST_F(MappedChannelReportingHanging, GivesAnErrorAndHoldsTheCallerBrieflyOnce) {
  hang(1);
  std::vector<std::int64_t> errors;
  EXPECT_LT(sampleAll(errors), 2 * kWait);
  EXPECT_EQ(errors, (std::vector<std::int64_t>{0, ETIMEDOUT, 0, 0}));
  errors.clear();
  EXPECT_LT(sampleAll(errors), kWait);  // Not another deadline.
  EXPECT_EQ(errors, (std::vector<std::int64_t>{0, EBUSY, 0, 0}));
  EXPECT_EQ(sources_[1]->reads, 2);  // The look-up's and the one that hangs.
}

TEST_F(MappedChannelReportingHanging, OfAllDriversHoldsTheCallerBrieflyToo) {
  for (std::size_t i = 0; i < sources_.size(); ++i) hang(i);
  std::vector<std::int64_t> errors;
  EXPECT_LT(sampleAll(errors), 2 * kWait);
  for (const std::int64_t error : errors) {
    EXPECT_TRUE(error == ETIMEDOUT || error == EBUSY) << error;
  }
  errors.clear();
  EXPECT_LT(sampleAll(errors), kWait);  // Not another deadline.
  EXPECT_EQ(std::count(errors.begin(), errors.end(), 0), 0);
}

TEST_F(MappedChannelReportingHanging, EndsWhenTheSourceAnswers) {
  hang(0);
  std::vector<std::int64_t> errors;
  sampleAll(errors);
  release();
  const auto end = steady_clock::now() + std::chrono::minutes(1);
  while (sample(subscribed_[0]).error && steady_clock::now() < end) {
    std::this_thread::yield();
  }
  EXPECT_EQ(valuesOf(*sample(subscribed_[0]).value), (Values{{"A", 1}}));
}

TEST_F(MappedChannelReportingHanging, DoesNotOutliveTheServiceInItsWay) {
  auto service =
      std::make_unique<MappedChannelReporting>(MappedChannelReporting::Finders{finder_});
  hang(0);
  EXPECT_EQ(service->copyChannelsInGroup("A", std::nullopt).error->code, ETIMEDOUT);
  service.reset();
}

TEST_F(MappedChannelReportingSources, AreSampledByManyThreadsAtOnce) {
  add("A", "1", {{"x", 1}});
  const auto subscribed = subscribe("A");
  std::atomic<int> samples = 0;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 500; ++i) {
        if (sample(subscribed).value) ++samples;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(samples, 4 * 500);
}

}  // namespace
}  // namespace ostrel
