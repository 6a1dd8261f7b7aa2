#pragma once

#include <sys/types.h>

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/store/StoreOwners.h"
#include "platform/linux/store/StoreRows.h"

struct sqlite3;

namespace ostrel {

/// Why the database could not do what it was asked.
struct StoreFault {
  enum class Kind {
    kTransient,  // May pass: full, locked, read-only, an error of the disk.
    kDamaged,    // The file is no store, or no longer one.
    kNewer,      // A later version wrote it; it is not touched.
  };

  Kind kind = Kind::kTransient;
  int code = 0;  // SQLite's.
  std::string description;
};

/// The database file: its place, its schema and what is written to it. One
/// thread at a time. Every operation gives none when it succeeded.
class StoreDatabase {
 public:
  using Result = std::optional<StoreFault>;

  /// `vfs` names the layer below SQLite; none is the system's.
  StoreDatabase(std::string path, const char* vfs);
  ~StoreDatabase();
  StoreDatabase(const StoreDatabase&) = delete;
  StoreDatabase& operator=(const StoreDatabase&) = delete;

  /// Opens the file, or makes it, with the directories above it. Checks that it
  /// is sound and of this version.
  Result open();
  void close();
  bool isOpen() const { return connection_ != nullptr; }
  /// Whether the last `open` made the store or found another file than the one
  /// before it.
  bool isAnother() const { return isAnother_; }

  /// Whether the path still names the file that is open.
  bool isInPlace() const;

  /// Closes the file, renames it to "PATH.damaged-TIME" and logs why. The last two
  /// files set aside are kept.
  Result setAside(std::string_view reason);

  Result begin();
  Result commit();
  void rollback();

  struct SessionRow {
    std::optional<std::int64_t> reporterID;
    std::optional<std::string_view> hierarchyToken;
    std::string_view sessionInfo;
    std::string_view userInfo;
    std::int64_t startedAt = 0;
    std::int64_t user = PayloadAccount::kNobody;
  };
  Result insertSession(const SessionRow& row, std::int64_t& id);
  Result setFlushedAt(std::int64_t session, std::int64_t time);
  Result setEndedAt(std::int64_t session, std::int64_t time);

  struct PowerRow {
    std::int32_t clientID = 0;
    std::string_view name;
    std::string_view event;
    std::optional<std::string_view> attachment;
    std::int64_t createdAt = 0;
    std::int64_t user = PayloadAccount::kNobody;
  };
  Result insertPowerEvent(const PowerRow& row);

  Result insertRows(const RowBatch& rows);

  /// Notes whose the rows are that were inserted. The last before a commit.
  Result noteOwners();

  /// In bytes.
  struct Room {
    std::int64_t used = 0;  // Of the file: what holds something,
    std::int64_t free = 0;  // and what does not any more.
    std::int64_t diskAvailable = 0;
    std::int64_t diskBytes = 0;
  };
  Result readRoom(Room& room);
  /// Whether less than so much of a disk is available.
  static bool isScarce(std::int64_t available, std::int64_t bytes, std::int64_t percent) {
    return available < bytes / 100 * percent;
  }

  /// As StoreOwners::removeOfLargest.
  Result removeOfLargestOwner(std::int64_t rows, std::int64_t& removed);

  /// Removes of each kind up to `rows` of the oldest rows, only those from before
  /// the time `before` if there is one; sessions, when nothing that is kept is older.
  /// The newest of each kind stays, so that no id is given twice. `removed` grows.
  Result removeOldest(std::int64_t rows, std::optional<std::int64_t> before,
                      std::int64_t& removed);

  /// After `removeOldest`.
  Result forgetOwnersOfRemoved();

  Result setStatus(std::string_view key, std::int64_t value);
  /// Adds to a value of the status that outlives the process.
  Result addToStatus(std::string_view key, std::int64_t value);

  /// Gives the store its name, unless it has one.
  Result nameStore();

  /// A number that differs before and after any insertion.
  Result readFingerprint(std::int64_t& fingerprint);

  /// The patterns of the analytics events that are wanted, when they may have
  /// changed since the last call. Inside a transaction.
  Result readInterestIfChanged(std::optional<std::vector<std::string>>& patterns);

  /// Whether `text` matches a pattern with `*`, `?` and `[...]`.
  static bool matches(const std::string& pattern, const std::string& text);

 private:
  struct Statements;

  Result tryToOpen();
  Result makeFile();
  Result clearCompanions();
  Result checkHeader(int file);
  Result connect();
  void keepLogAtClose(bool isKept);
  Result checkVersion(std::int64_t& version);
  Result makeSchema();
  Result upgrade();
  Result runAtOnce(std::initializer_list<const char*> steps);
  Result checkContent();
  Result prepareStatements();
  std::string nameForSetAside() const;
  void removeOldestSetAside();

  Result run(const char* sql);
  Result readInteger(const char* sql, std::int64_t& value);
  Result readInteger(StoreStatement& statement, std::string_view action,
                     std::int64_t& value);
  Result readText(const char* sql, std::string& value);
  Result resultOf(int code, std::string_view action) const;
  StoreFault fault(int code, std::string_view action) const;

  const std::string path_;
  const char* const vfs_;
  sqlite3* connection_ = nullptr;
  bool isAnother_ = false;
  dev_t device_ = 0;
  ino_t inode_ = 0;
  const RowBatch* rows_ = nullptr;  // What the row tables show.
  std::int64_t dataVersion_ = -1;
  StoreOwners owners_;
  std::unique_ptr<Statements> statements_;
};

}  // namespace ostrel
