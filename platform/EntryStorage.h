#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <span>

#include "Statistics/OstrelReportingTypes.h"
#include "platform/ValueBuffer.h"

namespace ostrel {

/// The entries of one list in the order in which they were appended: bytes that mean
/// nothing here. One thread at a time, its snapshots aside.
class StoredEntries {
 public:
  using Bytes = std::span<const std::uint8_t>;
  /// Takes some entries, one after the other and each of them whole. Valid during the
  /// call.
  using RunCallback = std::function<void(Bytes entries)>;

  /// The entries as they were when it was taken. Outlives them, and is read on any
  /// thread while others are appended.
  class Snapshot {
   public:
    virtual ~Snapshot() = default;

    /// Calls `callback` until it has had all entries in order; as often as it is
    /// asked. False, with an error logged, when it came to an entry that cannot be
    /// read: it and all behind it were left out.
    virtual bool forEachRun(const RunCallback& callback) const = 0;
  };

  virtual ~StoredEntries() = default;

  /// Appends the entry that consists of `parts`, of which there is a byte at least.
  /// `account`, which may be none, is asked to keep as many bytes, and has them back
  /// when the list goes.
  /// False when the account or the storage refuses; that was counted then, and the
  /// list's first was logged as an error. Later entries may be taken again.
  virtual bool append(std::span<const Bytes> parts,
                      const std::shared_ptr<PayloadAccount>& account) = 0;

  virtual std::shared_ptr<const Snapshot> snapshot() = 0;
};

/// Keeps what sessions collect until they stop. Any thread.
class EntryStorage {
 public:
  virtual ~EntryStorage() = default;

  /// An empty list. `session` is the one that log lines name.
  virtual std::unique_ptr<StoredEntries> makeEntries(ReporterID session) = 0;
};

}  // namespace ostrel
