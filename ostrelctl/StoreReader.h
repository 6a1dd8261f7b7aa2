#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "ostrelctl/JSONNode.h"
#include "platform/Outcome.h"

struct sqlite3;

namespace ostrel {

/// Microseconds since 1970-01-01T00:00:00Z.
using StoreTime = std::int64_t;

/// What a JSON column holds; as plain text when that is not JSON.
JSONNode jsonColumn(JSONNode column);
/// What a text column holds; empty for null.
std::string textColumn(const JSONNode& column);

/// One session as the store holds it. Infos are JSON.
struct RecordedSession {
  std::int64_t id = 0;
  std::int64_t reporterID = 0;
  std::string hierarchyToken;
  JSONNode sessionInfo;
  JSONNode userInfo;
  std::optional<StoreTime> startedAt;
  std::optional<StoreTime> flushedAt;
  std::optional<StoreTime> endedAt;
  std::int64_t messageCount = 0;
};

struct RecordedMessage {
  std::int64_t id = 0;
  /// None: sent without a session.
  std::optional<std::int64_t> sessionID;
  /// The reporter of the session or, without one, of the message.
  std::optional<std::int64_t> reporterID;
  std::int64_t category = 0;
  std::int64_t type = 0;
  JSONNode payload;
  StoreTime createdAt = 0;
};

/// Reads the store of a service, which may be running or not. It changes
/// nothing there. Errors are sentences for people. One thread at a time.
class StoreReader {
 public:
  static Outcome<std::shared_ptr<StoreReader>> open(const std::string& path);
  ~StoreReader();
  StoreReader(const StoreReader&) = delete;
  StoreReader& operator=(const StoreReader&) = delete;

  /// Oldest first; only the newest `limit` when that is not 0.
  Outcome<std::vector<RecordedSession>> sessions(std::int64_t limit);
  /// Empty when there is none of that id.
  Outcome<std::vector<RecordedSession>> session(std::int64_t id);
  Outcome<std::vector<RecordedSession>> newestSession();
  Outcome<std::vector<RecordedSession>> newestSessionOfReporter(std::int64_t reporterID);

  /// In the order in which they were recorded.
  Outcome<std::vector<RecordedMessage>> messagesOfSession(std::int64_t sessionID);
  /// At most `limit` of those after the message `id`.
  Outcome<std::vector<RecordedMessage>> messagesAfter(std::int64_t id,
                                                      std::int64_t limit);
  /// The id after which the newest `count` messages begin.
  Outcome<std::int64_t> idBeforeNewest(std::int64_t count);

  /// The rows of one of the service's own tables; none when it is not there.
  Outcome<std::vector<JSONObject>> rowsOfTable(const std::string& table);

  using Row = std::vector<JSONNode>;
  using RowHandler =
      std::function<void(const std::vector<std::string>& columns, Row row)>;
  /// Runs what stands in `sql`, one statement after the other. A statement that
  /// would write anything anywhere fails.
  Success query(const std::string& sql, const RowHandler& handler);

 private:
  explicit StoreReader(sqlite3* database) : database_(database) {}

  using Parameters = std::vector<std::int64_t>;
  Outcome<std::vector<Row>> rows(const std::string& sql, const Parameters& parameters);
  Outcome<std::vector<RecordedSession>> sessionsWhere(const std::string& clauses,
                                                      const Parameters& parameters);
  Outcome<std::vector<RecordedMessage>> messagesWhere(const std::string& clauses,
                                                      const Parameters& parameters);
  ErrorObject lastError() const;

  sqlite3* const database_;
};

}  // namespace ostrel
