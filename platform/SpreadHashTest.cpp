#include "platform/SpreadHash.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstdint>

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

}  // namespace
}  // namespace ostrel
