#pragma once

#include <cstddef>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"

namespace ostrel {

/// IDs of sessions, in 11 to 21 bytes for each of the most that there were: a connection
/// may have 100,000.
class ReporterIDSet {
 public:
  std::size_t size() const { return size_; }
  bool contains(ReporterID id) const;
  /// False when it is there already.
  bool insert(ReporterID id);
  /// False when it is not there.
  bool erase(ReporterID id);
  /// Calls `use` with each but 0.
  template <typename Use>
  void forEach(const Use& use) const {
    for (const ReporterID id : slots_) {
      if (id != ReporterID{0}) use(id);
    }
  }

 private:
  std::size_t home(ReporterID id) const;
  std::size_t after(std::size_t slot) const { return (slot + 1) & (slots_.size() - 1); }
  /// The slot that holds `id`, or the free one where it would stand.
  std::size_t find(ReporterID id) const;
  void grow();

  // Open addressing: an ID stands at its home or in one of the slots behind it,
  // without a gap. The ID of a free slot is 0; whether 0 is in the set stands apart.
  std::vector<ReporterID> slots_;
  std::size_t size_ = 0;
  bool hasZero_ = false;
};

}  // namespace ostrel
