#pragma once

#include <cstddef>
#include <functional>

#include "platform/Random.h"

namespace ostrel {

/// Draws from the kernel's generator.
class SystemRandom final : public Random {
 public:
  /// Fills the whole of the bytes, or returns false.
  using Source = std::function<bool(void* bytes, std::size_t size)>;

  SystemRandom();
  /// When `source` fails, draws come from the clock: even, but not secret.
  explicit SystemRandom(Source source);

  std::uint32_t uniform(std::uint32_t bound) override;

 private:
  std::uint32_t bits();

  const Source source_;
};

}  // namespace ostrel
