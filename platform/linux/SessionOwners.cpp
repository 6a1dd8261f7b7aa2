#include "platform/linux/SessionOwners.h"

#include <algorithm>

namespace ostrel {
namespace {

constexpr std::size_t kFewestSlots = 64;

}  // namespace

void SessionOwners::keep(std::size_t sessions) {
  areKept_ = true;
  std::size_t slots = kFewestSlots;
  while (3 * slots < 4 * sessions) slots *= 2;
  resize(slots);
}

void SessionOwners::enter(ReporterID id, const Owner& owner) {
  if (!areKept_ || id == kNoReporter) return;
  if (4 * (used_ + 1) > 3 * slots_.size()) resize(2 * slots_.size());
  Slot& slot = slots_[slotOf(id)];
  if (slot.owner == nullptr) {
    slot = {id, &owner};
    ++used_;
    return;
  }
  const Owner* later = &owner;
  if (later->connection < slot.owner->connection) std::swap(later, slot.owner);
  later_[{id, later->connection}] = later;
}

void SessionOwners::remove(ReporterID id, const Owner& owner) {
  if (used_ == 0) return;
  const std::size_t at = slotOf(id);
  if (slots_[at].owner != &owner) {
    later_.erase({id, owner.connection});
    return;
  }
  const auto next = later_.lower_bound({id, 0});
  if (next != later_.end() && next->first.first == id) {
    slots_[at].owner = next->second;
    later_.erase(next);
    return;
  }
  vacate(at);
  if (slots_.size() > kFewestSlots && 8 * used_ < slots_.size()) {
    resize(slots_.size() / 2);
  }
}

// Those behind the gap move up, as far as that brings none before its home.
void SessionOwners::vacate(std::size_t slot) {
  const std::size_t mask = slots_.size() - 1;
  std::size_t gap = slot;
  for (std::size_t at = after(gap); slots_[at].owner != nullptr; at = after(at)) {
    const bool mayMove = ((at - home(slots_[at].id)) & mask) >= ((at - gap) & mask);
    if (!mayMove) continue;
    slots_[gap] = slots_[at];
    gap = at;
  }
  slots_[gap] = {};
  --used_;
}

void SessionOwners::resize(std::size_t slots) {
  std::vector<Slot> old(std::max(slots, kFewestSlots));
  std::swap(old, slots_);
  for (const Slot& slot : old) {
    if (slot.owner != nullptr) slots_[slotOf(slot.id)] = slot;
  }
}

}  // namespace ostrel
