#pragma once

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <string>

namespace ostrel {

/// A store with the promised tables, kept open as a running service keeps it.
class TestStore {
 public:
  explicit TestStore(const std::string& path) {
    EXPECT_EQ(sqlite3_open(path.c_str(), &database_), SQLITE_OK);
    run("PRAGMA journal_mode=WAL");
    run("CREATE TABLE telemetry_sessions (id INTEGER PRIMARY KEY, reporter_id INTEGER,"
        " hierarchy_token TEXT, session_info TEXT, user_info TEXT, started_at INTEGER,"
        " flushed_at INTEGER, ended_at INTEGER);"
        "CREATE TABLE telemetry_messages (id INTEGER PRIMARY KEY,"
        " telemetry_session_id INTEGER, session_info TEXT, user_info TEXT,"
        " category INTEGER, type INTEGER, payload TEXT, created_at INTEGER);");
  }
  ~TestStore() { sqlite3_close(database_); }
  TestStore(const TestStore&) = delete;
  TestStore& operator=(const TestStore&) = delete;

  void run(const std::string& sql) {
    char* message = nullptr;
    EXPECT_EQ(sqlite3_exec(database_, sql.c_str(), /*callback=*/nullptr, /*arg=*/nullptr,
                           &message),
              SQLITE_OK)
        << message;
    sqlite3_free(message);
  }
  /// One message of session 1; the payload is JSON.
  void addMessage(int category, int type, const std::string& payload,
                  const std::string& session = "1") {
    run("INSERT INTO telemetry_messages (telemetry_session_id, category, type, payload,"
        " created_at) VALUES (" +
        session + ", " + std::to_string(category) + ", " + std::to_string(type) + ", '" +
        payload + "', 2000000)");
  }

 private:
  sqlite3* database_ = nullptr;
};

}  // namespace ostrel
