#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"
#include "platform/FetchAhead.h"

namespace ostrel {

class OstrelReportingServerInstance;
class OstrelReportingSession;

/// Finds the session of an ID among those of all registered clients.
///
/// Each message asks it, so that it is made for that: a row of slots in which an ID is
/// found with one look at memory nearly always, whatever the number of sessions, and
/// four IDs in a row with the same look. That several clients have a session under one
/// ID is rare; all but the first of them stand aside.
class OstrelReportingSessionIndex {
 public:
  /// A client and its session under the ID. Both are the client's to keep alive.
  struct Owner {
    std::uint64_t registration;  // Of the client; the lowest goes first.
    OstrelReportingServerInstance* client;
    OstrelReportingSession* session;
  };

  OstrelReportingSessionIndex();

  /// Enters `owner`, in the place of what its client had under the ID.
  void enter(ReporterID reporterID, const Owner& owner);

  /// Takes what the client has under the ID out; nothing happens when it is not there.
  void remove(ReporterID reporterID, const OstrelReportingServerInstance& client);

  /// The session of the client that registered first; none without any.
  OstrelReportingSession* find(ReporterID reporterID) const {
    return slots_[slotOf(reporterID)].session;
  }
  /// Asks for the memory that `find` will look at.
  void fetchAhead(ReporterID reporterID) const {
    fetchToRead(&slots_[home(reporterID)], sizeof(Slot));
  }
  /// The client of what `find` finds.
  OstrelReportingServerInstance* clientOf(ReporterID reporterID) const {
    return bearers_[slotOf(reporterID)].client;
  }

 private:
  struct Slot {
    ReporterID reporterID{};
    OstrelReportingSession* session = nullptr;  // None: a free slot.
  };
  // Beside a slot: what only changes ask for.
  struct Bearer {
    std::uint64_t registration = 0;
    OstrelReportingServerInstance* client = nullptr;
  };

  std::size_t home(ReporterID reporterID) const;
  std::size_t next(std::size_t at) const { return (at + 1) & (slots_.size() - 1); }
  /// Its slot, or the free one where it would stand.
  std::size_t slotOf(ReporterID reporterID) const {
    std::size_t at = home(reporterID);
    while (slots_[at].session != nullptr && slots_[at].reporterID != reporterID) {
      at = next(at);
    }
    return at;
  }
  Owner ownerAt(std::size_t at) const;
  void put(std::size_t at, ReporterID reporterID, const Owner& owner);
  void vacate(std::size_t at);
  void resize(std::size_t slots);

  std::size_t used_ = 0;
  std::vector<Slot> slots_;  // A power of two.
  std::vector<Bearer> bearers_;
  std::map<ReporterID, std::vector<Owner>> laterOwners_;  // By registration.
};

}  // namespace ostrel
