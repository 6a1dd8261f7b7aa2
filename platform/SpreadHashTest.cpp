#include "platform/SpreadHash.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "platform/SpreadHashTesting.h"

namespace ostrel {
namespace {

enum class ID : std::int64_t {};

constexpr std::uint64_t kIDs = 65536;
constexpr std::size_t kSlots = 1024;

// How many of `kIDs` IDs, each `step` after the one before, meet in one slot at most:
// about 64 do in each. `shift` chooses the bits of the hash that number the slots.
std::uint64_t mostInASlot(std::uint64_t step, int shift) {
  std::array<std::uint64_t, kSlots> slots{};
  for (std::uint64_t i = 0; i < kIDs; ++i) {
    const auto id = static_cast<ID>(i * step);
    ++slots[(SpreadHash()(id) >> shift) % kSlots];
  }
  return *std::max_element(slots.begin(), slots.end());
}

TEST(SpreadHash, IsTheSameForTheSameID) {
  EXPECT_EQ(SpreadHash()(ID{-4711}), SpreadHash()(ID{-4711}));
  EXPECT_NE(SpreadHash()(ID{-4711}), SpreadHash()(ID{4711}));
}

TEST(SpreadHash, SpreadsIDsInARow) {
  EXPECT_LT(mostInASlot(/*step=*/1, /*shift=*/0), 200u);
  EXPECT_LT(mostInASlot(/*step=*/1, /*shift=*/54), 200u);
}

// Multiples of a table's size, of a power of two, of the inverse of a usual factor.
TEST(SpreadHash, SpreadsIDsThatAreChosenToMeet) {
  for (const std::uint64_t step :
       {std::uint64_t{85229} * 172933, std::uint64_t{1} << 20, std::uint64_t{1} << 47,
        std::uint64_t{0xF1DE83E19937733D}}) {
    EXPECT_LT(mostInASlot(step, /*shift=*/0), 200u) << step;
    EXPECT_LT(mostInASlot(step, /*shift=*/54), 200u) << step;
  }
}

// How many of `count` hashes meet in one slot at most.
template <typename Hash>
std::size_t mostInASlot(std::size_t count, const Hash& hashOf) {
  std::array<std::size_t, kSlots> slots{};
  for (std::size_t i = 0; i < count; ++i) ++slots[hashOf(i) % kSlots];
  return *std::max_element(slots.begin(), slots.end());
}

TEST(SpreadHash, SpreadsIDsThatMeetWithoutASeed) {
  EXPECT_LT(mostInASlot(kIDs,
                        [](std::size_t i) {
                          return SpreadHash()(
                              testing_support::meetingID(static_cast<std::uint32_t>(i)));
                        }),
            200u);
}

TEST(SpreadHash, SpreadsKeysThatMeetWithoutASeed) {
  const std::vector<std::string> keys = testing_support::meetingKeys(4096);
  const auto unseeded = std::hash<std::string>();
  for (const std::string& key : keys) ASSERT_EQ(unseeded(key), unseeded(keys.front()));
  EXPECT_LT(
      mostInASlot(keys.size(), [&](std::size_t i) { return SpreadHash()(keys[i]); }), 30u)
      << "four on average";
}

TEST(SpreadHash, LetsOtherTextsMeetUnderEachSeed) {
  std::vector<std::string> met;
  for (int i = 0; met.size() < 100; ++i) {
    std::string text = "key" + std::to_string(i);
    if (SpreadHash::ofText(text, /*seed=*/1) % kSlots == 0) met.push_back(text);
  }
  EXPECT_LT(
      mostInASlot(met.size(),
                  [&](std::size_t i) { return SpreadHash::ofText(met[i], /*seed=*/2); }),
      10u);
}

TEST(SpreadHash, TellsTextsApartThatDifferInOneBitOrInLength) {
  for (std::size_t size = 0; size < 20; ++size) {
    const std::string text(size, '\0');
    const std::size_t hash = SpreadHash()(text);
    EXPECT_EQ(hash, SpreadHash()(std::string_view(text)));
    EXPECT_NE(hash, SpreadHash()(text + '\0'));
    for (std::size_t bit = 0; bit < 8 * size; ++bit) {
      std::string other = text;
      other[bit / 8] = static_cast<char>(1 << bit % 8);
      EXPECT_NE(hash, SpreadHash()(other)) << size << " bytes, bit " << bit;
    }
  }
}

}  // namespace
}  // namespace ostrel
