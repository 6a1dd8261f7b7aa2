#include "platform/linux/SessionOwners.h"

#include <gtest/gtest.h>

#include <array>
#include <cstdint>
#include <limits>
#include <map>
#include <random>
#include <set>

namespace ostrel {
namespace {

using Owner = SessionOwners::Owner;

constexpr Owner kFirst{3, 1000};
constexpr Owner kSecond{4, 1001};
constexpr Owner kThird{5, 1000};
constexpr ReporterID kID{7};

TEST(SessionOwners, KnowNothingUntilTheyAreKept) {
  SessionOwners owners;
  owners.enter(kID, kFirst);
  EXPECT_FALSE(owners.areKept());
  EXPECT_EQ(owners.find(kID), nullptr);
  EXPECT_EQ(owners.slots(), 0u);
  owners.remove(kID, kFirst);

  owners.keep(/*sessions=*/0);
  EXPECT_TRUE(owners.areKept());
  owners.enter(kID, kFirst);
  EXPECT_EQ(owners.find(kID), &kFirst);
}

TEST(SessionOwners, FindWhoConnectedFirstInWhateverOrderTheyAreEntered) {
  for (const auto& order :
       {std::array{&kFirst, &kSecond, &kThird}, std::array{&kThird, &kSecond, &kFirst},
        std::array{&kSecond, &kFirst, &kThird}}) {
    SessionOwners owners;
    owners.keep(/*sessions=*/3);
    for (const Owner* owner : order) owners.enter(kID, *owner);
    EXPECT_EQ(owners.find(kID), &kFirst);
    owners.remove(kID, kFirst);
    EXPECT_EQ(owners.find(kID), &kSecond);
    owners.remove(kID, kThird);
    EXPECT_EQ(owners.find(kID), &kSecond);
    owners.remove(kID, kSecond);
    EXPECT_EQ(owners.find(kID), nullptr);
  }
}

TEST(SessionOwners, HaveTheExtremesAndNobodyUnderZero) {
  SessionOwners owners;
  owners.keep(/*sessions=*/0);
  for (const std::int64_t id :
       {std::numeric_limits<std::int64_t>::min(), std::int64_t{-1}, std::int64_t{0},
        std::int64_t{1}, std::numeric_limits<std::int64_t>::max()}) {
    owners.enter(ReporterID{id}, kFirst);
    EXPECT_EQ(owners.find(ReporterID{id}), id == 0 ? nullptr : &kFirst) << id;
    EXPECT_EQ(owners.find(ReporterID{id ^ 2}), nullptr) << id;
  }
}

TEST(SessionOwners, GiveTheRoomBackThatIsNotNeededAnyMore) {
  constexpr std::int64_t kMany = 100'000;
  SessionOwners owners;
  owners.keep(/*sessions=*/0);
  const std::size_t fewest = owners.slots();
  for (std::int64_t id = 1; id <= kMany; ++id) owners.enter(ReporterID{id}, kFirst);
  EXPECT_LE(owners.slots(), std::size_t{3 * kMany});
  for (std::int64_t id = 1; id <= kMany; ++id) owners.remove(ReporterID{id}, kFirst);
  EXPECT_EQ(owners.slots(), fewest);

  SessionOwners known;
  known.keep(kMany);
  const std::size_t slots = known.slots();
  for (std::int64_t id = 1; id <= kMany; ++id) known.enter(ReporterID{id}, kFirst);
  EXPECT_EQ(known.slots(), slots) << "there was room for all that were told of";
}

TEST(SessionOwners, DoAsAPlainMapOfSetsDoes) {
  constexpr std::array kOwners{kFirst, kSecond, kThird};
  std::mt19937_64 random(7);
  for (const std::uint64_t range : {10, 300, 20'000}) {
    SessionOwners owners;
    owners.keep(/*sessions=*/0);
    std::map<ReporterID, std::set<std::size_t>> expected;
    for (int i = 0; i < 60'000; ++i) {
      // The first half mostly grows, the second mostly shrinks.
      const bool isEntering = random() % 4 < (i < 30'000 ? 3u : 1u);
      const ReporterID id{static_cast<std::int64_t>(random() % range) + 1};
      const std::size_t who = random() % kOwners.size();
      if (!isEntering) {
        owners.remove(id, kOwners[who]);
        expected[id].erase(who);
      } else if (expected[id].insert(who).second) {
        owners.enter(id, kOwners[who]);
      }
      const auto& those = expected[id];
      ASSERT_EQ(owners.find(id), those.empty() ? nullptr : &kOwners[*those.begin()]);
    }
    for (const auto& [id, those] : expected) {
      ASSERT_EQ(owners.find(id), those.empty() ? nullptr : &kOwners[*those.begin()]);
    }
  }
}

}  // namespace
}  // namespace ostrel
