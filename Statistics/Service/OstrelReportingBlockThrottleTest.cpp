#include "Statistics/Service/OstrelReportingBlockThrottle.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <stdexcept>

#include "Statistics/CoreTestFixture.h"
#include "platform/fake/ManualRunLoop.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;
using Runs = std::vector<std::pair<std::string, milliseconds>>;

const ReporterID kReporter{7};
const MessageCategory kCategory{0x40000007};
const MessageType kType{0};

class OstrelReportingBlockThrottleTest : public CoreTest {
 protected:
  OstrelReportingBlockThrottleTest() : begin_(fakes.clock->monotonicNow()) {}
  ~OstrelReportingBlockThrottleTest() override { runLoops->endThreads(); }

  void add(const std::string& name, const Dictionary& payload) {
    throttle->addMessageBlock([this, name] { runs.emplace_back(name, sinceBegin()); },
                              kReporter, payload, kCategory, kType);
  }
  void add(const std::string& name, const std::string& key, double seconds) {
    add(name, {{"key", key}, {"_throttle_seconds", seconds}});
  }

  void advance(milliseconds duration) { fakes.clock->advance(duration); }

  milliseconds sinceBegin() const {
    return std::chrono::duration_cast<milliseconds>(fakes.clock->monotonicNow() - begin_);
  }

  std::vector<std::string> runNames() const {
    std::vector<std::string> names;
    for (const auto& [name, time] : runs) names.push_back(name);
    return names;
  }

  const std::shared_ptr<ManualRunLoopFactory> runLoops =
      std::make_shared<ManualRunLoopFactory>(fakes.clock);
  const std::shared_ptr<OstrelReportingBlockThrottle> throttle =
      OstrelReportingBlockThrottle::init(runLoops);
  Runs runs;

 private:
  const std::chrono::nanoseconds begin_;
};

std::string keyOf(const Dictionary& payload) {
  return OstrelReportingBlockThrottle::buildMessageKey(payload, kReporter, kCategory,
                                                       kType);
}

constexpr const char* kKeyEnd = "reporterID|7|Routing_RouteChange|Generic";

// The comparison key.

TEST(OstrelReportingBlockThrottleKey, JoinsSortedPayloadReporterCategoryAndType) {
  EXPECT_EQ(keyOf({{"b", 2}, {"a", 1}, {"_throttle_seconds", 1}}),
            "_throttle_seconds|^|a|1|b|2|reporterID|7|Routing_RouteChange|Generic");
  EXPECT_EQ(keyOf(Dictionary()), kKeyEnd);
}

TEST(OstrelReportingBlockThrottleKey, MasksTheValuesOfExcludedKeys) {
  EXPECT_EQ(keyOf({{"systemuptime_sec", 1},
                   {"processuptime_ms", 2},
                   {"ostrelreporting_timestamp", 3},
                   {"_comparison_field_blacklist", 4},
                   {"_throttle_seconds", 5}}),
            std::string("_comparison_field_blacklist|^|_throttle_seconds|^|"
                        "ostrelreporting_timestamp|^|processuptime_ms|^|"
                        "systemuptime_sec|^|") +
                kKeyEnd);
}

TEST(OstrelReportingBlockThrottleKey, DiffersWhenAnExcludedKeyIsMissing) {
  EXPECT_EQ(keyOf({{"a", 1}, {"systemuptime_sec", 10}}),
            keyOf({{"a", 1}, {"systemuptime_sec", 20}}));
  EXPECT_NE(keyOf({{"a", 1}, {"systemuptime_sec", 10}}), keyOf({{"a", 1}}));
}

TEST(OstrelReportingBlockThrottleKey, DiffersInAnyOtherValue) {
  EXPECT_NE(keyOf({{"a", 1}}), keyOf({{"a", 2}}));
  EXPECT_NE(keyOf({{"a", 1}}), keyOf({{"b", 1}}));
}

TEST(OstrelReportingBlockThrottleKey, LeavesOutTheFieldsThatAPayloadLists) {
  const Value blacklist = ArrayBuilder().append("Count").append(3).build();

  EXPECT_EQ(keyOf({{"_comparison_field_blacklist", blacklist}, {"Count", 1}, {"x", 2}}),
            std::string("Count|^|_comparison_field_blacklist|^|x|2|") + kKeyEnd);
}

TEST(OstrelReportingBlockThrottleKey, LeavesOutIntegerKeysThatAPayloadLists) {
  DictionaryBuilder payload;
  payload.set("_comparison_field_blacklist",
              ArrayBuilder().append(3).append(1.5).append(Dictionary()).build());
  payload.set(Value(3), Value("three"));
  payload.set(Value(4), Value("four"));
  payload.set("3", "text");

  EXPECT_EQ(keyOf(payload.build()),
            std::string("3|^|4|four|3|text|_comparison_field_blacklist|^|") + kKeyEnd);
}

TEST(OstrelReportingBlockThrottleKey, IgnoresAListOfFieldsThatIsNoArray) {
  EXPECT_EQ(keyOf({{"_comparison_field_blacklist", "Count"}, {"Count", 1}}),
            std::string("Count|1|_comparison_field_blacklist|^|") + kKeyEnd);
}

TEST(OstrelReportingBlockThrottleKey, LeavesOutVolumeAndItsTimeTogether) {
  EXPECT_EQ(keyOf({{"Volume", 0.5}, {"VolumeOperationTime", 12}}),
            std::string("Volume|^|VolumeOperationTime|^|") + kKeyEnd);
  EXPECT_EQ(keyOf({{"Volume", 1}}), std::string("Volume|1|") + kKeyEnd);
  EXPECT_EQ(keyOf({{"VolumeOperationTime", 1}}),
            std::string("VolumeOperationTime|1|") + kKeyEnd);
}

TEST(OstrelReportingBlockThrottleKey, DiffersByReporterCategoryAndType) {
  const auto key = [](std::int64_t reporter, std::uint32_t category, std::uint16_t type) {
    return OstrelReportingBlockThrottle::buildMessageKey(
        {{"a", 1}}, ReporterID{reporter}, MessageCategory{category}, MessageType{type});
  };

  EXPECT_NE(key(7, 1, 0), key(8, 1, 0));
  EXPECT_NE(key(7, 1, 0), key(7, 2, 0));
  EXPECT_NE(key(7, 1, 0), key(7, 1, 1));
  EXPECT_EQ(key(INT64_MIN, 1, 0), "a|1|reporterID|-9223372036854775808|Generic|Generic");
}

TEST(OstrelReportingBlockThrottleKey, PutsIntegerKeysFirstByTheirValue) {
  DictionaryBuilder payload;
  payload.set("a", 1);
  payload.set(Value(10), Value("ten"));
  payload.set(Value(9), Value("nine"));
  payload.set(Value(-1), Value("minus"));
  payload.set(Value(-2), Value("less"));

  EXPECT_EQ(keyOf(payload.build()),
            std::string("-2|less|-1|minus|9|nine|10|ten|a|1|") + kKeyEnd);
}

TEST(OstrelReportingBlockThrottleKey, DescribesNestedValues) {
  EXPECT_EQ(keyOf({{"d", Dictionary{{"x", 1}}}}), std::string("d|{x: 1}|") + kKeyEnd);
}

// The delay.

class OstrelReportingBlockThrottleDelay : public OstrelReportingBlockThrottleTest {
 protected:
  static double secondsOf(const Value& time) {
    return OstrelReportingBlockThrottle::determineSleepTime({{"_throttle_seconds", time}})
        .count();
  }
};

TEST_F(OstrelReportingBlockThrottleDelay, IsHalfASecondUnlessToldOtherwise) {
  EXPECT_EQ(OstrelReportingBlockThrottle::determineSleepTime(Dictionary()).count(), 0.5);
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingBlockThrottleDelay, IsWhatThePayloadSaysInSinglePrecision) {
  EXPECT_EQ(secondsOf(2), 2.0);
  EXPECT_EQ(secondsOf(4), 4.0);
  EXPECT_EQ(secondsOf(4.9), static_cast<double>(4.9F));
  EXPECT_EQ(secondsOf(0.1), static_cast<double>(0.1F));
  EXPECT_EQ(secondsOf(true), 1.0);
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingBlockThrottleDelay, AcceptsWhatIsDueAtOnce) {
  EXPECT_EQ(secondsOf(0), 0.0);
  EXPECT_EQ(secondsOf(-3), -3.0);
  EXPECT_EQ(secondsOf(-std::numeric_limits<double>::max()),
            -std::numeric_limits<double>::max());
  EXPECT_EQ(secondsOf(-std::numeric_limits<double>::infinity()),
            -std::numeric_limits<double>::infinity());
  EXPECT_TRUE(std::isnan(secondsOf(std::nan(""))));
  EXPECT_EQ(takeLines(), LogLines{});
}

TEST_F(OstrelReportingBlockThrottleDelay, RejectsFiveSecondsAndMore) {
  EXPECT_EQ(secondsOf(5), 0.5);
  EXPECT_EQ(secondsOf(10), 0.5);
  EXPECT_EQ(secondsOf(5.0), 0.5);
  EXPECT_EQ(secondsOf(UINT64_MAX), 0.5);
  EXPECT_EQ(secondsOf(std::numeric_limits<double>::infinity()), 0.5);

  const LogLines lines = takeLines();
  ASSERT_EQ(lines.size(), 5u);
  EXPECT_EQ(lines[0],
            infoLine("osrr", "Rejecting large throttle time. {time=5, max=5.000000}"));
  EXPECT_EQ(lines[1],
            infoLine("osrr", "Rejecting large throttle time. {time=10, max=5.000000}"));
}

TEST_F(OstrelReportingBlockThrottleDelay, RejectsWhatIsNotANumber) {
  EXPECT_EQ(secondsOf("2"), 0.5);
  EXPECT_EQ(secondsOf(Date{1}), 0.5);
  EXPECT_EQ(secondsOf(Array()), 0.5);

  const LogLines lines = takeLines();
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[0],
            infoLine("osrr", "Rejecting non Numbrel value of throttle time. {time=2}"));
}

// Delivery.

TEST_F(OstrelReportingBlockThrottleTest, RunsABlockOnceAfterItsDelay) {
  add("a", "a", 2);

  advance(milliseconds(1999));
  EXPECT_EQ(runs, Runs{});
  advance(milliseconds(1));
  EXPECT_EQ(runs, (Runs{{"a", milliseconds(2000)}}));
  advance(milliseconds(10000));
  EXPECT_EQ(runs.size(), 1u);
}

TEST_F(OstrelReportingBlockThrottleTest, DelaysByHalfASecondWithoutAThrottleTime) {
  add("a", Dictionary{{"x", 1}});
  add("b", Dictionary{{"_throttle_seconds", "2"}});
  add("c", Dictionary{{"_throttle_seconds", 10}, {"y", 1}});

  advance(milliseconds(5000));

  EXPECT_EQ(runs, (Runs{{"a", milliseconds(500)},
                        {"b", milliseconds(500)},
                        {"c", milliseconds(500)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, RunsWhatIsDueAtOnceInTheWorkersNextPass) {
  add("zero", "zero", 0);
  add("negative", "negative", -1);
  add("nan", "nan", std::nan(""));
  add("below all", "below all", -std::numeric_limits<double>::infinity());
  EXPECT_EQ(runs, Runs{});

  advance(milliseconds(0));

  EXPECT_EQ(runNames(),
            (std::vector<std::string>{"zero", "negative", "nan", "below all"}));
}

TEST_F(OstrelReportingBlockThrottleTest, RunsTheBlocksOfOneBatchInTheOrderOfTheirDates) {
  add("late", "late", 3);
  add("early", "early", 1);
  add("middle", "middle", 2);

  advance(milliseconds(3000));

  EXPECT_EQ(runs, (Runs{{"early", milliseconds(1000)},
                        {"middle", milliseconds(2000)},
                        {"late", milliseconds(3000)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, RunsOnlyTheNewestOfEqualMessages) {
  add("first", "same", 0.5);
  add("second", "same", 0.5);
  add("third", "same", 0.5);

  advance(milliseconds(5000));

  EXPECT_EQ(runs, (Runs{{"third", milliseconds(500)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, StartsTheWaitOverWithEachEqualMessage) {
  add("first", "same", 0.5);
  advance(milliseconds(400));
  add("second", "same", 2);

  advance(milliseconds(1999));
  EXPECT_EQ(runs, Runs{});
  advance(milliseconds(1));

  EXPECT_EQ(runs, (Runs{{"second", milliseconds(2400)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, ShortensTheWaitToo) {
  add("first", "same", 4);
  advance(milliseconds(1000));
  add("second", "same", 0.5);

  advance(milliseconds(500));

  EXPECT_EQ(runs, (Runs{{"second", milliseconds(1500)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, FoldsWhatTheWorkerHasNotAttachedYet) {
  add("long", "long", 4);
  advance(milliseconds(0));
  add("first", "same", 0.5);
  add("second", "same", 0.5);

  advance(milliseconds(5000));

  EXPECT_EQ(runNames(), (std::vector<std::string>{"long", "second"}));
}

TEST_F(OstrelReportingBlockThrottleTest, StartsAnewOnceAMessageWasDelivered) {
  add("first", "same", 0.5);
  advance(milliseconds(1000));
  add("second", "same", 0.5);
  advance(milliseconds(1000));

  EXPECT_EQ(runs, (Runs{{"first", milliseconds(500)}, {"second", milliseconds(1500)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, KeepsThrottleBatching) {
  add("long", "long", 2);
  advance(milliseconds(500));
  add("short", "short", 0.5);  // Due at 1.0 s.

  advance(milliseconds(1500));
  EXPECT_EQ(runs, (Runs{{"long", milliseconds(2000)}}));

  // The worker sleeps 0.1 s, then finds it overdue.
  advance(milliseconds(100));
  EXPECT_EQ(runs, (Runs{{"long", milliseconds(2000)}, {"short", milliseconds(2100)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, HoldsABatchBackAsLongAsItFoldsItselfOn) {
  add("a", "a", 1);
  advance(milliseconds(0));
  add("b", "b", 0);
  for (int i = 0; i < 5; ++i) {
    advance(milliseconds(900));
    add("a" + std::to_string(i), "a", 1);
  }

  advance(milliseconds(1100));

  EXPECT_EQ(runs, (Runs{{"a4", milliseconds(5500)}, {"b", milliseconds(5600)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, CountsTheDelayFromTheAdd) {
  advance(milliseconds(50));  // The worker sleeps until 100 ms.
  add("a", "a", 0.2);

  advance(milliseconds(1000));

  EXPECT_EQ(runs, (Runs{{"a", milliseconds(250)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, SurvivesABlockThatThrows) {
  const Dictionary payload{{"a", 1}};
  throttle->addMessageBlock([] { throw std::runtime_error("trouble"); }, kReporter,
                            payload, kCategory, kType);
  throttle->addMessageBlock(/*block=*/nullptr, ReporterID{8}, payload, kCategory, kType);
  advance(milliseconds(1000));

  add("after", payload);
  advance(milliseconds(1000));

  EXPECT_EQ(runNames(), std::vector<std::string>{"after"});
}

TEST_F(OstrelReportingBlockThrottleTest, DeliversWhatABlockAddsUnderAnotherKey) {
  throttle->addMessageBlock([this] { add("inner", "inner", 0); }, kReporter,
                            {{"key", "outer"}}, kCategory, kType);

  advance(milliseconds(1000));

  EXPECT_EQ(runs, (Runs{{"inner", milliseconds(600)}}));
}

TEST_F(OstrelReportingBlockThrottleTest, KeepsDroppingWhatIsFoldedWhileItsBlockRuns) {
  const Dictionary payload{{"key", "same"}};
  throttle->addMessageBlock([this, payload] { add("inner", payload); }, kReporter,
                            payload, kCategory, kType);

  advance(milliseconds(5000));

  EXPECT_EQ(runs, Runs{});
  throttle->waitForCompletion();  // Nothing waits.
  EXPECT_EQ(sinceBegin(), milliseconds(5000));
}

TEST_F(OstrelReportingBlockThrottleTest, EndsTheWorkerAfterItsPassWhenToldTo) {
  advance(milliseconds(0));
  throttle->setShouldKeepRunning(false);
  advance(milliseconds(100));
  add("a", "a", 0);

  advance(milliseconds(1000));

  EXPECT_EQ(runs, Runs{});
}

TEST_F(OstrelReportingBlockThrottleTest, SaysWhatItDoesAtDebugLevel) {
  makeVerbose("reporting_rtc_verbose");
  add("a", "a", 0.5);
  add("b", "a", 0.5);

  advance(milliseconds(550));

  EXPECT_EQ(
      takeLines(),
      (LogLines{debugLine("osrr",
                          "Dropping duplicate message for _throttle_seconds|^|key|a|"
                          "reporterID|7|Routing_RouteChange|Generic"),
                debugLine("osrr", "calling workingRunLoop run from inside thread block"),
                debugLine("osrr", "sleeping in thread")}));
}

TEST_F(OstrelReportingBlockThrottleTest, SaysNothingOfDebugLevelUnlessAsked) {
  add("a", "a", 0.5);
  add("b", "a", 0.5);

  advance(milliseconds(550));

  EXPECT_EQ(takeLines(), LogLines{});
}

// Waiting for completion.

class OstrelReportingBlockThrottleWait : public OstrelReportingBlockThrottleTest {
 protected:
  OstrelReportingBlockThrottleWait() { makeVerbose("reporting_rtc_verbose"); }

  // The wait's own lines.
  LogLines takeWaitLines() {
    LogLines lines = takeLines();
    std::erase_if(lines, [](const auto& line) {
      return line.text == "sleeping in thread" ||
             line.text == "calling workingRunLoop run from inside thread block";
    });
    return lines;
  }
};

TEST_F(OstrelReportingBlockThrottleWait, ReturnsAtOnceWhenNothingWaits) {
  throttle->waitForCompletion();

  EXPECT_EQ(sinceBegin(), milliseconds(0));
  EXPECT_EQ(takeWaitLines(),
            LogLines{infoLine(
                "osrr", "waitForCompletion. timersInFlight=0 unscheduledTimerKeys=0")});
}

TEST_F(OstrelReportingBlockThrottleWait, AsksEveryHalfSecondUntilNothingWaits) {
  add("a", "a", 1.2);
  add("b", "b", 0.1);

  throttle->waitForCompletion();

  EXPECT_EQ(sinceBegin(), milliseconds(1500));
  EXPECT_EQ(runNames(), (std::vector<std::string>{"b", "a"}));
  EXPECT_EQ(
      takeWaitLines(),
      (LogLines{
          infoLine("osrr", "waitForCompletion. timersInFlight=2 unscheduledTimerKeys=2"),
          debugLine("osrr",
                    "Waiting up to 5 seconds for blockThrottle queue to be empty.")}));
}

TEST_F(OstrelReportingBlockThrottleWait, CountsAttachedTimersAsScheduled) {
  add("a", "a", 1.2);
  advance(milliseconds(0));

  throttle->waitForCompletion();

  EXPECT_EQ(
      fakes.log->count("waitForCompletion. timersInFlight=1 unscheduledTimerKeys=0"), 1u);
}

TEST_F(OstrelReportingBlockThrottleWait, GivesUpAfterFiveSecondsAndLeavesTheEntries) {
  throttle->setShouldKeepRunning(false);  // No timer ever fires.
  add("a", "a", 1);

  throttle->waitForCompletion();

  EXPECT_EQ(sinceBegin(), milliseconds(5000));
  EXPECT_EQ(
      takeWaitLines(),
      (LogLines{
          infoLine("osrr", "waitForCompletion. timersInFlight=1 unscheduledTimerKeys=1"),
          debugLine("osrr",
                    "Waiting up to 5 seconds for blockThrottle queue to be empty."),
          defaultLine("osrr",
                      "Giving up on waiting for completion after 5 seconds. "
                      "timersInFlight=1")}));
}

TEST_F(OstrelReportingBlockThrottleWait, EntriesLeftAfterGivingUpFireLater) {
  add("first", "same", 4);
  fakes.clock->scheduleAt(fakes.clock->monotonicNow() + std::chrono::seconds(3),
                          [this] { add("second", "same", 4); });

  throttle->waitForCompletion();
  EXPECT_TRUE(fakes.log->contains(LogLevel::kDefault, "osrr",
                                  "Giving up on waiting for completion after 5 seconds. "
                                  "timersInFlight=1"));
  EXPECT_EQ(runs, Runs{});
  advance(milliseconds(2000));

  EXPECT_EQ(runs, (Runs{{"second", milliseconds(7000)}}));
}

// The wrapper.

TEST(OstrelReportingBlockThrottleTimerWrapper, BearsAWaitWithoutATimer) {
  OstrelReportingBlockThrottleTimerWrapper wrapper([] {});

  wrapper.sleepFor(ThrottleTime(1));

  EXPECT_EQ(wrapper.timer(), nullptr);
}

}  // namespace
}  // namespace ostrel
