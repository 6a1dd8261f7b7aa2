// Open addressing: an ID stands in its home slot or, when that is taken, in the first
// free one after it. A slot that is vacated is filled by the next ID that would rather
// be there, so that a search may end at a free slot. Between three eighths and three
// quarters of the slots are in use while the table grows.
#include "Statistics/Service/OstrelReportingSessionIndex.h"

#include <algorithm>

#include "platform/SpreadHash.h"

namespace ostrel {
namespace {

constexpr std::size_t kFewestSlots = 16;

// So many IDs in a row have homes in a row: slots that share a line of the cache.
constexpr std::uint64_t kRow = 4;

}  // namespace

OstrelReportingSessionIndex::OstrelReportingSessionIndex()
    : slots_(kFewestSlots), bearers_(kFewestSlots) {}

// Clients count their sessions, so that IDs in a row are asked for in a row.
std::size_t OstrelReportingSessionIndex::home(ReporterID reporterID) const {
  const auto id = static_cast<std::uint64_t>(reporterID);
  return (SpreadHash()(id / kRow) * kRow + id % kRow) & (slots_.size() - 1);
}

OstrelReportingSessionIndex::Owner OstrelReportingSessionIndex::ownerAt(
    std::size_t at) const {
  return {bearers_[at].registration, bearers_[at].client, slots_[at].session};
}

void OstrelReportingSessionIndex::put(std::size_t at, ReporterID reporterID,
                                      const Owner& owner) {
  slots_[at] = {reporterID, owner.session};
  bearers_[at] = {owner.registration, owner.client};
}

void OstrelReportingSessionIndex::enter(ReporterID reporterID, const Owner& owner) {
  if (4 * (used_ + 1) > 3 * slots_.size()) resize(2 * slots_.size());
  const std::size_t at = slotOf(reporterID);
  const Owner first = ownerAt(at);
  if (first.session == nullptr || first.client == owner.client) {
    if (first.session == nullptr) ++used_;
    put(at, reporterID, owner);
    return;
  }
  Owner later = owner;
  if (later.registration < first.registration) {
    put(at, reporterID, owner);
    later = first;
  }
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
  if (slots_[at].session == nullptr) return;
  const bool isFirst = bearers_[at].client == &client;
  const auto found = laterOwners_.find(reporterID);
  if (found == laterOwners_.end()) {
    if (isFirst) vacate(at);
    return;
  }
  auto& owners = found->second;
  if (isFirst) {
    put(at, reporterID, owners.front());
    owners.erase(owners.begin());
  } else {
    std::erase_if(owners, [&](const Owner& owner) { return owner.client == &client; });
  }
  if (owners.empty()) laterOwners_.erase(found);
}

// Each ID that follows without a gap moves down if that brings it towards its home.
void OstrelReportingSessionIndex::vacate(std::size_t at) {
  const std::size_t mask = slots_.size() - 1;
  for (std::size_t from = next(at); slots_[from].session != nullptr; from = next(from)) {
    const std::size_t distance = (from - home(slots_[from].reporterID)) & mask;
    if (distance < ((from - at) & mask)) continue;
    put(at, slots_[from].reporterID, ownerAt(from));
    at = from;
  }
  put(at, ReporterID{}, Owner{});
  --used_;
  if (slots_.size() > kFewestSlots && 8 * used_ < slots_.size()) {
    resize(slots_.size() / 2);
  }
}

void OstrelReportingSessionIndex::resize(std::size_t slots) {
  std::vector<Slot> oldSlots(slots);
  std::vector<Bearer> oldBearers(slots);
  oldSlots.swap(slots_);
  oldBearers.swap(bearers_);
  for (std::size_t i = 0; i < oldSlots.size(); ++i) {
    const auto& [reporterID, session] = oldSlots[i];
    if (session == nullptr) continue;
    put(slotOf(reporterID), reporterID,
        {oldBearers[i].registration, oldBearers[i].client, session});
  }
}

}  // namespace ostrel
