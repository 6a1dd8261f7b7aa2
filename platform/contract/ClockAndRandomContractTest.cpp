#include <stdlib.h>
#include <time.h>

#include <cmath>
#include <cstdio>
#include <cstring>

#include "platform/contract/Time.h"
#include "platform/fake/FakeRandom.h"
#include "platform/linux/SystemRandom.h"

namespace ostrel {
namespace {

/// Sets the process's zone for one test.
class ZoneScope {
 public:
  explicit ZoneScope(const char* zone) {
    if (const char* before = getenv("TZ")) before_ = before;
    setenv("TZ", zone, /*overwrite=*/1);
    tzset();
  }
  ~ZoneScope() {
    if (before_) {
      setenv("TZ", before_->c_str(), /*overwrite=*/1);
    } else {
      unsetenv("TZ");
    }
    tzset();
  }
  ZoneScope(const ZoneScope&) = delete;
  ZoneScope& operator=(const ZoneScope&) = delete;

 private:
  std::optional<std::string> before_;
};

struct ManualClockInZone {
  void setEastOfGreenwich(std::chrono::minutes offset) { clock.setZone(offset); }
  ManualClock clock;
};

struct SystemClockInZone {
  void setEastOfGreenwich(std::chrono::minutes offset) {
    const auto west = -offset.count();  // POSIX counts westwards.
    const auto absolute = std::abs(west);
    char zone[32];
    std::snprintf(zone, sizeof zone, "<TST>%c%02d:%02d", west < 0 ? '-' : '+',
                  static_cast<int>(absolute / 60), static_cast<int>(absolute % 60));
    scope.emplace(zone);
  }
  SystemClock clock;
  std::optional<ZoneScope> scope;
};

template <typename Subject>
class ClockContract : public testing::Test {
 protected:
  Subject subject_;
};
using Clocks = testing::Types<ManualClockInZone, SystemClockInZone>;
TYPED_TEST_SUITE(ClockContract, Clocks);

TYPED_TEST(ClockContract, NeverGoesBackOnTheMonotonicClock) {
  auto before = this->subject_.clock.monotonicNow();
  for (int i = 0; i < 1000; ++i) {
    const auto now = this->subject_.clock.monotonicNow();
    ASSERT_GE(now, before);
    before = now;
  }
}

TYPED_TEST(ClockContract, TellsADateOfThisCentury) {
  const double seconds = this->subject_.clock.now().secondsSince1970;
  EXPECT_GT(seconds, 1.7e9);
  EXPECT_LT(seconds, 4.2e9);
}

TYPED_TEST(ClockContract, WritesDatesForFileNamesInTheLocalZone) {
  const Date date{1769860800.0};  // 2026-01-31T12:00:00Z
  this->subject_.setEastOfGreenwich(std::chrono::minutes(0));
  EXPECT_EQ(this->subject_.clock.fileNameDate(date), "20260131-120000+0000");
  this->subject_.setEastOfGreenwich(std::chrono::minutes(60));
  EXPECT_EQ(this->subject_.clock.fileNameDate(date), "20260131-130000+0100");
  this->subject_.setEastOfGreenwich(std::chrono::minutes(-3 * 60 - 30));
  EXPECT_EQ(this->subject_.clock.fileNameDate(date), "20260131-083000-0330");
  this->subject_.setEastOfGreenwich(std::chrono::hours(14));
  EXPECT_EQ(this->subject_.clock.fileNameDate(date), "20260201-020000+1400");
}

TYPED_TEST(ClockContract, CutsFractionsOfASecondInFileNames) {
  this->subject_.setEastOfGreenwich(std::chrono::minutes(0));
  EXPECT_EQ(this->subject_.clock.fileNameDate({1769860800.999}), "20260131-120000+0000");
  EXPECT_EQ(this->subject_.clock.fileNameDate({-0.5}), "19691231-235959+0000");
}

TEST(SystemClock, FollowsTheRulesOfAZoneWithSummerTime) {
  const ZoneScope zone("CET-1CEST,M3.5.0,M10.5.0/3");
  EXPECT_EQ(SystemClock().fileNameDate({1769860800.0}), "20260131-130000+0100");
  EXPECT_EQ(SystemClock().fileNameDate({1785499200.0}), "20260731-140000+0200");
}

TEST(SystemClock, WritesFileNamesForDatesThatNoCalendarHolds) {
  const ZoneScope zone("UTC0");
  const SystemClock clock;
  EXPECT_EQ(clock.fileNameDate({std::nan("")}), "19700101-000000+0000");
  EXPECT_EQ(clock.fileNameDate({HUGE_VAL}), "99991230-235959+0000");
  EXPECT_EQ(clock.fileNameDate({-HUGE_VAL}), "00000102-000000+0000");
}

template <typename Subject>
class RandomContract : public testing::Test {
 protected:
  Subject random_;
};
using Randoms = testing::Types<FakeRandom, SystemRandom>;
TYPED_TEST_SUITE(RandomContract, Randoms);

TYPED_TEST(RandomContract, DrawsBelowItsBound) {
  for (const std::uint32_t bound : {1u, 2u, 3u, 60u, 0x80000000u, 0xFFFFFFFFu}) {
    for (int i = 0; i < 100; ++i) EXPECT_LT(this->random_.uniform(bound), bound);
  }
}

TEST(SystemRandom, DrawsEveryValueAboutEquallyOften) {
  SystemRandom random;
  std::vector<int> counts(60);
  for (int i = 0; i < 60000; ++i) ++counts[random.uniform(60)];
  // 1000 each; eight standard deviations.
  for (const int count : counts) EXPECT_NEAR(count, 1000, 250);
}

TEST(SystemRandom, DrawsAgainWhereAResultWouldComeTooOften) {
  // With three results 2^32 draws leave one over: the draw 0 is not used.
  std::vector<std::uint32_t> draws{0, 0, 0x80000000u};
  std::size_t next = 0;
  SystemRandom random([&](void* bytes, std::size_t size) {
    std::memcpy(bytes, &draws.at(next++), size);
    return true;
  });
  EXPECT_EQ(random.uniform(3), 1u);
  EXPECT_EQ(next, 3u);
}

TEST(SystemRandom, GoesOnDrawingWhenTheKernelGivesNothing) {
  SystemRandom random([](void*, std::size_t) { return false; });
  std::vector<int> counts(60);
  for (int i = 0; i < 60000; ++i) ++counts[random.uniform(60)];
  for (const int count : counts) EXPECT_NEAR(count, 1000, 250);
}

TEST(FakeRandom, DrawsWhatItWasToldAndRemembersTheBounds) {
  FakeRandom random;
  random.script({59, 7});
  EXPECT_EQ(random.uniform(60), 59u);
  EXPECT_EQ(random.uniform(10), 7u);
  EXPECT_EQ(random.uniform(10), 0u);
  EXPECT_THAT(random.bounds(), testing::ElementsAre(60u, 10u, 10u));
}

}  // namespace
}  // namespace ostrel
