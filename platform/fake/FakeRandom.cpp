#include "platform/fake/FakeRandom.h"

#include "platform/fake/FakeUse.h"

namespace ostrel {

std::uint32_t FakeRandom::uniform(std::uint32_t bound) {
  checkFakeUse(bound >= 1, "a draw's bound is 1 at least");
  const std::lock_guard lock(mutex_);
  bounds_.push_back(bound);
  if (draws_.empty()) return 0;
  const std::uint32_t draw = draws_.front();
  draws_.pop_front();
  checkFakeUse(draw < bound, "a scripted draw lies below its bound");
  return draw;
}

void FakeRandom::script(std::vector<std::uint32_t> draws) {
  const std::lock_guard lock(mutex_);
  draws_.insert(draws_.end(), draws.begin(), draws.end());
}

std::vector<std::uint32_t> FakeRandom::bounds() const {
  const std::lock_guard lock(mutex_);
  return bounds_;
}

}  // namespace ostrel
