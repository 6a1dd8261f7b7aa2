#pragma once

#include <cstdint>

namespace ostrel {

class Random {
 public:
  virtual ~Random() = default;

  /// An integer from 0 to `bound` - 1, each equally likely. `bound` is at
  /// least 1. Never fails. Any thread.
  virtual std::uint32_t uniform(std::uint32_t bound) = 0;
};

}  // namespace ostrel
