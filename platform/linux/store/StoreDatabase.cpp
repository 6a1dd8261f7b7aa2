// The file is written by one connection in WAL mode with synchronous=FULL: a
// commit is durable when it returns. Commits are few (the writer gathers), so the
// difference to NORMAL is one fsync a commit: with 8,192 rows in each, 1.17
// against 1.19 million rows a second here. Pages of 16 KiB cost a quarter less
// processor time a row than those of 4 KiB: fewer system calls, fewer splits. The log
// grows to 16 MiB before a checkpoint: at full load each 4 MiB cost two more syncs,
// which were a third of the time.
#include "platform/linux/store/StoreDatabase.h"

#include <dirent.h>
#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <limits>
#include <memory>

#include "platform/Logging.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/Limits.h"
#include "platform/linux/store/StoreIdentity.h"
#include "platform/linux/store/StoreRowTables.h"
#include "platform/linux/store/StoreStatement.h"

namespace ostrel {
namespace {

constexpr std::int64_t kVersion = 2;
constexpr const char* kSetVersion =
    "PRAGMA application_id = 1330860620; PRAGMA user_version = 2";

constexpr const char* kSchema = R"(
CREATE TABLE telemetry_sessions (
  id INTEGER PRIMARY KEY, reporter_id INTEGER, hierarchy_token TEXT, session_info TEXT,
  user_info TEXT, started_at INTEGER, flushed_at INTEGER, ended_at INTEGER);
CREATE TABLE telemetry_messages (
  id INTEGER PRIMARY KEY, telemetry_session_id INTEGER, session_info TEXT,
  user_info TEXT, category INTEGER, type INTEGER, payload TEXT, created_at INTEGER);
CREATE TABLE analytics_events (
  id INTEGER PRIMARY KEY, name TEXT, payload TEXT, created_at INTEGER);
CREATE TABLE power_events (
  id INTEGER PRIMARY KEY, client_id INTEGER, name TEXT, event TEXT, created_at INTEGER,
  attachment TEXT);
CREATE TABLE analytics_interest (pattern TEXT PRIMARY KEY);
INSERT INTO analytics_interest VALUES ('*');
CREATE TABLE service_status (key TEXT PRIMARY KEY, value);
)";

// Larger files are checked where they are touched.
constexpr off_t kCheckedAtOpenBytes = 4 * 1024 * 1024;

constexpr int kBusyMilliseconds = 100;
constexpr std::string_view kSetAsideSuffix = ".damaged-";

std::string directoryOf(const std::string& path) {
  const auto slash = path.rfind('/');
  return slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
}

std::string nameOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

StoreFault systemFault(int error, std::string_view action, const std::string& path) {
  return {StoreFault::Kind::kTransient, SQLITE_CANTOPEN,
          "cannot " + std::string(action) + " " + path + ": " + std::strerror(error)};
}

StoreDatabase::Result makeDirectories(const std::string& path) {
  for (std::size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
    const std::string directory = path.substr(0, end);
    if (::mkdir(directory.c_str(), 0700) != 0 && errno != EEXIST) {
      return systemFault(errno, "make the directory", directory);
    }
    if (end == std::string::npos) return std::nullopt;
  }
}

bool hasMemory() {
  constexpr sqlite3_uint64 kMuch = 1024 * 1024;
  void* const memory = sqlite3_malloc64(kMuch);
  sqlite3_free(memory);
  return memory != nullptr;
}

StoreFault damaged(std::string description) {
  return {StoreFault::Kind::kDamaged, SQLITE_CORRUPT, std::move(description)};
}

// The check reports a page that could not be read as one of its findings, with SQLite's
// code or without. None: the finding is about what was read.
std::optional<int> readErrorIn(const std::string& finding) {
  constexpr std::string_view kWithCode = "unable to get the page. error code=";
  if (const auto place = finding.find(kWithCode); place != std::string::npos) {
    return std::atoi(finding.c_str() + place + kWithCode.size());
  }
  if (finding.find("failed to get page") != std::string::npos) return SQLITE_IOERR_READ;
  return std::nullopt;
}

StoreFault newer(std::int64_t version) {
  return {StoreFault::Kind::kNewer, SQLITE_ERROR,
          "the store has version " + std::to_string(version) +
              ", written by a later service; this one knows " + std::to_string(kVersion)};
}

}  // namespace

struct StoreDatabase::Statements {
  StoreStatement begin;
  StoreStatement commit;
  StoreStatement insertSession;
  StoreStatement setFlushedAt;
  StoreStatement setEndedAt;
  StoreStatement insertMessages;
  StoreStatement insertAnalytics;
  StoreStatement insertPowerEvent;
  StoreStatement setStatus;
  StoreStatement dataVersion;
  StoreStatement interest;
  StoreStatement fingerprint;
  StoreStatement room;
  StoreStatement removeMessages;
  StoreStatement removeAnalytics;
  StoreStatement removePower;
  StoreStatement removeSessions;
  StoreStatement addToStatus;
  StoreStatement nameStore;

  struct Source {
    StoreStatement Statements::*statement;
    const char* sql;
  };
  static const Source kSources[];
};

const StoreDatabase::Statements::Source StoreDatabase::Statements::kSources[] = {
    {&Statements::begin, "BEGIN IMMEDIATE"},
    {&Statements::commit, "COMMIT"},
    {&Statements::insertSession,
     "INSERT INTO telemetry_sessions (reporter_id, hierarchy_token, session_info, "
     "user_info, started_at) VALUES (?, ?, ?, ?, ?)"},
    {&Statements::setFlushedAt,
     "UPDATE telemetry_sessions SET flushed_at = ?2 WHERE id = ?1"},
    {&Statements::setEndedAt,
     "UPDATE telemetry_sessions SET ended_at = ?2 WHERE id = ?1"},
    {&Statements::insertMessages,
     "INSERT INTO telemetry_messages (telemetry_session_id, session_info, user_info, "
     "category, type, payload, created_at) SELECT * FROM batch_messages"},
    {&Statements::insertAnalytics,
     "INSERT INTO analytics_events (name, payload, created_at) "
     "SELECT * FROM batch_analytics"},
    {&Statements::insertPowerEvent,
     "INSERT INTO power_events (client_id, name, event, attachment, created_at) "
     "VALUES (?, ?, ?, ?, ?)"},
    {&Statements::setStatus,
     "INSERT INTO service_status (key, value) VALUES (?, ?) "
     "ON CONFLICT (key) DO UPDATE SET value = excluded.value"},
    {&Statements::dataVersion, "PRAGMA data_version"},
    {&Statements::interest, "SELECT pattern FROM analytics_interest"},
    {&Statements::fingerprint,
     "SELECT ifnull((SELECT max(id) FROM telemetry_sessions), 0) + "
     "ifnull((SELECT max(id) FROM telemetry_messages), 0) + "
     "ifnull((SELECT max(id) FROM analytics_events), 0) + "
     "ifnull((SELECT max(id) FROM power_events), 0)"},
    {&Statements::room,
     "SELECT (page_count - freelist_count) * page_size, freelist_count * page_size FROM "
     "pragma_page_count, pragma_freelist_count, pragma_page_size"},
    {&Statements::removeMessages,
     "DELETE FROM telemetry_messages WHERE "
     "id < (SELECT min(id) FROM telemetry_messages) + ?1 AND "
     "id < (SELECT max(id) FROM telemetry_messages) AND created_at < ?2"},
    {&Statements::removeAnalytics,
     "DELETE FROM analytics_events WHERE "
     "id < (SELECT min(id) FROM analytics_events) + ?1 AND "
     "id < (SELECT max(id) FROM analytics_events) AND created_at < ?2"},
    {&Statements::removePower,
     "DELETE FROM power_events WHERE "
     "id < (SELECT min(id) FROM power_events) + ?1 AND "
     "id < (SELECT max(id) FROM power_events) AND created_at < ?2"},
    {&Statements::removeSessions,
     "DELETE FROM telemetry_sessions WHERE "
     "id < (SELECT min(id) FROM telemetry_sessions) + ?1 AND "
     "id < (SELECT max(id) FROM telemetry_sessions) AND ended_at < ?2 AND "
     "ended_at < (SELECT created_at FROM telemetry_messages ORDER BY id LIMIT 1)"},
    {&Statements::addToStatus,
     "INSERT INTO service_status (key, value) VALUES (?, ?) "
     "ON CONFLICT (key) DO UPDATE SET value = value + excluded.value"},
    {&Statements::nameStore,
     "INSERT INTO service_status (key, value) VALUES (?, lower(hex(randomblob(16)))) "
     "ON CONFLICT (key) DO NOTHING"},
};

StoreDatabase::StoreDatabase(std::string path, const char* vfs)
    : path_(std::move(path)), vfs_(vfs) {}

StoreDatabase::~StoreDatabase() { close(); }

// SQLite takes some damaged schemas for a want of memory: then it says so each time,
// though there is some.
StoreDatabase::Result StoreDatabase::open() {
  const auto isMemory = [](const Result& result) {
    return result && (result->code & 0xFF) == SQLITE_NOMEM;
  };
  Result result = tryToOpen();
  if (isMemory(result)) {
    const bool wasAnother = isAnother_;
    result = tryToOpen();
    isAnother_ |= wasAnother;
  }
  if (isMemory(result) && hasMemory()) return damaged(result->description);
  return result;
}

StoreDatabase::Result StoreDatabase::tryToOpen() {
  close();
  Result result = makeFile();
  if (!result) result = connect();
  if (result) close();
  return result;
}

void StoreDatabase::close() {
  statements_.reset();
  owners_.release();
  sqlite3_close_v2(connection_);
  connection_ = nullptr;
}

StoreDatabase::Result StoreDatabase::makeFile() {
  if (auto failed = makeDirectories(directoryOf(path_))) return failed;
  if (auto failed = clearCompanions()) return failed;
  struct stat status;
  const bool isThere = ::lstat(path_.c_str(), &status) == 0;
  if (isThere && !S_ISREG(status.st_mode)) return damaged("it is not a regular file");
  const FileDescriptor file(
      ::open(path_.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!file) {
    // One of our own would be no better off if it were set aside for a new one.
    if (errno == EACCES && isThere && status.st_uid != ::geteuid()) {
      return damaged("it belongs to user " + std::to_string(status.st_uid));
    }
    return systemFault(errno, "open", path_);
  }
  if (::fstat(file.get(), &status) != 0) return systemFault(errno, "look at", path_);
  if ((status.st_mode & 07777) != 0600 && ::fchmod(file.get(), 0600) != 0) {
    return systemFault(errno, "set the permissions of", path_);
  }
  isAnother_ = device_ != status.st_dev || inode_ != status.st_ino;
  device_ = status.st_dev;
  inode_ = status.st_ino;
  return status.st_size == 0 ? std::nullopt : checkHeader(file.get());
}

// What stands in place of the log or its index and is no file would keep the store from
// being used; it holds nothing of ours.
StoreDatabase::Result StoreDatabase::clearCompanions() {
  for (const char* suffix : {"-wal", "-shm"}) {
    const std::string path = path_ + suffix;
    struct stat status;
    if (::lstat(path.c_str(), &status) != 0 || S_ISREG(status.st_mode)) continue;
    const std::string target = nameForSetAside();
    if (::rename(path.c_str(), target.c_str()) != 0) {
      return systemFault(errno, "set aside", path);
    }
    OSTREL_LOG_ERROR(processLogScope, "set %@ aside as %@: it is not a regular file",
                     path, target);
    removeOldestSetAside();
  }
  return std::nullopt;
}

StoreDatabase::Result StoreDatabase::checkHeader(int file) {
  constexpr std::string_view kMagic("SQLite format 3\0", 16);
  constexpr std::size_t kVersionOffset = 60;
  std::uint8_t bytes[kVersionOffset + 4] = {};
  const ssize_t size = ::pread(file, bytes, sizeof bytes, /*offset=*/0);
  if (size < 0) return systemFault(errno, "read", path_);
  if (std::memcmp(bytes, kMagic.data(), kMagic.size()) != 0) {
    return damaged("it is not a database");
  }
  const std::uint32_t version =
      static_cast<std::uint32_t>(bytes[kVersionOffset]) << 24 |
      static_cast<std::uint32_t>(bytes[kVersionOffset + 1]) << 16 |
      static_cast<std::uint32_t>(bytes[kVersionOffset + 2]) << 8 |
      bytes[kVersionOffset + 3];
  if (version > kVersion && version <= INT32_MAX) return newer(version);
  return std::nullopt;
}

StoreDatabase::Result StoreDatabase::connect() {
  const int code = sqlite3_open_v2(path_.c_str(), &connection_,
                                   SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, vfs_);
  if (code != SQLITE_OK) return fault(code, "open");
  keepLogAtClose(/*isKept=*/true);
  sqlite3_extended_result_codes(connection_, /*onoff=*/1);
  sqlite3_busy_timeout(connection_, kBusyMilliseconds);
  if (auto failed = run("PRAGMA page_size = 16384;"
                        "PRAGMA trusted_schema = OFF; PRAGMA cache_size = -2000;"
                        "PRAGMA temp_store = MEMORY; PRAGMA synchronous = FULL")) {
    return failed;
  }
  std::int64_t version = 0;
  if (auto failed = checkVersion(version)) return failed;
  std::string mode;
  if (auto failed = readText("PRAGMA journal_mode = WAL", mode)) return failed;
  if (mode != "wal") return fault(SQLITE_CANTOPEN, "use a write-ahead log");
  if (auto failed = run("PRAGMA wal_autocheckpoint = 1024;"
                        "PRAGMA journal_size_limit = 16777216")) {
    return failed;
  }
  if (version == 0) {
    if (auto failed = makeSchema()) return failed;
  } else if (auto failed = checkContent()) {
    return failed;
  }
  if (version != 0 && version < kVersion) {
    if (auto failed = upgrade()) return failed;
  }
  if (const int registered = registerRowTables(connection_, &rows_)) {
    return fault(registered, "prepare");
  }
  if (auto failed = prepareStatements()) return failed;
  keepLogAtClose(/*isKept=*/false);
  return std::nullopt;
}

// What is damaged, or not ours, is left as it was found.
void StoreDatabase::keepLogAtClose(bool isKept) {
  if (connection_ == nullptr) return;
  sqlite3_db_config(connection_, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, isKept ? 1 : 0,
                    nullptr);
}

StoreDatabase::Result StoreDatabase::checkVersion(std::int64_t& version) {
  if (auto failed = readInteger("PRAGMA user_version", version)) return failed;
  if (version > kVersion) return newer(version);
  if (version < 0) return damaged("its version is below 0");
  std::int64_t tables = 0;
  if (auto failed = readInteger("SELECT count(*) FROM sqlite_schema", tables)) {
    return failed;
  }
  if (version == 0 && tables != 0) return damaged("it holds something else");
  return std::nullopt;
}

StoreDatabase::Result StoreDatabase::makeSchema() {
  isAnother_ = true;
  return runAtOnce({kSchema, StoreOwners::kSchema, kSetVersion});
}

// From version 1.
StoreDatabase::Result StoreDatabase::upgrade() {
  OSTREL_LOG_DEFAULT(processLogScope, "the store %@ is made one of version %lli", path_,
                     kVersion);
  return runAtOnce({StoreOwners::kSchema, StoreOwners::kDisownAll, kSetVersion});
}

// All of the steps or, after a fault or a crash, none.
StoreDatabase::Result StoreDatabase::runAtOnce(std::initializer_list<const char*> steps) {
  if (auto failed = run("BEGIN IMMEDIATE")) return failed;
  for (const char* sql : steps) {
    if (auto failed = run(sql)) {
      rollback();
      return failed;
    }
  }
  Result failed = run("COMMIT");
  if (failed) rollback();
  return failed;
}

StoreDatabase::Result StoreDatabase::checkContent() {
  struct stat status;
  if (::stat(path_.c_str(), &status) != 0) return systemFault(errno, "look at", path_);
  if (status.st_size > kCheckedAtOpenBytes) return std::nullopt;
  std::string finding;
  if (auto failed = readText("PRAGMA quick_check(1)", finding)) return failed;
  if (finding == "ok") return std::nullopt;
  const std::optional<int> error = readErrorIn(finding);
  const StoreFault found = error ? fault(*error, "check") : damaged(finding);
  return found.kind == StoreFault::Kind::kTransient ? found : damaged(finding);
}

StoreDatabase::Result StoreDatabase::prepareStatements() {
  auto statements = std::make_unique<Statements>();
  for (const auto& [statement, sql] : Statements::kSources) {
    const int code = ((*statements).*statement).prepare(connection_, sql);
    if (code == SQLITE_ERROR) {
      return damaged(std::string("its tables are others: ") +
                     sqlite3_errmsg(connection_));
    }
    if (code != SQLITE_OK) return fault(code, "prepare");
  }
  if (const int code = owners_.prepare(connection_)) {
    return code == SQLITE_ERROR ? damaged(std::string("its tables are others: ") +
                                          sqlite3_errmsg(connection_))
                                : fault(code, "prepare");
  }
  statements_ = std::move(statements);
  dataVersion_ = -1;
  return std::nullopt;
}

bool StoreDatabase::isInPlace() const {
  struct stat status;
  return ::stat(path_.c_str(), &status) == 0 && status.st_dev == device_ &&
         status.st_ino == inode_;
}

std::string StoreDatabase::nameForSetAside() const {
  const std::time_t now = std::time(nullptr);
  struct tm calendar;
  char stamp[32];
  std::strftime(stamp, sizeof stamp, "%Y%m%dT%H%M%SZ", ::gmtime_r(&now, &calendar));
  std::string name = path_ + std::string(kSetAsideSuffix) + stamp;
  const std::size_t size = name.size();
  struct stat status;
  for (int i = 2; ::lstat(name.c_str(), &status) == 0; ++i) {
    name.resize(size);
    name += '-' + std::to_string(i);
  }
  return name;
}

StoreDatabase::Result StoreDatabase::setAside(std::string_view reason) {
  keepLogAtClose(/*isKept=*/true);
  close();
  const std::string target = nameForSetAside();
  if (::rename(path_.c_str(), target.c_str()) != 0) {
    return systemFault(errno, "set aside", path_);
  }
  ::rename((path_ + "-wal").c_str(), (target + "-wal").c_str());
  ::unlink((path_ + "-shm").c_str());
  OSTREL_LOG_ERROR(processLogScope, "set the store %@ aside as %@: %@", path_, target,
                   reason);
  removeOldestSetAside();
  return std::nullopt;
}

void StoreDatabase::removeOldestSetAside() {
  const std::string directory = directoryOf(path_);
  const std::string prefix = nameOf(path_) + std::string(kSetAsideSuffix);
  std::vector<std::string> names;
  const std::unique_ptr<DIR, int (*)(DIR*)> listing(::opendir(directory.c_str()),
                                                    ::closedir);
  if (listing == nullptr) return;
  while (const dirent* entry = ::readdir(listing.get())) {
    const std::string_view name(entry->d_name);
    if (name.starts_with(prefix) && !name.ends_with("-wal")) names.emplace_back(name);
  }
  std::sort(names.begin(), names.end());
  for (std::size_t i = 0; i + limits::kStoreFilesSetAside < names.size(); ++i) {
    const std::string path = directory + "/" + names[i];
    ::unlink(path.c_str());
    ::unlink((path + "-wal").c_str());
  }
}

StoreDatabase::Result StoreDatabase::begin() {
  return resultOf(statements_->begin.run(), "begin to write");
}

StoreDatabase::Result StoreDatabase::commit() {
  return resultOf(statements_->commit.run(), "commit");
}

void StoreDatabase::rollback() {
  owners_.forgetNoted();
  if (connection_ != nullptr && sqlite3_get_autocommit(connection_) == 0) {
    run("ROLLBACK");
  }
}

StoreDatabase::Result StoreDatabase::insertSession(const SessionRow& row,
                                                   std::int64_t& id) {
  const int code = statements_->insertSession.run(
      row.reporterID, row.hierarchyToken, row.sessionInfo, row.userInfo, row.startedAt);
  if (code == SQLITE_OK) {
    id = sqlite3_last_insert_rowid(connection_);
    owners_.note(RowKind::kSessions, id, row.user,
                 row.sessionInfo.size() + row.userInfo.size());
  }
  return resultOf(code, "insert a session");
}

StoreDatabase::Result StoreDatabase::setFlushedAt(std::int64_t session,
                                                  std::int64_t time) {
  return resultOf(statements_->setFlushedAt.run(session, time), "update a session");
}

StoreDatabase::Result StoreDatabase::setEndedAt(std::int64_t session, std::int64_t time) {
  return resultOf(statements_->setEndedAt.run(session, time), "update a session");
}

StoreDatabase::Result StoreDatabase::insertPowerEvent(const PowerRow& row) {
  const int code = statements_->insertPowerEvent.run(row.clientID, row.name, row.event,
                                                     row.attachment, row.createdAt);
  if (code == SQLITE_OK) {
    owners_.note(RowKind::kPower, sqlite3_last_insert_rowid(connection_), row.user,
                 row.name.size() + row.event.size());
  }
  return resultOf(code, "insert a power event");
}

StoreDatabase::Result StoreDatabase::insertRows(const RowBatch& rows) {
  rows_ = &rows;
  int code = SQLITE_OK;
  // There is one writer: the IDs of a statement follow each other.
  const auto firstOf = [&](std::size_t inserted) {
    return sqlite3_last_insert_rowid(connection_) + 1 -
           static_cast<std::int64_t>(inserted);
  };
  if (!rows.messages.empty()) {
    code = statements_->insertMessages.run();
    std::int64_t id = firstOf(rows.messages.size());
    for (const MessageRow& row : rows.messages) {
      owners_.note(RowKind::kMessages, id++, row.user,
                   row.sessionInfo.size + row.userInfo.size + row.payload.size);
    }
  }
  if (code == SQLITE_OK && !rows.analytics.empty()) {
    code = statements_->insertAnalytics.run();
    std::int64_t id = firstOf(rows.analytics.size());
    for (const AnalyticsRow& row : rows.analytics) {
      owners_.note(RowKind::kAnalytics, id++, row.user, row.name.size + row.payload.size);
    }
  }
  rows_ = nullptr;
  return resultOf(code, "insert rows");
}

StoreDatabase::Result StoreDatabase::noteOwners() {
  return resultOf(owners_.write(), "note whose rows there are");
}

StoreDatabase::Result StoreDatabase::readRoom(Room& room) {
  StoreStatement& statement = statements_->room;
  const int code = statement.step();
  if (code == SQLITE_ROW) {
    room.used = statement.integer(0);
    room.free = statement.integer(1);
  }
  statement.reset();
  if (code != SQLITE_ROW) return fault(code, "read the size");
  struct statvfs disk;
  if (::statvfs(path_.c_str(), &disk) != 0) return systemFault(errno, "look at", path_);
  room.diskAvailable = static_cast<std::int64_t>(disk.f_bavail * disk.f_frsize);
  room.diskBytes = static_cast<std::int64_t>(disk.f_blocks * disk.f_frsize);
  return std::nullopt;
}

StoreDatabase::Result StoreDatabase::removeOfLargestOwner(std::int64_t rows,
                                                          std::int64_t& removed) {
  return resultOf(owners_.removeOfLargest(rows, removed), "remove old rows");
}

StoreDatabase::Result StoreDatabase::forgetOwnersOfRemoved() {
  return resultOf(owners_.forgetRemoved(), "note whose rows there are");
}

StoreDatabase::Result StoreDatabase::removeOldest(std::int64_t rows,
                                                  std::optional<std::int64_t> before,
                                                  std::int64_t& removed) {
  for (StoreStatement* statement :
       {&statements_->removeMessages, &statements_->removeAnalytics,
        &statements_->removePower, &statements_->removeSessions}) {
    const int code =
        statement->run(rows, before.value_or(std::numeric_limits<std::int64_t>::max()));
    if (code != SQLITE_OK) return fault(code, "remove old rows");
    removed += sqlite3_changes64(connection_);
  }
  return std::nullopt;
}

StoreDatabase::Result StoreDatabase::setStatus(std::string_view key, std::int64_t value) {
  return resultOf(statements_->setStatus.run(key, value), "update the status");
}

StoreDatabase::Result StoreDatabase::addToStatus(std::string_view key,
                                                 std::int64_t value) {
  return resultOf(statements_->addToStatus.run(key, value), "update the status");
}

StoreDatabase::Result StoreDatabase::nameStore() {
  return resultOf(statements_->nameStore.run(std::string_view(kStoreIdentityKey)),
                  "name the store");
}

StoreDatabase::Result StoreDatabase::readFingerprint(std::int64_t& fingerprint) {
  return readInteger(statements_->fingerprint, "read the last rows", fingerprint);
}

StoreDatabase::Result StoreDatabase::readInterestIfChanged(
    std::optional<std::vector<std::string>>& patterns) {
  std::int64_t version = 0;
  if (auto failed = readInteger(statements_->dataVersion, "read the version of the data",
                                version)) {
    return failed;
  }
  if (version == dataVersion_) return std::nullopt;
  std::vector<std::string> read;
  StoreStatement& interest = statements_->interest;
  int code;
  while ((code = interest.step()) == SQLITE_ROW) read.push_back(interest.text(0));
  interest.reset();
  if (code != SQLITE_OK) return fault(code, "read the wanted events");
  dataVersion_ = version;
  patterns = std::move(read);
  return std::nullopt;
}

bool StoreDatabase::matches(const std::string& pattern, const std::string& text) {
  return sqlite3_strglob(pattern.c_str(), text.c_str()) == 0;
}

StoreDatabase::Result StoreDatabase::run(const char* sql) {
  return resultOf(sqlite3_exec(connection_, sql, nullptr, nullptr, nullptr), "set up");
}

StoreDatabase::Result StoreDatabase::readInteger(const char* sql, std::int64_t& value) {
  StoreStatement statement;
  const int code = statement.prepare(connection_, sql);
  return code == SQLITE_OK ? readInteger(statement, "read", value) : fault(code, "read");
}

StoreDatabase::Result StoreDatabase::readInteger(StoreStatement& statement,
                                                 std::string_view action,
                                                 std::int64_t& value) {
  const int code = statement.step();
  if (code == SQLITE_ROW) value = statement.integer(0);
  statement.reset();
  return code == SQLITE_ROW ? Result() : fault(code, action);
}

StoreDatabase::Result StoreDatabase::readText(const char* sql, std::string& value) {
  StoreStatement statement;
  int code = statement.prepare(connection_, sql);
  if (code == SQLITE_OK) code = statement.step();
  if (code != SQLITE_ROW) return fault(code, "read");
  value = statement.text(0);
  return std::nullopt;
}

StoreDatabase::Result StoreDatabase::resultOf(int code, std::string_view action) const {
  return code == SQLITE_OK ? Result() : fault(code, action);
}

StoreFault StoreDatabase::fault(int code, std::string_view action) const {
  const int primary = code & 0xFF;
  // An error in statements that were once right: the tables changed below us.
  const bool isDamaged = primary == SQLITE_CORRUPT || primary == SQLITE_NOTADB ||
                         primary == SQLITE_ERROR || primary == SQLITE_CONSTRAINT;
  return {isDamaged ? StoreFault::Kind::kDamaged : StoreFault::Kind::kTransient, code,
          "cannot " + std::string(action) + " in " + path_ + ": " + sqlite3_errstr(code)};
}

}  // namespace ostrel
