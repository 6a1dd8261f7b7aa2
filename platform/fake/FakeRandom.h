#pragma once

#include <deque>
#include <mutex>
#include <vector>

#include "platform/Random.h"

namespace ostrel {

/// Draws what the test says: the scripted values in turn, then 0.
class FakeRandom final : public Random {
 public:
  std::uint32_t uniform(std::uint32_t bound) override;

  /// Each value must lie below the bound that it meets.
  void script(std::vector<std::uint32_t> draws);
  /// The bounds asked for, in order.
  std::vector<std::uint32_t> bounds() const;

 private:
  mutable std::mutex mutex_;
  std::deque<std::uint32_t> draws_;
  std::vector<std::uint32_t> bounds_;
};

}  // namespace ostrel
