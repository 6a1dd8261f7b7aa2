// Open addressing: an ID stands in its home slot or, when that is taken, in the first
// free one after it. A slot that is vacated is filled by the next ID that would rather
// be there, so that a search may end at a free slot. Between three eighths and three
// quarters of the slots are in use while the table grows.
#include "Statistics/Service/OstrelReportingSessionIndex.h"

#include <algorithm>
#include <memory>
#include <utility>

namespace ostrel {
namespace {

constexpr std::size_t kFewestSlots = 16;

// The system puts the stack and code at another place in each process.
std::uint64_t makeSeed() {
  static const char place = 0;
  const char here = 0;
  return reinterpret_cast<std::uintptr_t>(&place) * 0x9E3779B97F4A7C15 ^
         reinterpret_cast<std::uintptr_t>(&here);
}

}  // namespace

OstrelReportingSessionIndex::OstrelReportingSessionIndex()
    : seed_(makeSeed()), slots_(kFewestSlots) {}

std::size_t OstrelReportingSessionIndex::home(ReporterID reporterID) const {
  std::uint64_t hash = static_cast<std::uint64_t>(reporterID) ^ seed_;
  hash = (hash ^ (hash >> 32)) * 0xD6E8FEB86659FD93;
  hash = (hash ^ (hash >> 32)) * 0xD6E8FEB86659FD93;
  return (hash ^ (hash >> 32)) & (slots_.size() - 1);
}

// Its slot, or the free one where it would stand.
std::size_t OstrelReportingSessionIndex::slotOf(ReporterID reporterID) const {
  std::size_t at = home(reporterID);
  while (slots_[at].first.session != nullptr && slots_[at].reporterID != reporterID) {
    at = next(at);
  }
  return at;
}

void OstrelReportingSessionIndex::enter(ReporterID reporterID, const Owner& owner) {
  if (4 * (used_ + 1) > 3 * slots_.size()) resize(2 * slots_.size());
  Slot& slot = slots_[slotOf(reporterID)];
  if (slot.first.session == nullptr) {
    slot = {reporterID, owner};
    ++used_;
    return;
  }
  if (slot.first.client == owner.client) {
    slot.first = owner;
    return;
  }
  Owner later = owner;
  if (later.registration < slot.first.registration) std::swap(slot.first, later);
  auto& owners = laterOwners_[reporterID];
  const auto place = std::lower_bound(
      owners.begin(), owners.end(), later,
      [](const Owner& a, const Owner& b) { return a.registration < b.registration; });
  if (place != owners.end() && place->client == later.client) {
    *place = later;
  } else {
    owners.insert(place, later);
  }
}

void OstrelReportingSessionIndex::remove(ReporterID reporterID,
                                         const OstrelReportingServerInstance& client) {
  const std::size_t at = slotOf(reporterID);
  Slot& slot = slots_[at];
  if (slot.first.session == nullptr) return;
  const bool isFirst = slot.first.client == &client;
  const auto found = laterOwners_.find(reporterID);
  if (found == laterOwners_.end()) {
    if (isFirst) vacate(at);
    return;
  }
  auto& owners = found->second;
  if (isFirst) {
    slot.first = owners.front();
    owners.erase(owners.begin());
  } else {
    std::erase_if(owners, [&](const Owner& owner) { return owner.client == &client; });
  }
  if (owners.empty()) laterOwners_.erase(found);
}

// Each ID that follows without a gap moves down if that brings it towards its home.
void OstrelReportingSessionIndex::vacate(std::size_t at) {
  const std::size_t mask = slots_.size() - 1;
  for (std::size_t from = next(at); slots_[from].first.session != nullptr;
       from = next(from)) {
    const std::size_t distance = (from - home(slots_[from].reporterID)) & mask;
    if (distance < ((from - at) & mask)) continue;
    slots_[at] = slots_[from];
    at = from;
  }
  slots_[at] = Slot();
  --used_;
  if (slots_.size() > kFewestSlots && 8 * used_ < slots_.size()) {
    resize(slots_.size() / 2);
  }
}

void OstrelReportingSessionIndex::resize(std::size_t slots) {
  std::vector<Slot> old(slots);
  old.swap(slots_);
  for (const Slot& slot : old) {
    if (slot.first.session != nullptr) slots_[slotOf(slot.reporterID)] = slot;
  }
}

}  // namespace ostrel
