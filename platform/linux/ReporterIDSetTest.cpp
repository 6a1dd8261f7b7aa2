#include "platform/linux/ReporterIDSet.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <random>
#include <set>

namespace ostrel {
namespace {

TEST(ReporterIDSet, BeginsEmpty) {
  ReporterIDSet set;
  EXPECT_EQ(set.size(), 0u);
  EXPECT_FALSE(set.contains(ReporterID{0}));
  EXPECT_FALSE(set.contains(ReporterID{1}));
  EXPECT_FALSE(set.erase(ReporterID{0}));
  EXPECT_FALSE(set.erase(ReporterID{1}));
}

TEST(ReporterIDSet, TakesEveryIDOnceTheExtremesAndZeroToo) {
  constexpr std::int64_t kExtremes[] = {0, 1, -1,
                                        std::numeric_limits<std::int64_t>::min(),
                                        std::numeric_limits<std::int64_t>::max()};
  ReporterIDSet set;
  for (const std::int64_t id : kExtremes) {
    EXPECT_TRUE(set.insert(ReporterID{id}));
    EXPECT_FALSE(set.insert(ReporterID{id}));
    EXPECT_TRUE(set.contains(ReporterID{id}));
  }
  EXPECT_EQ(set.size(), std::size(kExtremes));
  for (const std::int64_t id : kExtremes) {
    EXPECT_TRUE(set.erase(ReporterID{id}));
    EXPECT_FALSE(set.contains(ReporterID{id}));
  }
  EXPECT_EQ(set.size(), 0u);
}

TEST(ReporterIDSet, DoesAsASetOfTheLibraryDoes) {
  std::mt19937_64 random(7);
  for (const std::int64_t range : {20, 400, 100'000}) {
    ReporterIDSet set;
    std::set<std::int64_t> expected;
    for (int i = 0; i < 50'000; ++i) {
      const std::int64_t id =
          static_cast<std::int64_t>(random() % static_cast<std::uint64_t>(range)) - 3;
      if (random() % 2 == 0) {
        ASSERT_EQ(set.insert(ReporterID{id}), expected.insert(id).second);
      } else {
        ASSERT_EQ(set.erase(ReporterID{id}), expected.erase(id) != 0);
      }
      ASSERT_EQ(set.size(), expected.size());
    }
    for (std::int64_t id = -3; id < range; ++id) {
      ASSERT_EQ(set.contains(ReporterID{id}), expected.count(id) != 0) << id;
    }
  }
}

TEST(ReporterIDSet, GoesThroughAllButZero) {
  ReporterIDSet set;
  set.forEach([](ReporterID) { FAIL() << "it is empty"; });
  std::set<ReporterID> expected;
  for (std::int64_t id = -50; id < 50; ++id) {
    set.insert(ReporterID{id});
    if (id != 0) expected.insert(ReporterID{id});
  }
  std::set<ReporterID> found;
  set.forEach([&](ReporterID id) { EXPECT_TRUE(found.insert(id).second); });
  EXPECT_EQ(found, expected);
}

}  // namespace
}  // namespace ostrel
