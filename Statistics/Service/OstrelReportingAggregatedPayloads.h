#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"
#include "Statistics/Support/Monitored.h"
#include "Statistics/Support/MutableDictionary.h"
#include "platform/EntryStorage.h"
#include "platform/Value.h"

namespace ostrel {

/// What a session collects for its summary: dictionaries, in order. Messages
/// stand as one-entry dictionaries {message identifier: payload}, orientation
/// changes as two-entry ones.
///
/// Entries are handed to the storage encoded, so that a message costs its own bytes
/// and its identifier's and no allocation. An entry that the storage refuses is not
/// in the list; the storage says so.
class OstrelReportingAggregatedPayloads {
 public:
  using EntryCallback = std::function<void(ValueView entry)>;

  /// The entries as they were when it was taken; what is appended later does
  /// not show. Shares what the list keeps. May be read on another thread.
  class Snapshot {
   public:
    /// Calls `callback` once for each entry, in order. An entry is valid during the
    /// call. False: the storage could not read all, and the walk ended there.
    bool forEach(const EntryCallback& callback) const;

   private:
    friend class OstrelReportingAggregatedPayloads;
    std::vector<Dictionary> front_;
    std::shared_ptr<const StoredEntries::Snapshot> stored_;
    struct Reference {
      std::size_t storedBefore;  // So many stored entries come before it.
      std::string identifier;
      Dictionary payload;
    };
    std::vector<Reference> references_;
  };

  /// `storage` outlives the list. `session` is the one that it belongs to.
  OstrelReportingAggregatedPayloads(EntryStorage& storage, ReporterID session)
      : storage_(storage), session_(session) {}

  /// Appends {`identifier`: `payload`}. A large payload that is nobody's, as a
  /// summary is, is kept by reference.
  void append(std::string_view identifier, const Dictionary& payload) {
    append(identifier, payload, payload.value().bytes());
  }
  /// The same for who knows the payload's bytes already: their end is found by a walk.
  void append(std::string_view identifier, const Dictionary& payload,
              StoredEntries::Bytes encoded);
  void append(const Dictionary& entry);

  /// Puts a reference to `entry` before all others: what is merged into it later
  /// shows in snapshots that are taken later.
  void insertFront(std::shared_ptr<const MutableDictionary> entry);

  bool empty() const { return size() == 0; }
  std::size_t size() const { return front_.size() + storedCount_ + references_.size(); }
  Snapshot snapshot() const;

 private:
  void store(std::span<const StoredEntries::Bytes> parts, const Dictionary& bearer);

  EntryStorage& storage_;
  const ReporterID session_;
  std::vector<std::shared_ptr<const MutableDictionary>> front_;  // Latest last.
  std::unique_ptr<StoredEntries> stored_;                        // None until the first.
  std::size_t storedCount_ = 0;
  std::vector<Snapshot::Reference> references_;
};

/// The list with its own monitor.
using AggregatedPayloadData = Monitored<OstrelReportingAggregatedPayloads>;

}  // namespace ostrel
