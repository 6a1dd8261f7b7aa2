// What the tests of the store share.
#pragma once

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/linux/TestSupport.h"
#include "platform/linux/store/Store.h"

namespace ostrel {

using testing_support::eventually;
using testing_support::TemporaryDirectory;

/// A second connection to a store, as a reader or a meddler has one.
class OtherConnection {
 public:
  explicit OtherConnection(const std::string& path) {
    EXPECT_EQ(sqlite3_open(path.c_str(), &connection_), SQLITE_OK) << path;
    sqlite3_busy_timeout(connection_, /*ms=*/5000);
  }
  ~OtherConnection() { sqlite3_close(connection_); }
  OtherConnection(const OtherConnection&) = delete;
  OtherConnection& operator=(const OtherConnection&) = delete;

  /// The rows as text, the columns separated by "|".
  std::vector<std::string> rows(const std::string& sql) {
    std::vector<std::string> rows;
    char* error = nullptr;
    const int code = sqlite3_exec(
        connection_, sql.c_str(),
        [](void* out, int count, char** values, char**) {
          std::string row;
          for (int i = 0; i < count; ++i) {
            if (i != 0) row += '|';
            row += values[i] != nullptr ? values[i] : "NULL";
          }
          static_cast<std::vector<std::string>*>(out)->push_back(row);
          return 0;
        },
        &rows, &error);
    EXPECT_EQ(code, SQLITE_OK) << sql << ": " << (error != nullptr ? error : "");
    sqlite3_free(error);
    return rows;
  }

  void run(const std::string& sql) { rows(sql); }

  std::string one(const std::string& sql) {
    const auto all = rows(sql);
    return all.size() == 1 ? all.front() : std::to_string(all.size()) + " rows";
  }

 private:
  sqlite3* connection_ = nullptr;
};

/// Waits for something that another thread brings.
template <typename T>
class Awaited {
 public:
  void set(T value) {
    const std::lock_guard lock(mutex_);
    value_ = std::move(value);
    ++times_;
    isThere_.notify_all();
  }

  /// None after far longer than it may take.
  std::optional<T> get() {
    std::unique_lock lock(mutex_);
    isThere_.wait_for(lock, std::chrono::seconds(30),
                      [this] { return value_.has_value(); });
    return value_;
  }

  int times() {
    const std::lock_guard lock(mutex_);
    return times_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable isThere_;
  std::optional<T> value_;
  int times_ = 0;
};

namespace testing_support {

/// Makes `directory` one with these files alone, whatever their paths were.
inline void writeFiles(const std::string& directory,
                       const std::map<std::string, std::string>& files) {
  std::filesystem::remove_all(directory);
  std::filesystem::create_directories(directory);
  for (const auto& [name, content] : files) {
    std::ofstream(directory + "/" + std::string(std::filesystem::path(name).filename()),
                  std::ios::binary)
        << content;
  }
}

}  // namespace testing_support

/// The result of a flush, waited for.
inline std::optional<ErrorObject> flushed(TelemetrySession& session) {
  Awaited<std::optional<ErrorObject>> result;
  session.flush([&](std::optional<ErrorObject> error) { result.set(error); });
  const auto error = result.get();
  EXPECT_TRUE(error) << "the flush was not answered";
  return error.value_or(std::nullopt);
}

inline Dictionary sessionInfo(std::int64_t reporterID) {
  return {{kTelvarSessionInfoClientType, Value(19)},
          {kTelvarSessionInfoClientVersion, Value(1.0)},
          {kTelvarSessionInfoSessionID, Value(reporterID)},
          {kTelvarSessionInfoBatchEvent, Value(true)},
          {kTelvarSessionInfoHierarchyToken, Value("00-token")}};
}

inline Dictionary userInfo() {
  return {{kTelvarUserInfoClientName, Value("com.orbisk.ostrel")}};
}

}  // namespace ostrel
