// The wall clock jumps while timers wait: waits stay on steady time, and what is told of
// the wall clock stays sane.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingBlockThrottle.h"
#include "Statistics/Service/OstrelReportingServiceDelegate.h"
#include "platform/fake/FakePlatform.h"
#include "platform/fake/ManualRunLoop.h"
#include "platform/linux/SystemClock.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "platform/linux/ThreadRunLoop.h"
#include "platform/linux/TimedConditionFactory.h"
#include "platform/linux/TimerThread.h"

namespace {

long long wallClockOffset = 0;  // In seconds; accessed atomically.

}  // namespace

// Stands before the C library's in this program: the wall clock can be set, and whoever
// reads it sees that.
extern "C" int clock_gettime(clockid_t clock, timespec* time) noexcept {
  const long result = syscall(SYS_clock_gettime, clock, time);
  if (clock == CLOCK_REALTIME) {
    time->tv_sec += __atomic_load_n(&wallClockOffset, __ATOMIC_RELAXED);
  }
  return static_cast<int>(result);
}

namespace ostrel {
namespace {

using std::chrono::duration;
using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr double kHour = 3600;
constexpr double kDay = 24 * kHour;
constexpr double kLastOfSystemClock = 9.0e9;  // In the year 2255.

struct Jump {
  const char* name;
  double shift;                    // Added to the wall clock,
  std::optional<double> absolute;  // or what it is set to.
  const char* zone = nullptr;
};

void PrintTo(const Jump& jump, std::ostream* out) { *out << jump.name; }

const Jump kJumps[] = {
    {"BackOneHour", -kHour, std::nullopt},
    {"ForwardTenYears", 3652 * kDay, std::nullopt},
    {"To1970", 0, 0.5},
    {"To2038", 0, 2147483648.0},
    {"OntoALeapSecond", 0, 1483228799.999},
    {"ToZero", 0, 0.0},
    {"BelowZero", 0, -kDay * 365},
    {"FarIntoTheFuture", 0, 4.0e12},
    {"ForwardAsAfterASuspension", 8 * kHour, std::nullopt},
    {"IntoAnotherZone", 0, std::nullopt, "<TST>-13:45"},
};

TEST(ClockJumpOfTheSystem, LeavesEveryWaitOnSteadyTime) {
  constexpr milliseconds kWait{400};
  struct Fired {
    std::atomic<int> count{0};
    std::atomic<nanoseconds::rep> soonest{nanoseconds::max().count()};
    const steady_clock::time_point begin = steady_clock::now();

    void note() {
      const nanoseconds::rep passed = nanoseconds(steady_clock::now() - begin).count();
      if (passed < soonest) soonest = passed;
      ++count;
    }
  };
  const auto fired = std::make_shared<Fired>();  // The throttle's thread may keep it.
  const auto timers = std::make_shared<TimerThread>();
  ThreadPoolWorkQueues queues(timers);
  TimedConditionFactory conditions(timers);
  const SystemClock clock;

  timers->scheduleAfter(kWait, [fired] { fired->note(); });
  queues.backgroundQueue().asyncAfter(kWait, [fired] { fired->note(); });
  const auto condition = conditions.makeCondition();
  condition->lock();
  condition->wait(kWait, [fired](Condition::Wake wake) {
    if (wake == Condition::Wake::kTimedOut) fired->note();
  });
  condition->unlock();
  const auto throttle =
      OstrelReportingBlockThrottle::init(std::make_shared<ThreadRunLoopFactory>());
  throttle->addMessageBlock([fired] { fired->note(); }, ReporterID{1},
                            {{"_throttle_seconds", duration<double>(kWait).count()}},
                            MessageCategory{1}, MessageType{1});
  constexpr int kTimers = 4;

  const double before = clock.now().secondsSince1970;
  for (const Jump& jump : kJumps) {
    // As far as the library's own count of nanoseconds goes.
    const double target =
        std::min(jump.absolute.value_or(before + jump.shift), kLastOfSystemClock);
    __atomic_store_n(&wallClockOffset, static_cast<long long>(target - before),
                     __ATOMIC_RELAXED);
    // The offset is a whole number of seconds, and time goes on.
    EXPECT_NEAR(clock.now().secondsSince1970, target, 120) << jump.name;
    std::this_thread::sleep_for(milliseconds(20));
  }
  // Left an hour behind: who waits for the wall clock waits an hour.
  __atomic_store_n(&wallClockOffset, -3600LL, __ATOMIC_RELAXED);
  const auto deadline = steady_clock::now() + seconds(60);
  while (fired->count < kTimers && steady_clock::now() < deadline) {
    std::this_thread::sleep_for(milliseconds(5));
  }
  __atomic_store_n(&wallClockOffset, 0LL, __ATOMIC_RELAXED);
  throttle->setShouldKeepRunning(false);

  EXPECT_EQ(fired->count, kTimers);
  EXPECT_GE(fired->soonest, nanoseconds(kWait).count());
}

/// Manual time, and the file names of the real clock.
class NamingClock final : public Clock {
 public:
  explicit NamingClock(std::shared_ptr<ManualClock> manual)
      : manual_(std::move(manual)) {}

  Date now() const override { return manual_->now(); }
  nanoseconds monotonicNow() const override { return manual_->monotonicNow(); }
  std::string fileNameDate(Date date) const override {
    return SystemClock().fileNameDate(date);
  }

 private:
  const std::shared_ptr<ManualClock> manual_;
};

class ClockJump : public testing::TestWithParam<Jump> {
 protected:
  ClockJump() {
    forgetIsInternalBuildForTesting();
    fakes.deviceInfo->setAnswer("InternalBuild", true);
    fakes.processInfo->setCommandName(/*pid=*/7, "client");
    platform = fakes.platform();
    platform.clock = std::make_shared<NamingClock>(fakes.clock);
    root = OstrelReportingServiceDelegate::init(platform);
    fakes.listener->setDelegate(root.get());
    if (const char* zone = getenv("TZ")) zone_ = zone;
  }
  ~ClockJump() override {
    if (zone_) {
      setenv("TZ", zone_->c_str(), /*overwrite=*/1);
    } else {
      unsetenv("TZ");
    }
    tzset();
    fakes.telemetryBackend->releaseCallbacks();
    fakes.orientationService->releaseCallbacks();
    fakes.runUntilIdle();
    forgetIsInternalBuildForTesting();
  }

  void jump() {
    const Jump& to = GetParam();
    const double now = fakes.clock->now().secondsSince1970;
    fakes.clock->setWallClock({to.absolute.value_or(now + to.shift)});
    if (to.zone != nullptr) setenv("TZ", to.zone, /*overwrite=*/1);
  }

  std::shared_ptr<OstrelReportingSession> makeSession(std::uint16_t type) {
    auto session = OstrelReportingSession::initWithID(
        ReporterID{1}, /*processIdentifiers=*/{7}, platform);
    session->setServiceType(ServiceType{type});
    fakes.runUntilIdle();
    return session;
  }

  OstrelReportingPlatform platform;
  FakePlatform fakes;
  std::shared_ptr<OstrelReportingServiceDelegate> root;

 private:
  std::optional<std::string> zone_;
};

TEST_P(ClockJump, LeavesTheWaitForBackendsAtNineSeconds) {
  fakes.telemetryBackend->setDiscovery(FakeDiscovery::held());
  const auto session = makeSession(/*type=*/0);
  session->start();
  fakes.advance(seconds(4));
  jump();
  fakes.advance(milliseconds(4999));
  EXPECT_FALSE(session->started());
  fakes.advance(milliseconds(1));
  EXPECT_TRUE(session->started());
}

TEST_P(ClockJump, LeavesAnAlarmWhereItWasDrawn) {
  fakes.random->script({30});
  makeSession(/*type=*/4)
      ->sendMessage({}, MessageCategory{1}, MessageType{1},
                    /*reply=*/nullptr);
  fakes.advance(seconds(10));
  jump();
  fakes.advance(milliseconds(19'999));
  EXPECT_TRUE(fakes.telemetryBackend->singleMessages().empty());
  fakes.advance(milliseconds(1));
  EXPECT_EQ(fakes.telemetryBackend->singleMessages().size(), 1u);
}

TEST_P(ClockJump, LeavesAThrottledBlockAtItsDelay) {
  const auto runLoops = std::make_shared<ManualRunLoopFactory>(fakes.clock);
  const auto throttle = OstrelReportingBlockThrottle::init(runLoops);
  int delivered = 0;
  throttle->addMessageBlock([&delivered] { ++delivered; }, ReporterID{1},
                            {{"_throttle_seconds", 3}}, MessageCategory{1},
                            MessageType{1});
  fakes.advance(milliseconds(500));
  jump();
  fakes.advance(milliseconds(2499));
  EXPECT_EQ(delivered, 0);
  // The worker looks again every half second.
  fakes.advance(milliseconds(501));
  EXPECT_EQ(delivered, 1);
  throttle->setShouldKeepRunning(false);
  runLoops->endThreads();
}

TEST_P(ClockJump, NeverMakesAnUptimeNegative) {
  const auto connection = fakes.listener->accept(/*pid=*/7);
  fakes.advance(milliseconds(2500));
  jump();
  const double apart = std::abs(fakes.clock->now().secondsSince1970 -
                                ManualClock::kStart.secondsSince1970);
  fakes.log->clear();
  connection->invalidate();
  fakes.runUntilIdle();

  const auto event = fakes.analyticsSink->payload(/*index=*/0);
  const auto told = event.find("seconds")->floatingPoint();
  ASSERT_TRUE(told);
  EXPECT_TRUE(std::isfinite(*told));
  EXPECT_DOUBLE_EQ(*told, apart);
  EXPECT_TRUE(fakes.log->contains(
      LogLevel::kDefault, "osrs",
      "InvalidationHandler: connection exited process=client uptime_sec=" +
          std::to_string(static_cast<long long>(apart))));
}

TEST_P(ClockJump, TellsWhenTheDeviceTurnedAsANumber) {
  const auto session = makeSession(/*type=*/2);
  session->start();
  fakes.runUntilIdle();
  const double start = fakes.clock->now().secondsSince1970;
  fakes.advance(milliseconds(1500));
  jump();
  fakes.orientationService->turnDevice(1);
  const double apart = fakes.clock->now().secondsSince1970 - start;
  std::vector<Value> entries;
  session->aggregatedPayloadData()->lock()->snapshot().forEach(
      [&entries](ValueView entry) { entries.emplace_back(entry); });
  ASSERT_EQ(entries.size(), 1u);
  const auto time =
      entries[0].view().dictionary()->find("device_orientation_time")->floatingPoint();
  ASSERT_TRUE(time);
  EXPECT_TRUE(std::isfinite(*time));
  EXPECT_DOUBLE_EQ(*time, apart);
}

TEST_P(ClockJump, NamesTheSessionLogByADateOfFourDigits) {
  const auto session = makeSession(/*type=*/2);
  session->start();
  session->sendMessage({}, MessageCategory{1}, MessageType{1}, /*reply=*/nullptr);
  fakes.runUntilIdle();
  jump();
  session->stop();
  fakes.runUntilIdle();
  const auto files = fakes.fileSystem->files();
  ASSERT_EQ(files.size(), 1u);
  EXPECT_THAT(files.begin()->first,
              testing::MatchesRegex("/logs/Audio/Reporting/[0-9]{8}-[0-9]{6}[+-][0-9]{4}"
                                    "-ostrel-\\(null\\)-telephony\\.json"));
}

TEST_P(ClockJump, LeavesAStoppedAndStartedSessionWorking) {
  const auto session = makeSession(/*type=*/0);
  session->start();
  fakes.runUntilIdle();
  jump();
  session->stop();
  session->start();
  session->sendMessage({}, MessageCategory{1}, MessageType{1}, /*reply=*/nullptr);
  fakes.runUntilIdle();
  EXPECT_EQ(fakes.telemetryBackend->lastSession()->messages().size(), 1u);
  EXPECT_EQ(session->startDate(), fakes.clock->now());
  session->stop();
  fakes.runUntilIdle();
}

INSTANTIATE_TEST_SUITE_P(Ten, ClockJump, testing::ValuesIn(kJumps),
                         [](const auto& jump) { return std::string(jump.param.name); });

}  // namespace
}  // namespace ostrel
