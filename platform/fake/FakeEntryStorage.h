#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <memory>

#include "platform/EntryStorage.h"

namespace ostrel {

/// Entries in memory, read back in runs of a few. Takes all of them until it is told
/// to stop.
class FakeEntryStorage final : public EntryStorage {
 public:
  std::unique_ptr<StoredEntries> makeEntries(ReporterID session) override;

  /// Each list takes this many bytes from now on, what it has included.
  void setMostBytesOfList(std::size_t bytes) { state_->mostBytes = bytes; }
  /// After so many runs from now on, none can be read.
  void setReadableRuns(std::uint64_t runs) { state_->readableRuns = runs; }

  std::uint64_t refusedEntries() const { return state_->refused; }

 private:
  friend class FakeEntries;
  struct State {
    std::atomic<std::size_t> mostBytes{std::numeric_limits<std::size_t>::max()};
    std::atomic<std::uint64_t> readableRuns{std::numeric_limits<std::uint64_t>::max()};
    std::atomic<std::uint64_t> refused{0};
  };

  const std::shared_ptr<State> state_ = std::make_shared<State>();
};

}  // namespace ostrel
