#include "forwarder/RetryPauses.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>
#include <vector>

#include "platform/fake/FakeRandom.h"

namespace ostrel {
namespace {

using std::chrono::milliseconds;

constexpr Date kNow{784111777.0};  // Sun, 06 Nov 1994 08:49:37 GMT.

/// Always the largest.
class LargestRandom final : public Random {
 public:
  std::uint32_t uniform(std::uint32_t bound) override { return bound - 1; }
};

TEST(RetryPauses, GrowByHalfUpTo15Minutes) {
  LargestRandom random;
  RetryPauses pauses(random);
  EXPECT_EQ(pauses.next({}), milliseconds(5000));
  EXPECT_EQ(pauses.next({}), milliseconds(7500));
  EXPECT_EQ(pauses.next({}), milliseconds(11250));
  milliseconds longest{0};
  for (int i = 0; i < 100; ++i) longest = pauses.next({});
  EXPECT_EQ(longest, RetryPauses::kLongest);
}

TEST(RetryPauses, AreDrawnFromTheirUpperHalf) {
  FakeRandom random;
  RetryPauses pauses(random);
  EXPECT_EQ(pauses.next({}), milliseconds(2500));
  EXPECT_EQ(random.bounds(), std::vector<std::uint32_t>{2501});
}

TEST(RetryPauses, BeginAgainAfterASuccess) {
  LargestRandom random;
  RetryPauses pauses(random);
  for (int i = 0; i < 20; ++i) pauses.next({});
  pauses.reset();
  EXPECT_EQ(pauses.next({}), RetryPauses::kFirst);
}

TEST(RetryPauses, AreAtLeastWhatTheCollectorAsksFor) {
  FakeRandom smallest;
  EXPECT_EQ(RetryPauses(smallest).next(milliseconds(100'000)), milliseconds(100'000));
  LargestRandom largest;
  EXPECT_EQ(RetryPauses(largest).next(milliseconds(100'000)), milliseconds(110'000));
  EXPECT_EQ(RetryPauses(largest).next(RetryPauses::kLongestAsked),
            RetryPauses::kLongestAsked + milliseconds(60'000));
}

TEST(RetryPauses, AreNoShorterThanTheirOwnForACollectorThatAsksForLess) {
  FakeRandom random;
  EXPECT_EQ(RetryPauses(random).next(milliseconds(0)), milliseconds(2500));
}

TEST(PauseAsked, IsANumberOfSeconds) {
  EXPECT_EQ(pauseAsked("0", kNow), milliseconds(0));
  EXPECT_EQ(pauseAsked("120", kNow), milliseconds(120'000));
}

TEST(PauseAsked, IsTheTimeUntilADate) {
  EXPECT_EQ(pauseAsked("Sun, 06 Nov 1994 08:50:37 GMT", kNow), milliseconds(60'000));
}

TEST(PauseAsked, IsNothingForADateThatIsPast) {
  EXPECT_EQ(pauseAsked("Sun, 06 Nov 1994 08:49:36 GMT", kNow), milliseconds(0));
  EXPECT_EQ(pauseAsked("Thu, 01 Jan 1970 00:00:00 GMT", kNow), milliseconds(0));
}

TEST(PauseAsked, IsOneDayAtMost) {
  EXPECT_EQ(pauseAsked("86400", kNow), RetryPauses::kLongestAsked);
  EXPECT_EQ(pauseAsked("86401", kNow), RetryPauses::kLongestAsked);
  EXPECT_EQ(pauseAsked("1000000000000", kNow), RetryPauses::kLongestAsked);
  EXPECT_EQ(pauseAsked("99999999999999999999999999", kNow), RetryPauses::kLongestAsked);
  EXPECT_EQ(pauseAsked("Fri, 31 Dec 9999 23:59:59 GMT", kNow),
            RetryPauses::kLongestAsked);
}

TEST(PauseAsked, IsNoneForAnythingElse) {
  for (const char* text :
       {"", "-1", "1.5", "soon", " 5", "5 ", "Sun, 06 Nov 1994 08:49:37 CET",
        "Sun, 06 Xyz 1994 08:49:37 GMT", "Sun, x6 Nov 1994 08:49:37 GMT",
        "Sunday, 06-Nov-94 08:49:37 GMT", "Sun Nov  6 08:49:37 1994"}) {
    EXPECT_EQ(pauseAsked(text, kNow), std::nullopt) << text;
  }
}

TEST(PauseAsked, BearsAClockThatSaysNoTime) {
  const Date none{std::numeric_limits<double>::quiet_NaN()};
  EXPECT_EQ(pauseAsked("Sun, 06 Nov 1994 08:49:37 GMT", none), milliseconds(0));
}

}  // namespace
}  // namespace ostrel
