#include "platform/Date.h"

#include <gtest/gtest.h>

#include <cmath>

namespace ostrel {
namespace {

TEST(Date, IsWrittenInUTCWithMilliseconds) {
  EXPECT_EQ(iso8601({1769860800.25}), "2026-01-31T12:00:00.250Z");
  EXPECT_EQ(iso8601({0}), "1970-01-01T00:00:00.000Z");
}

TEST(Date, IsRoundedToTheNearestMillisecond) {
  EXPECT_EQ(iso8601({0.0014}), "1970-01-01T00:00:00.001Z");
  EXPECT_EQ(iso8601({0.0016}), "1970-01-01T00:00:00.002Z");
  EXPECT_EQ(iso8601({59.9996}), "1970-01-01T00:01:00.000Z");
  EXPECT_EQ(iso8601({-0.0016}), "1969-12-31T23:59:59.998Z");
}

TEST(Date, MayLieBefore1970) {
  EXPECT_EQ(iso8601({-1}), "1969-12-31T23:59:59.000Z");
  EXPECT_EQ(iso8601({-2208988800.0}), "1900-01-01T00:00:00.000Z");
}

TEST(Date, KnowsLeapDays) {
  EXPECT_EQ(iso8601({951782400}), "2000-02-29T00:00:00.000Z");
  EXPECT_EQ(iso8601({951868800}), "2000-03-01T00:00:00.000Z");
}

TEST(Date, IsWrittenForTheYears0000To9999) {
  EXPECT_EQ(iso8601({-62167219200.0}), "0000-01-01T00:00:00.000Z");
  EXPECT_EQ(iso8601({-62167219200.001}), "");
  EXPECT_EQ(iso8601({253402300799.999}), "9999-12-31T23:59:59.999Z");
  EXPECT_EQ(iso8601({253402300800.0}), "");
}

TEST(Date, IsNotWrittenWhenItIsNotFinite) {
  EXPECT_EQ(iso8601({HUGE_VAL}), "");
  EXPECT_EQ(iso8601({-HUGE_VAL}), "");
  EXPECT_EQ(iso8601({std::nan("")}), "");
}

}  // namespace
}  // namespace ostrel
