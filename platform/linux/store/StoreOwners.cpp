#include "platform/linux/store/StoreOwners.h"

#include <sqlite3.h>

#include <algorithm>
#include <map>
#include <optional>
#include <string>

#include "platform/linux/store/StoreStatement.h"

namespace ostrel {
namespace {

// What a row takes beside its texts, roughly.
constexpr std::size_t kRowBytes = 40;

// Of `row_owners`, for one commit: where users take turns each has a row for a row.
constexpr int kMostLookedAt = 2048;

// Of users who have most and of whose rows none may go.
constexpr int kMostUsersTried = 16;

// In the order of the kinds.
constexpr std::array<const char*, kRowKinds> kTables = {
    "telemetry_messages", "analytics_events", "power_events", "telemetry_sessions"};

std::size_t indexOf(RowKind kind) { return static_cast<std::size_t>(kind); }
std::int64_t numberOf(RowKind kind) { return static_cast<std::int64_t>(kind); }

// How many IDs from `first` to `last`; those of a store that somebody meddled with may
// be any.
std::uint64_t countOf(std::int64_t first, std::int64_t last) {
  return static_cast<std::uint64_t>(last) - static_cast<std::uint64_t>(first) + 1;
}

// As much of `bytes` as `part` is of `whole`.
std::int64_t partOf(std::int64_t bytes, std::uint64_t part, std::uint64_t whole) {
  if (whole == 0 || part >= whole) return bytes;
  return static_cast<std::int64_t>(
      static_cast<double>(bytes) *
      (static_cast<double>(part) / static_cast<double>(whole)));
}

}  // namespace

const char* const StoreOwners::kSchema = R"(
CREATE TABLE row_owners (
  kind INTEGER, first_id INTEGER, last_id INTEGER, user INTEGER, bytes INTEGER,
  PRIMARY KEY (kind, first_id)) WITHOUT ROWID;
CREATE INDEX row_owners_by_user ON row_owners (user, kind, first_id);
CREATE TABLE owner_bytes (user INTEGER PRIMARY KEY, bytes INTEGER);
)";

// The kinds share what the file takes.
const char* const StoreOwners::kDisownAll = R"(
INSERT INTO row_owners SELECT kind, first, last, -1, last - first + 1 FROM (
  SELECT 0 AS kind, min(id) AS first, max(id) AS last FROM telemetry_messages UNION ALL
  SELECT 1, min(id), max(id) FROM analytics_events UNION ALL
  SELECT 2, min(id), max(id) FROM power_events UNION ALL
  SELECT 3, min(id), max(id) FROM telemetry_sessions) WHERE first NOT NULL;
UPDATE row_owners SET bytes = CAST(1.0 * bytes / (SELECT total(bytes) FROM row_owners) *
  (SELECT (page_count - freelist_count) * page_size FROM pragma_page_count,
   pragma_freelist_count, pragma_page_size) AS INTEGER);
INSERT INTO owner_bytes SELECT -1, sum(bytes) FROM row_owners HAVING count(*) > 0;
)";

struct StoreOwners::Statements {
  struct OfKind {
    StoreStatement firstID;
    StoreStatement lastID;
    StoreStatement remove;
  };
  std::array<OfKind, kRowKinds> ofKind;
  StoreStatement sessionsLeft;
  StoreStatement note;
  StoreStatement addBytes;
  StoreStatement largest;
  StoreStatement oldestOfUser;
  StoreStatement oldestOfKind;
  StoreStatement keep;
  StoreStatement drop;
  StoreStatement timeOfOldestMessage;
};

StoreOwners::StoreOwners() = default;
StoreOwners::~StoreOwners() = default;

int StoreOwners::prepare(sqlite3* connection) {
  connection_ = connection;
  forgetNoted();
  auto made = std::make_unique<Statements>();
  int code = SQLITE_OK;
  const auto make = [&](StoreStatement& statement, const std::string& sql) {
    if (code == SQLITE_OK) code = statement.prepare(connection, sql.c_str());
  };
  for (std::size_t i = 0; i < kRowKinds; ++i) {
    Statements::OfKind& ofKind = made->ofKind[i];
    const std::string table = kTables[i];
    make(ofKind.firstID, "SELECT min(id) FROM " + table);
    make(ofKind.lastID, "SELECT max(id) FROM " + table);
    const bool areSessions = i == indexOf(RowKind::kSessions);
    make(ofKind.remove,
         "DELETE FROM " + table + " WHERE id BETWEEN ?1 AND ?2" +
             (areSessions ? " AND ended_at < ifnull(?3, ended_at + 1)" : ""));
  }
  make(made->sessionsLeft,
       "SELECT count(*) FROM telemetry_sessions WHERE id BETWEEN ?1 AND ?2");
  make(made->note,
       "INSERT OR REPLACE INTO row_owners (kind, first_id, last_id, user, bytes) VALUES "
       "(?, ?, ?, ?, ?)");
  make(made->addBytes,
       "INSERT INTO owner_bytes (user, bytes) VALUES (?1, max(0, ?2)) "
       "ON CONFLICT (user) DO UPDATE SET bytes = max(0, bytes + ?2)");
  make(made->largest,
       "SELECT user, bytes FROM owner_bytes WHERE bytes > 0 ORDER BY bytes DESC LIMIT 1");
  make(made->oldestOfUser,
       "SELECT first_id, last_id, user, bytes FROM row_owners WHERE user = ?1 AND "
       "kind = ?2 AND first_id > ?3 ORDER BY first_id LIMIT 1");
  make(made->oldestOfKind,
       "SELECT first_id, last_id, user, bytes FROM row_owners WHERE kind = ?1 "
       "ORDER BY first_id LIMIT 1");
  make(made->keep,
       "UPDATE OR REPLACE row_owners SET first_id = ?3, bytes = ?4 WHERE kind = ?1 AND "
       "first_id = ?2");
  make(made->drop, "DELETE FROM row_owners WHERE kind = ?1 AND first_id = ?2");
  make(made->timeOfOldestMessage,
       "SELECT created_at FROM row_owners LEFT JOIN telemetry_messages ON id = first_id "
       "WHERE user = ?1 AND kind = 0 ORDER BY first_id LIMIT 1");
  if (code == SQLITE_OK) statements_ = std::move(made);
  return code;
}

void StoreOwners::release() {
  statements_.reset();
  forgetNoted();
}

void StoreOwners::note(RowKind kind, std::int64_t id, std::int64_t user,
                       std::size_t bytes) {
  const auto rowBytes = static_cast<std::int64_t>(bytes + kRowBytes);
  std::size_t& last = lastOfKind_[indexOf(kind)];
  if (last != 0) {
    OwnedRows& rows = noted_[last - 1];
    if (rows.user == user && rows.last == id - 1) {
      rows.last = id;
      rows.bytes += rowBytes;
      return;
    }
  }
  noted_.push_back({kind, id, id, user, rowBytes});
  last = noted_.size();
}

void StoreOwners::forgetNoted() {
  noted_.clear();
  lastOfKind_ = {};
}

int StoreOwners::write() {
  std::map<std::int64_t, std::int64_t> bytesOfUsers;
  for (const OwnedRows& rows : noted_) {
    const int code = statements_->note.run(numberOf(rows.kind), rows.first, rows.last,
                                           rows.user, rows.bytes);
    if (code != SQLITE_OK) return code;
    bytesOfUsers[rows.user] += rows.bytes;
  }
  forgetNoted();
  for (const auto& [user, bytes] : bytesOfUsers) {
    if (const int code = statements_->addBytes.run(user, bytes)) return code;
  }
  return SQLITE_OK;
}

int StoreOwners::removeOfLargest(std::int64_t rows, std::int64_t& removed) {
  StoreStatement& largest = statements_->largest;
  const std::int64_t before = removed;
  for (int i = 0; i < kMostUsersTried && removed == before; ++i) {
    int code = largest.begin();
    const std::int64_t user = largest.integer(0);
    const std::int64_t bytes = largest.integer(1);
    largest.reset();
    if (code != SQLITE_ROW) return code;
    for (const RowKind kind :
         {RowKind::kMessages, RowKind::kAnalytics, RowKind::kPower}) {
      if ((code = removeOf(user, kind, rows, removed)) != SQLITE_OK) return code;
    }
    if ((code = removeSessionsOf(user, rows, removed)) != SQLITE_OK) return code;
    // Nothing may go of what it has: whoever has most beside it is next.
    if (removed == before &&
        (code = statements_->addBytes.run(user, -bytes)) != SQLITE_OK)
      return code;
  }
  return SQLITE_OK;
}

int StoreOwners::removeOf(std::int64_t user, RowKind kind, std::int64_t rows,
                          std::int64_t& removed) {
  Statements::OfKind& ofKind = statements_->ofKind[indexOf(kind)];
  std::int64_t newest = 0;
  int code = newestOf(kind, newest);
  if (code != SQLITE_ROW) return code;
  for (int i = 0; i < kMostLookedAt && rows > 0; ++i) {
    OwnedRows owned;
    code = oldestOf(user, kind, /*after=*/INT64_MIN, owned);
    if (code != SQLITE_ROW) return code;
    if (owned.first >= newest) return SQLITE_OK;
    std::int64_t end = std::max(owned.first, std::min(owned.last, newest - 1));
    if (countOf(owned.first, end) > static_cast<std::uint64_t>(rows)) {
      end = owned.first + rows - 1;
    }
    if ((code = ofKind.remove.run(owned.first, end)) != SQLITE_OK) return code;
    const std::int64_t gone = sqlite3_changes64(connection_);
    removed += gone;
    rows -= std::max<std::int64_t>(gone, 1);
    code = end < owned.last ? keepFrom(owned, end + 1) : drop(owned);
    if (code != SQLITE_OK) return code;
  }
  return SQLITE_OK;
}

int StoreOwners::removeSessionsOf(std::int64_t user, std::int64_t rows,
                                  std::int64_t& removed) {
  StoreStatement& time = statements_->timeOfOldestMessage;
  std::optional<std::int64_t> before;
  int code = time.begin(user);
  const bool hasMessages = code == SQLITE_ROW;
  if (hasMessages && !time.isNull(0)) before = time.integer(0);
  time.reset();
  if (code != SQLITE_ROW && code != SQLITE_OK) return code;
  // The oldest has gone already, and is not forgotten yet: any may have messages.
  if (hasMessages && !before) return SQLITE_OK;
  Statements::OfKind& ofKind = statements_->ofKind[indexOf(RowKind::kSessions)];
  std::int64_t newest = 0;
  code = newestOf(RowKind::kSessions, newest);
  if (code != SQLITE_ROW) return code;
  for (int i = 0; i < kMostLookedAt && rows > 0; ++i) {
    OwnedRows owned;
    code = oldestOf(user, RowKind::kSessions, sessionsLookedAt_, owned);
    if (code == SQLITE_OK || (code == SQLITE_ROW && owned.last >= newest)) {
      sessionsLookedAt_ = INT64_MIN;
      return SQLITE_OK;
    }
    if (code != SQLITE_ROW) return code;
    sessionsLookedAt_ = owned.first;
    if ((code = ofKind.remove.run(owned.first, owned.last, before)) != SQLITE_OK) {
      return code;
    }
    const std::int64_t gone = sqlite3_changes64(connection_);
    removed += gone;
    rows -= std::max<std::int64_t>(gone, 1);
    StoreStatement& count = statements_->sessionsLeft;
    code = count.begin(owned.first, owned.last);
    const auto left = static_cast<std::uint64_t>(count.integer(0));
    count.reset();
    if (code != SQLITE_ROW) return code;
    code = left == 0
               ? drop(owned)
               : keep(owned, owned.first,
                      partOf(owned.bytes, left, left + static_cast<std::uint64_t>(gone)));
    if (code != SQLITE_OK) return code;
  }
  return SQLITE_OK;
}

int StoreOwners::forgetRemoved() {
  for (std::size_t i = 0; i < kRowKinds; ++i) {
    if (const int code = forgetRemoved(static_cast<RowKind>(i))) return code;
  }
  return SQLITE_OK;
}

int StoreOwners::forgetRemoved(RowKind kind) {
  StoreStatement& first = statements_->ofKind[indexOf(kind)].firstID;
  int code = first.begin();
  const bool isEmpty = first.isNull(0);
  const std::int64_t oldest = first.integer(0);
  first.reset();
  if (code != SQLITE_ROW || isEmpty) return code == SQLITE_ROW ? SQLITE_OK : code;
  for (int i = 0; i < kMostLookedAt; ++i) {
    OwnedRows owned;
    StoreStatement& statement = statements_->oldestOfKind;
    code = statement.begin(numberOf(kind));
    read(statement, kind, owned);
    if (code != SQLITE_ROW) return code;
    if (owned.first >= oldest) return SQLITE_OK;
    code = owned.last < oldest ? drop(owned) : keepFrom(owned, oldest);
    if (code != SQLITE_OK) return code;
  }
  return SQLITE_OK;
}

int StoreOwners::newestOf(RowKind kind, std::int64_t& id) {
  StoreStatement& statement = statements_->ofKind[indexOf(kind)].lastID;
  const int code = statement.begin();
  id = statement.integer(0);
  statement.reset();
  return code;
}

int StoreOwners::oldestOf(std::int64_t user, RowKind kind, std::int64_t after,
                          OwnedRows& rows) {
  StoreStatement& statement = statements_->oldestOfUser;
  const int code = statement.begin(user, numberOf(kind), after);
  read(statement, kind, rows);
  return code;
}

void StoreOwners::read(StoreStatement& statement, RowKind kind, OwnedRows& rows) {
  // More than there can be is a meddler's.
  constexpr std::int64_t kMostBytes = std::int64_t{1} << 60;
  rows = {kind, statement.integer(0), statement.integer(1), statement.integer(2),
          std::clamp<std::int64_t>(statement.integer(3), 0, kMostBytes)};
  statement.reset();
}

int StoreOwners::keepFrom(const OwnedRows& rows, std::int64_t first) {
  return keep(
      rows, first,
      partOf(rows.bytes, countOf(first, rows.last), countOf(rows.first, rows.last)));
}

int StoreOwners::keep(const OwnedRows& rows, std::int64_t first, std::int64_t bytes) {
  const int code = statements_->keep.run(numberOf(rows.kind), rows.first, first, bytes);
  if (code != SQLITE_OK) return code;
  return statements_->addBytes.run(rows.user, bytes - rows.bytes);
}

int StoreOwners::drop(const OwnedRows& rows) {
  const int code = statements_->drop.run(numberOf(rows.kind), rows.first);
  return code != SQLITE_OK ? code : statements_->addBytes.run(rows.user, -rows.bytes);
}

}  // namespace ostrel
