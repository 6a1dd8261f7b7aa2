// The store is opened read-only. Its journal is a write-ahead log, which a reader
// joins through shared memory beside the database; where that cannot be made (a
// stopped service's store in a directory that is not the reader's), the file is
// all there is, and is read as one that does not change.
#include "ostrelctl/StoreReader.h"

#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <utility>

namespace ostrel {
namespace {

constexpr int kBusyMilliseconds = 2000;

ErrorObject storeError(int code, std::string sentence) {
  return {"sqlite", code, std::move(sentence)};
}

std::string fileURI(const std::string& path, std::string_view parameters) {
  constexpr char kDigits[] = "0123456789ABCDEF";
  std::string uri = "file:";
  for (const char character : path) {
    const auto byte = static_cast<unsigned char>(character);
    if (byte > 0x20 && byte < 0x7F &&
        std::string_view("?#%").find(character) == std::string_view::npos) {
      uri += character;
    } else {
      uri += {'%', kDigits[byte >> 4], kDigits[byte & 0xF]};
    }
  }
  return uri.append("?").append(parameters);
}

bool hasContent(const std::string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0 && status.st_size > 0;
}

/// Opens the file and reads its schema. None, with the result code in `code` and
/// SQLite's words in `message`, when either fails.
sqlite3* openAndTry(const std::string& uri, int& code, std::string& message) {
  sqlite3* database = nullptr;
  code = sqlite3_open_v2(uri.c_str(), &database, SQLITE_OPEN_READONLY | SQLITE_OPEN_URI,
                         /*zVfs=*/nullptr);
  if (code == SQLITE_OK) {
    sqlite3_busy_timeout(database, kBusyMilliseconds);
    code = sqlite3_exec(database, "SELECT count(*) FROM sqlite_schema",
                        /*callback=*/nullptr, /*arg=*/nullptr, /*errmsg=*/nullptr);
  }
  if (code == SQLITE_OK) return database;
  message = database != nullptr ? sqlite3_errmsg(database) : sqlite3_errstr(code);
  sqlite3_close(database);
  return nullptr;
}

/// Statements reach no other file: an attached one could be written to.
int refuseOtherFiles(void*, int action, const char*, const char*, const char*,
                     const char*) {
  return action == SQLITE_ATTACH ? SQLITE_DENY : SQLITE_OK;
}

struct StatementEnd {
  void operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }
};
using Statement = std::unique_ptr<sqlite3_stmt, StatementEnd>;

std::string hexadecimal(const void* bytes, int size) {
  constexpr char kDigits[] = "0123456789abcdef";
  const auto* at = static_cast<const unsigned char*>(bytes);
  std::string text;
  for (int i = 0; i < size; ++i) {
    text += {kDigits[at[i] >> 4], kDigits[at[i] & 0xF]};
  }
  return text;
}

JSONNode columnNode(sqlite3_stmt* statement, int column) {
  switch (sqlite3_column_type(statement, column)) {
    case SQLITE_INTEGER:
      return {std::int64_t{sqlite3_column_int64(statement, column)}};
    case SQLITE_FLOAT:
      return {sqlite3_column_double(statement, column)};
    case SQLITE_TEXT: {
      const auto* text =
          reinterpret_cast<const char*>(sqlite3_column_text(statement, column));
      const int size = sqlite3_column_bytes(statement, column);
      return {std::string(text, static_cast<std::size_t>(size))};
    }
    case SQLITE_BLOB: {
      const void* bytes = sqlite3_column_blob(statement, column);
      return {hexadecimal(bytes, sqlite3_column_bytes(statement, column))};
    }
    default:
      return {};
  }
}

std::vector<std::string> columnNames(sqlite3_stmt* statement) {
  std::vector<std::string> names;
  for (int i = 0; i < sqlite3_column_count(statement); ++i) {
    names.emplace_back(sqlite3_column_name(statement, i));
  }
  return names;
}

StoreReader::Row currentRow(sqlite3_stmt* statement) {
  StoreReader::Row row;
  for (int i = 0; i < sqlite3_column_count(statement); ++i) {
    row.push_back(columnNode(statement, i));
  }
  return row;
}

}  // namespace

JSONNode jsonColumn(JSONNode column) {
  const std::string* text = column.string();
  if (text == nullptr) return column;
  auto parsed = parseJSON(*text);
  return parsed.value ? std::move(*parsed.value) : column;
}

std::string textColumn(const JSONNode& column) {
  return column.string() != nullptr ? *column.string() : std::string();
}

Outcome<std::shared_ptr<StoreReader>> StoreReader::open(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) {
    return {{},
            storeError(SQLITE_CANTOPEN,
                       "there is no store at " + path + ": nothing was recorded yet")};
  }
  int code = SQLITE_OK;
  std::string message;
  sqlite3* database = openAndTry(fileURI(path, "mode=ro"), code, message);
  if (database == nullptr && code == SQLITE_CANTOPEN && !hasContent(path + "-wal")) {
    database = openAndTry(fileURI(path, "mode=ro&immutable=1"), code, message);
  }
  if (database == nullptr) {
    return {{}, storeError(code, "the store at " + path + " cannot be read: " + message)};
  }
  sqlite3_set_authorizer(database, refuseOtherFiles, /*pUserData=*/nullptr);
  return {std::shared_ptr<StoreReader>(new StoreReader(database)), {}};
}

StoreReader::~StoreReader() { sqlite3_close(database_); }

Outcome<std::vector<RecordedSession>> StoreReader::sessions(std::int64_t limit) {
  return sessionsWhere("ORDER BY id DESC LIMIT ?1", {limit == 0 ? -1 : limit});
}

Outcome<std::vector<RecordedSession>> StoreReader::session(std::int64_t id) {
  return sessionsWhere("WHERE id = ?1", {id});
}

Outcome<std::vector<RecordedSession>> StoreReader::newestSession() {
  return sessionsWhere("ORDER BY id DESC LIMIT 1", {});
}

Outcome<std::vector<RecordedSession>> StoreReader::newestSessionOfReporter(
    std::int64_t reporterID) {
  return sessionsWhere("WHERE reporter_id = ?1 ORDER BY id DESC LIMIT 1", {reporterID});
}

Outcome<std::vector<RecordedSession>> StoreReader::sessionsWhere(
    const std::string& clauses, const Parameters& parameters) {
  auto found = rows(
      "SELECT id, reporter_id, hierarchy_token, session_info, user_info, started_at,"
      " flushed_at, ended_at, coalesce(messages, 0) FROM telemetry_sessions LEFT JOIN"
      " (SELECT telemetry_session_id AS session, count(*) AS messages"
      " FROM telemetry_messages GROUP BY session) ON session = id " +
          clauses,
      parameters);
  if (!found.value) return {{}, std::move(found.error)};
  std::vector<RecordedSession> sessions;
  for (Row& row : *found.value) {
    RecordedSession session;
    session.id = row[0].signedInteger().value_or(0);
    session.reporterID = row[1].signedInteger().value_or(0);
    session.hierarchyToken = textColumn(row[2]);
    session.sessionInfo = jsonColumn(std::move(row[3]));
    session.userInfo = jsonColumn(std::move(row[4]));
    session.startedAt = row[5].signedInteger();
    session.flushedAt = row[6].signedInteger();
    session.endedAt = row[7].signedInteger();
    session.messageCount = row[8].signedInteger().value_or(0);
    sessions.push_back(std::move(session));
  }
  std::reverse(sessions.begin(), sessions.end());
  return {std::move(sessions), {}};
}

Outcome<std::vector<RecordedMessage>> StoreReader::messagesOfSession(
    std::int64_t sessionID) {
  return messagesWhere("WHERE m.telemetry_session_id = ?1 ORDER BY m.id", {sessionID});
}

Outcome<std::vector<RecordedMessage>> StoreReader::messagesAfter(std::int64_t id,
                                                                 std::int64_t limit) {
  return messagesWhere("WHERE m.id > ?1 ORDER BY m.id LIMIT ?2", {id, limit});
}

Outcome<std::vector<RecordedMessage>> StoreReader::messagesWhere(
    const std::string& clauses, const Parameters& parameters) {
  auto found = rows(
      "SELECT m.id, m.telemetry_session_id, s.reporter_id, m.session_info, m.category,"
      " m.type, m.payload, m.created_at FROM telemetry_messages AS m"
      " LEFT JOIN telemetry_sessions AS s ON s.id = m.telemetry_session_id " +
          clauses,
      parameters);
  if (!found.value) return {{}, std::move(found.error)};
  std::vector<RecordedMessage> messages;
  for (Row& row : *found.value) {
    RecordedMessage message;
    message.id = row[0].signedInteger().value_or(0);
    message.sessionID = row[1].signedInteger();
    message.reporterID = row[2].signedInteger();
    if (const JSONNode info = jsonColumn(std::move(row[3])); info.object() != nullptr) {
      const JSONNode* id = find(*info.object(), "kTelvarSessionInfoSessionID");
      if (id != nullptr && !message.reporterID) message.reporterID = id->signedInteger();
    }
    message.category = row[4].signedInteger().value_or(0);
    message.type = row[5].signedInteger().value_or(0);
    message.payload = jsonColumn(std::move(row[6]));
    message.createdAt = row[7].signedInteger().value_or(0);
    messages.push_back(std::move(message));
  }
  return {std::move(messages), {}};
}

Outcome<std::int64_t> StoreReader::idBeforeNewest(std::int64_t count) {
  auto found = rows(
      "SELECT coalesce((SELECT id FROM telemetry_messages ORDER BY id DESC"
      " LIMIT 1 OFFSET ?1), 0)",
      {count});
  if (!found.value) return {{}, std::move(found.error)};
  return {found.value->at(0).at(0).signedInteger().value_or(0), {}};
}

Outcome<std::vector<JSONObject>> StoreReader::rowsOfTable(const std::string& table) {
  std::vector<JSONObject> objects;
  bool isThere = false;
  Success success = query("SELECT name FROM sqlite_schema",
                          [&](const std::vector<std::string>&, const Row& row) {
                            isThere = isThere || textColumn(row[0]) == table;
                          });
  if (success.succeeded && isThere) {
    success = query("SELECT * FROM \"" + table + "\"",
                    [&objects](const std::vector<std::string>& columns, Row row) {
                      JSONObject& object = objects.emplace_back();
                      for (std::size_t i = 0; i < row.size(); ++i) {
                        object.push_back({columns[i], std::move(row[i])});
                      }
                    });
  }
  if (!success.succeeded) return {{}, success.error};
  return {std::move(objects), {}};
}

Success StoreReader::query(const std::string& sql, const RowHandler& handler) {
  const char* rest = sql.c_str();
  while (*rest != '\0') {
    sqlite3_stmt* prepared = nullptr;
    if (sqlite3_prepare_v2(database_, rest, /*nByte=*/-1, &prepared, &rest) !=
        SQLITE_OK) {
      return {false, lastError()};
    }
    const Statement statement(prepared);
    if (!statement) continue;  // A blank or a comment.
    if (sqlite3_stmt_readonly(prepared) == 0) {
      return {false, storeError(SQLITE_READONLY,
                                "the store is only read: a statement "
                                "that writes is refused")};
    }
    const std::vector<std::string> columns = columnNames(prepared);
    int code = sqlite3_step(prepared);
    for (; code == SQLITE_ROW; code = sqlite3_step(prepared)) {
      handler(columns, currentRow(prepared));
    }
    if (code != SQLITE_DONE) return {false, lastError()};
  }
  return {true, {}};
}

Outcome<std::vector<StoreReader::Row>> StoreReader::rows(const std::string& sql,
                                                         const Parameters& parameters) {
  sqlite3_stmt* prepared = nullptr;
  if (sqlite3_prepare_v2(database_, sql.c_str(), /*nByte=*/-1, &prepared,
                         /*pzTail=*/nullptr) != SQLITE_OK) {
    return {{}, lastError()};
  }
  const Statement statement(prepared);
  for (std::size_t i = 0; i < parameters.size(); ++i) {
    sqlite3_bind_int64(prepared, static_cast<int>(i + 1), parameters[i]);
  }
  std::vector<Row> result;
  int code = sqlite3_step(prepared);
  for (; code == SQLITE_ROW; code = sqlite3_step(prepared)) {
    result.push_back(currentRow(prepared));
  }
  if (code != SQLITE_DONE) return {{}, lastError()};
  return {std::move(result), {}};
}

ErrorObject StoreReader::lastError() const {
  return storeError(sqlite3_extended_errcode(database_),
                    std::string("the store says: ") + sqlite3_errmsg(database_));
}

}  // namespace ostrel
