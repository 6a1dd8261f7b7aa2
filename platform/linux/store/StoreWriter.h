#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/linux/Limits.h"
#include "platform/linux/store/StoreCounters.h"
#include "platform/linux/store/StoreDatabase.h"
#include "platform/linux/store/StoreOperation.h"

namespace ostrel {

/// What the store keeps.
struct StoreRetention {
  std::int64_t bytes = limits::kStoreBytes;
  std::chrono::microseconds age = limits::kStoreAge;
  /// Of the disk, in percent, that the store does not grow into as long as it has so
  /// many bytes.
  std::int64_t percentKeptFree = limits::kDiskPercentKeptFree;
  std::int64_t bytesInNeed = limits::kStoreBytesInNeed;
  /// Of the texts of one row; beyond it the row is lost.
  std::size_t rowBytes = limits::kStoreRowBytes;
};

/// Writes operations to the database and bears its faults. What was handed over
/// is kept until a commit made it durable; after a fault it is written again.
/// One thread at a time.
class StoreWriter {
 public:
  StoreWriter(std::string path, const char* vfs, const StoreRetention& retention,
              StoreCounters& counters, StatusCounts otherCounts = nullptr);

  /// Opens the database, or opens it again, and writes what is not durable yet. A
  /// damaged file is set aside and a new one begun.
  void recover();

  /// What keeps the store from being used; none when nothing does.
  const std::optional<StoreFault>& fault() const { return fault_; }

  /// Takes operations over and, unless there is a fault, writes them into the open
  /// transaction.
  void add(std::vector<StoreBatch> batches);

  /// Makes what was added durable, calls the completions of its flushes and gives
  /// the batches back, emptied. Nothing of this on a fault.
  std::vector<StoreBatch> commit();

  /// Whether there is anything to commit.
  bool hasUncommitted() const { return !pending_.empty(); }
  /// Of payloads.
  std::size_t uncommittedBytes() const { return uncommittedBytes_; }

  /// Calls the completions of the flushes that wait with the fault's error.
  void failFlushes();

  /// Gives up the oldest operations so that at most `count` are kept. Only during
  /// a fault.
  void keepAtMost(std::size_t count);

  /// As a message for clients.
  static ErrorObject errorOf(const StoreFault& fault);

  void close() { database_.close(); }

 private:
  using Result = StoreDatabase::Result;

  struct Position {
    std::size_t batch = 0;
    std::size_t operation = 0;
  };

  class RowTexts;

  // A commit that failed and may have been made all the same.
  struct DoubtfulCommit {
    std::int64_t fingerprint;  // Of the store with it.
    std::size_t batches;       // At the front of `pending_`.
    std::vector<std::pair<StoreSession*, std::int64_t>> rows;
  };

  Result openOrReplace();
  Result setAside(const StoreFault& fault);
  Result resolveDoubt();
  void leaveOutOfDoubt(std::size_t batches);
  std::vector<StoreBatch> takeDone(std::size_t batches);
  Result writePending();
  Result write(StoreOperation& operation);
  Result write(StoreOperation& operation, SessionMessage& message);
  Result write(StoreOperation& operation, const LoneMessage& message);
  Result write(StoreOperation& operation, AnalyticsEvent& event);
  Result write(StoreOperation& operation, const PowerEvent& event);
  /// Completes a message's row, whose other columns are set, and adds it.
  template <typename Message>
  void addRow(StoreOperation& operation, const Message& message, RowTexts& texts,
              MessageRow& row);
  void lose(StoreOperation& operation, std::atomic<std::uint64_t>& counter);
  Result insertSession(StoreSession& session);
  Result writeRows(bool evenIfFew);
  Result writeStatus();
  Result removeOld();
  Result makeRoom(std::int64_t rows, std::int64_t& removed);
  Result readInterest();
  bool wants(const std::string& name);
  void fail(const StoreFault& fault);
  void rollback();
  static void completeFlushes(std::vector<StoreBatch>& batches,
                              const std::optional<ErrorObject>& error);

  StoreDatabase database_;
  const StoreRetention retention_;
  StoreCounters& counters_;
  const StatusCounts otherCounts_;

  std::optional<StoreFault> fault_;
  std::string loggedFault_;
  std::uint64_t file_ = 0;  // Counts the files opened, so that rows of others are known.

  std::vector<StoreBatch> pending_;
  Position written_;  // What comes before it is in the open transaction.
  bool isInTransaction_ = false;
  std::int64_t fingerprintBefore_ = 0;  // Of the store, before the transaction.
  std::size_t uncommittedBytes_ = 0;
  std::vector<StoreSession*> uncommittedSessions_;
  std::optional<DoubtfulCommit> doubt_;
  RowBatch rows_;
  std::string text_;

  bool wantsAll_ = false;
  std::vector<std::string> wantedPatterns_;
  std::unordered_map<std::string, bool> wantedNames_;
  std::uint64_t writtenStatus_ = 0;
  std::int64_t newestTime_ = 0;    // Of the operations, as it is written.
  std::int64_t nextAgeCheck_ = 0;  // On the same clock.
};

}  // namespace ostrel
