#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace ostrel {

/// A prepared statement. Text given to it must live until the next step. Calls give
/// SQLite's codes.
class StoreStatement {
 public:
  StoreStatement() = default;
  StoreStatement(const StoreStatement&) = delete;
  StoreStatement& operator=(const StoreStatement&) = delete;
  ~StoreStatement() { sqlite3_finalize(statement_); }

  int prepare(sqlite3* connection, const char* sql) {
    return sqlite3_prepare_v3(connection, sql, /*nByte=*/-1, SQLITE_PREPARE_PERSISTENT,
                              &statement_, /*pzTail=*/nullptr);
  }

  /// SQLITE_ROW, or SQLITE_OK at the end.
  int step() {
    const int code = sqlite3_step(statement_);
    return code == SQLITE_DONE ? SQLITE_OK : code;
  }
  void reset() { sqlite3_reset(statement_); }

  /// With `values` for its parameters, in their order.
  template <typename... Values>
  int run(const Values&... values) {
    const int code = begin(values...);
    reset();
    return code;
  }
  /// As `run`, to the first row: `reset` ends it.
  template <typename... Values>
  int begin(const Values&... values) {
    int index = 0;
    (bind(++index, values), ...);
    return step();
  }

  bool isNull(int column) {
    return sqlite3_column_type(statement_, column) == SQLITE_NULL;
  }
  std::int64_t integer(int column) { return sqlite3_column_int64(statement_, column); }
  std::string text(int column) {
    const unsigned char* text = sqlite3_column_text(statement_, column);
    if (text == nullptr) return {};
    return {reinterpret_cast<const char*>(text),
            static_cast<std::size_t>(sqlite3_column_bytes(statement_, column))};
  }

 private:
  void bind(int index, std::int64_t value) {
    sqlite3_bind_int64(statement_, index, value);
  }
  void bind(int index, std::string_view text) {
    sqlite3_bind_text64(statement_, index, text.data(), text.size(), SQLITE_STATIC,
                        SQLITE_UTF8);
  }
  template <typename T>
  void bind(int index, const std::optional<T>& value) {
    if (value) {
      bind(index, *value);
    } else {
      sqlite3_bind_null(statement_, index);
    }
  }

  sqlite3_stmt* statement_ = nullptr;
};

}  // namespace ostrel
