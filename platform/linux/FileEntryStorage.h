#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

#include "platform/EntryStorage.h"
#include "platform/WorkQueue.h"
#include "platform/linux/SpillFile.h"

namespace ostrel {

/// Lists begin in memory. What is too much for it goes to a file without a name in
/// `directory`, one for all lists, and comes back from there piece by piece. When the
/// file cannot be written, entries stay in memory as far as that of all lists goes.
class FileEntryStorage final : public EntryStorage {
 public:
  struct Limits {
    std::size_t listBytesInMemory;
    /// Of all lists together; what each list begins with is always there.
    std::size_t bytesInMemory;
    /// How long the file is left alone after an error.
    std::chrono::milliseconds pauseOfFile;
    /// Of `bytesInMemory`: what the file gets together with what follows.
    std::size_t bytesOfFile = 0;

    /// Those of `platform/linux/Limits.h`.
    static Limits ofService();
  };

  /// `disposal` gives the file's room on the disk back, and outlives the storage, though
  /// not the lists; none: whoever releases a list does.
  explicit FileEntryStorage(std::string directory, ConcurrentQueue* disposal = nullptr);
  FileEntryStorage(std::string directory, const Limits& limits, const SpillCalls& calls,
                   ConcurrentQueue* disposal = nullptr);
  ~FileEntryStorage() override;

  std::unique_ptr<StoredEntries> makeEntries(ReporterID session) override;

  // Any thread.
  /// Entries that were not taken, since the service began.
  std::uint64_t refusedEntries() const;
  /// What the lists take in memory now.
  std::size_t bytesInMemory() const;
  /// Whether there is a file now.
  bool hasFile() const;

 private:
  struct State;
  class Memory;
  class Entries;
  class EntriesSnapshot;

  const std::shared_ptr<State> state_;
};

}  // namespace ostrel
