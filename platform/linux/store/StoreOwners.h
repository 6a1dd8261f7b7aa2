#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "platform/linux/store/StoreRows.h"

struct sqlite3;

namespace ostrel {

class StoreStatement;

/// Whose the rows of a store are, so that whoever floods it loses rows of their own and
/// nobody else's. The table `row_owners` has a row for rows in a row of one user's, so
/// that a batch of them costs next to nothing; `owner_bytes` says what each user has.
/// On the connection of a StoreDatabase; all that writes is inside its transaction.
/// Calls give SQLite's codes.
class StoreOwners {
 public:
  /// Makes the tables.
  static const char* const kSchema;
  /// For a store that had none: what it holds is nobody's.
  static const char* const kDisownAll;

  StoreOwners();
  ~StoreOwners();

  int prepare(sqlite3* connection);
  /// Before the connection is closed.
  void release();

  /// A row was inserted, whose texts have so many bytes.
  void note(RowKind kind, std::int64_t id, std::int64_t user, std::size_t bytes);
  /// Writes what was noted.
  int write();
  /// It was not to be.
  void forgetNoted();

  /// Removes of each kind up to `rows` of the oldest rows of the user who has most bytes.
  /// The newest row of each kind stays, and sessions that have not ended or have messages
  /// of that user. `removed` grows, unless nobody has anything.
  int removeOfLargest(std::int64_t rows, std::int64_t& removed);

  /// Forgets whose the oldest rows were that are not there any more.
  int forgetRemoved();

 private:
  struct OwnedRows {
    RowKind kind{};
    std::int64_t first = 0;  // IDs.
    std::int64_t last = 0;
    std::int64_t user = 0;
    std::int64_t bytes = 0;
  };
  struct Statements;

  int removeOf(std::int64_t user, RowKind kind, std::int64_t rows, std::int64_t& removed);
  int removeSessionsOf(std::int64_t user, std::int64_t rows, std::int64_t& removed);
  int forgetRemoved(RowKind kind);
  // SQLITE_ROW with what is found, else none was.
  int newestOf(RowKind kind, std::int64_t& id);
  int oldestOf(std::int64_t user, RowKind kind, std::int64_t after, OwnedRows& rows);
  static void read(StoreStatement& statement, RowKind kind, OwnedRows& rows);
  // Of `rows` those from `first` on are left; with so many bytes.
  int keepFrom(const OwnedRows& rows, std::int64_t first);
  int keep(const OwnedRows& rows, std::int64_t first, std::int64_t bytes);
  int drop(const OwnedRows& rows);

  std::unique_ptr<Statements> statements_;
  sqlite3* connection_ = nullptr;
  std::vector<OwnedRows> noted_;
  std::array<std::size_t, kRowKinds> lastOfKind_{};  // In `noted_`, from 1.
  // Of the largest owner: the sessions that may not go yet are looked at again after all
  // others.
  std::int64_t sessionsLookedAt_ = INT64_MIN;
};

}  // namespace ostrel
