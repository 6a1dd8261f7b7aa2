#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "Statistics/Support/Monitored.h"
#include "Statistics/Support/MutableDictionary.h"
#include "platform/Value.h"

namespace ostrel {

/// What a session collects for its summary: dictionaries, in order. Messages
/// stand as one-entry dictionaries {message identifier: payload}, orientation
/// changes as two-entry ones.
///
/// Entries are kept encoded, one after the other in large chunks, so that a
/// message costs its own bytes and its identifier's and no allocation.
class OstrelReportingAggregatedPayloads {
 public:
  using EntryCallback = std::function<void(ValueView entry)>;

  /// The entries as they were when it was taken; what is appended later does
  /// not show. Shares the list's memory. May be read on another thread.
  class Snapshot {
   public:
    /// Calls `callback` once for each entry, in order.
    void forEach(const EntryCallback& callback) const;

   private:
    friend class OstrelReportingAggregatedPayloads;
    struct Part {
      std::shared_ptr<const std::uint8_t[]> bytes;
      std::size_t size;
    };
    std::vector<Dictionary> front_;
    std::vector<Part> parts_;
  };

  /// Appends {`identifier`: `payload`}.
  void append(std::string_view identifier, const Dictionary& payload);
  void append(const Dictionary& entry);

  /// Puts a reference to `entry` before all others: what is merged into it later
  /// shows in snapshots that are taken later.
  void insertFront(std::shared_ptr<const MutableDictionary> entry);

  bool empty() const { return size_ == 0; }
  std::size_t size() const { return size_; }
  Snapshot snapshot() const;

 private:
  struct Chunk {
    std::shared_ptr<std::uint8_t[]> bytes;
    std::size_t capacity;
    std::size_t used = 0;
  };

  std::uint8_t* room(std::size_t bytes);

  std::size_t size_ = 0;
  std::vector<std::shared_ptr<const MutableDictionary>> front_;  // Latest last.
  std::vector<Chunk> chunks_;
  std::string head_;  // Of the last message's entry; keeps its memory for the next.
};

/// The list with its own monitor.
using AggregatedPayloadData = Monitored<OstrelReportingAggregatedPayloads>;

}  // namespace ostrel
