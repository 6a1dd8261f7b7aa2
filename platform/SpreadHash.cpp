#include "platform/SpreadHash.h"

#include <bit>
#include <cstring>

namespace ostrel {
namespace {

struct State {
  std::uint64_t a, b, c, d;

  void mix() {
    a += b;
    c += d;
    b = std::rotl(b, 13) ^ a;
    d = std::rotl(d, 16) ^ c;
    a = std::rotl(a, 32) + d;
    c += b;
    d = std::rotl(d, 21) ^ a;
    b = std::rotl(b, 17) ^ c;
    c = std::rotl(c, 32);
  }
  void take(std::uint64_t block) {
    d ^= block;
    mix();
    a ^= block;
  }
};

}  // namespace

std::uint64_t SpreadHash::ofText(std::string_view text, std::uint64_t seed) noexcept {
  const std::uint64_t other = seed * kFactor;
  State state{seed ^ 0x736F6D6570736575, other ^ 0x646F72616E646F6D,
              seed ^ 0x6C7967656E657261, other ^ 0x7465646279746573};
  const std::uint64_t size = text.size();
  for (; text.size() >= sizeof(std::uint64_t); text.remove_prefix(8)) {
    std::uint64_t block;
    std::memcpy(&block, text.data(), sizeof block);
    state.take(block);
  }
  std::uint64_t last = 0;
  if (!text.empty()) std::memcpy(&last, text.data(), text.size());
  state.take(last | size << 56);
  state.c ^= 0xFF;
  for (int round = 0; round < 3; ++round) state.mix();
  return state.a ^ state.b ^ state.c ^ state.d;
}

}  // namespace ostrel
