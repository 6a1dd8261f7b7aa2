#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <utility>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"
#include "platform/FetchAhead.h"
#include "platform/SpreadHash.h"

namespace ostrel {

/// Whose session an ID means: of all clients that have one under it, the one's that
/// connected first, since it is the one that requests find. Empty until there were
/// clients of two users; nobody else needs to know. One thread.
class SessionOwners {
 public:
  /// A client. Whoever enters one keeps it until the last of its sessions is removed.
  struct Owner {
    std::uint64_t connection;  // The lower, the earlier.
    std::uint32_t user;
  };

  bool areKept() const { return areKept_; }
  /// From now on, those of `sessions` sessions first, which are to be entered.
  void keep(std::size_t sessions);

  /// One that was not entered before. ID 0 means no session.
  void enter(ReporterID id, const Owner& owner);
  /// Nothing happens when it was not entered.
  void remove(ReporterID id, const Owner& owner);

  /// None where there is no session.
  const Owner* find(ReporterID id) const {
    return slots_.empty() ? nullptr : slots_[slotOf(id)].owner;
  }
  /// Asks for the memory that `find` will look at.
  void fetchAhead(ReporterID id) const {
    if (!slots_.empty()) fetchToRead(&slots_[home(id)], sizeof(Slot));
  }

  /// How many sessions there is room for.
  std::size_t slots() const { return slots_.size(); }

 private:
  struct Slot {
    ReporterID id{};
    const Owner* owner = nullptr;  // None: a free slot.
  };

  std::size_t home(ReporterID id) const { return SpreadHash()(id) & (slots_.size() - 1); }
  std::size_t after(std::size_t slot) const { return (slot + 1) & (slots_.size() - 1); }
  /// The slot of `id`, or the free one where it would stand.
  std::size_t slotOf(ReporterID id) const {
    std::size_t slot = home(id);
    while (slots_[slot].owner != nullptr && slots_[slot].id != id) slot = after(slot);
    return slot;
  }
  void vacate(std::size_t slot);
  void resize(std::size_t slots);

  bool areKept_ = false;
  // Open addressing: an ID stands at its home or in one of the slots behind it, without a
  // gap. A power of two.
  std::vector<Slot> slots_;
  std::size_t used_ = 0;
  // Those behind the first of an ID, by their connection.
  std::map<std::pair<ReporterID, std::uint64_t>, const Owner*> later_;
};

}  // namespace ostrel
