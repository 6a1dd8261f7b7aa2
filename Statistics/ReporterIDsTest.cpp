#include "Statistics/ReporterIDs.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <utility>
#include <vector>

namespace ostrel {
namespace {

ReporterIDs numbered(std::size_t count) {
  ReporterIDs ids;
  for (std::size_t i = 1; i <= count; ++i) {
    ids.push_back(ReporterID{static_cast<std::int64_t>(i)});
  }
  return ids;
}

std::vector<ReporterID> asVector(const ReporterIDs& ids) {
  return {ids.begin(), ids.end()};
}

TEST(ReporterIDs, BeginsEmpty) {
  const ReporterIDs ids;
  EXPECT_TRUE(ids.empty());
  EXPECT_EQ(ids.size(), 0u);
  EXPECT_EQ(ids.begin(), ids.end());
}

TEST(ReporterIDs, HoldIDsInOrderWhateverTheirNumber) {
  for (const std::size_t count : {0, 1, 2, 3, 4, 5, 1024}) {
    const ReporterIDs ids = numbered(count);
    ASSERT_EQ(ids.size(), count);
    for (std::size_t i = 0; i < count; ++i) {
      EXPECT_EQ(ids[i], ReporterID{static_cast<std::int64_t>(i + 1)});
    }
  }
}

TEST(ReporterIDs, CopiesAndMovesInsideAndOutside) {
  for (const std::size_t count : {0, 1, 2, 3, 9}) {
    const ReporterIDs ids = numbered(count);
    ReporterIDs copy = ids;
    EXPECT_EQ(copy, ids);
    const ReporterIDs moved = std::move(copy);
    EXPECT_EQ(moved, ids);
    for (const std::size_t other : {0, 2, 3}) {
      ReporterIDs assigned = numbered(other);
      assigned = ids;
      EXPECT_EQ(assigned, ids);
      ReporterIDs a = ids;
      ReporterIDs b = numbered(other);
      a.swap(b);
      EXPECT_EQ(a, numbered(other));
      EXPECT_EQ(b, ids);
    }
  }
}

TEST(ReporterIDs, MayBeAssignedToItself) {
  ReporterIDs ids = numbered(5);
  const ReporterIDs& same = ids;
  ids = same;
  EXPECT_EQ(ids, numbered(5));
}

TEST(ReporterIDs, AreMadeOfAListOrOfOneIDManyTimes) {
  EXPECT_EQ((ReporterIDs{ReporterID{1}, ReporterID{2}, ReporterID{3}}), numbered(3));
  EXPECT_EQ(asVector(ReporterIDs(4, ReporterID{7})),
            std::vector<ReporterID>(4, ReporterID{7}));
  EXPECT_TRUE(ReporterIDs(0, ReporterID{7}).empty());
}

TEST(ReporterIDs, AreEqualWhenAllAreInTheSameOrder) {
  EXPECT_EQ(numbered(3), numbered(3));
  EXPECT_NE(numbered(3), numbered(2));
  EXPECT_NE((ReporterIDs{ReporterID{1}, ReporterID{2}}),
            (ReporterIDs{ReporterID{2}, ReporterID{1}}));
}

}  // namespace
}  // namespace ostrel
