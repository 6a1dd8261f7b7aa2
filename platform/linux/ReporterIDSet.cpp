#include "platform/linux/ReporterIDSet.h"

#include <algorithm>
#include <utility>

#include "platform/SpreadHash.h"

namespace ostrel {
namespace {

constexpr std::size_t kFewestSlots = 16;  // A power of two, as all counts.
constexpr ReporterID kFree{0};

}  // namespace

bool ReporterIDSet::contains(ReporterID id) const {
  if (id == kFree) return hasZero_;
  return !slots_.empty() && slots_[find(id)] == id;
}

bool ReporterIDSet::insert(ReporterID id) {
  if (contains(id)) return false;
  ++size_;
  if (id == kFree) {
    hasZero_ = true;
    return true;
  }
  if (4 * size_ > 3 * slots_.size()) grow();
  slots_[find(id)] = id;
  return true;
}

bool ReporterIDSet::erase(ReporterID id) {
  if (!contains(id)) return false;
  --size_;
  if (id == kFree) {
    hasZero_ = false;
    return true;
  }
  // Those behind the gap move up, as far as that brings none before its home.
  std::size_t gap = find(id);
  for (std::size_t at = after(gap); slots_[at] != kFree; at = after(at)) {
    const std::size_t mask = slots_.size() - 1;
    const bool mayMove = ((at - home(slots_[at])) & mask) >= ((at - gap) & mask);
    if (!mayMove) continue;
    slots_[gap] = slots_[at];
    gap = at;
  }
  slots_[gap] = kFree;
  return true;
}

std::size_t ReporterIDSet::home(ReporterID id) const {
  return SpreadHash()(id) & (slots_.size() - 1);
}

std::size_t ReporterIDSet::find(ReporterID id) const {
  std::size_t slot = home(id);
  while (slots_[slot] != kFree && slots_[slot] != id) slot = after(slot);
  return slot;
}

void ReporterIDSet::grow() {
  std::vector<ReporterID> old(std::max(kFewestSlots, 2 * slots_.size()), kFree);
  std::swap(old, slots_);
  for (const ReporterID id : old) {
    if (id != kFree) slots_[find(id)] = id;
  }
}

}  // namespace ostrel
