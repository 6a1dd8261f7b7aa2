#include "platform/linux/SystemRandom.h"

#include <errno.h>
#include <sys/random.h>
#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <utility>

namespace ostrel {
namespace {

bool readKernel(void* bytes, std::size_t size) {
  for (;;) {
    const ssize_t got = getrandom(bytes, size, 0);
    if (got == static_cast<ssize_t>(size)) return true;
    if (got >= 0 || errno != EINTR) return false;
  }
}

// The clock and a count, well stirred.
std::uint32_t bitsOfClock() {
  static std::atomic<std::uint64_t> count{0};
  const auto now = std::chrono::steady_clock::now().time_since_epoch().count();
  std::uint64_t x =
      static_cast<std::uint64_t>(now) + 0x9E3779B97F4A7C15u * (count.fetch_add(1) + 1);
  x = (x ^ (x >> 30)) * 0xBF58476D1CE4E5B9u;
  x = (x ^ (x >> 27)) * 0x94D049BB133111EBu;
  return static_cast<std::uint32_t>((x ^ (x >> 31)) >> 32);
}

}  // namespace

SystemRandom::SystemRandom() : SystemRandom(readKernel) {}

SystemRandom::SystemRandom(Source source) : source_(std::move(source)) {}

std::uint32_t SystemRandom::bits() {
  std::uint32_t drawn = 0;
  if (source_(&drawn, sizeof drawn)) return drawn;
  return bitsOfClock();
}

std::uint32_t SystemRandom::uniform(std::uint32_t bound) {
  // The high half of a product spreads 2^32 draws over `bound` results; draws
  // that would give some results one more than others are drawn again.
  const std::uint32_t uneven = -bound % bound;
  for (;;) {
    const std::uint64_t product = std::uint64_t{bits()} * bound;
    if (static_cast<std::uint32_t>(product) >= uneven) {
      return static_cast<std::uint32_t>(product >> 32);
    }
  }
}

}  // namespace ostrel
