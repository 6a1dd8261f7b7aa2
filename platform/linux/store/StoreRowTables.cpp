#include "platform/linux/store/StoreRowTables.h"

#include <sqlite3.h>

#include <new>

namespace ostrel {
namespace {

void giveText(sqlite3_context* context, const RowBatch& rows, RowText text) {
  if (!text.isThere) {
    sqlite3_result_null(context);
    return;
  }
  const std::string_view piece = rows.of(text);
  sqlite3_result_text64(context, piece.data(), piece.size(), SQLITE_STATIC, SQLITE_UTF8);
}

struct Messages {
  static constexpr const char* kName = "batch_messages";
  static constexpr const char* kDeclaration =
      "CREATE TABLE x(telemetry_session_id, session_info, user_info, category, type, "
      "payload, created_at)";

  static std::size_t size(const RowBatch& rows) { return rows.messages.size(); }

  static void column(sqlite3_context* context, const RowBatch& rows, std::size_t index,
                     int column) {
    const MessageRow& row = rows.messages[index];
    switch (column) {
      case 0:
        if (row.session) sqlite3_result_int64(context, *row.session);
        break;
      case 1:
        giveText(context, rows, row.sessionInfo);
        break;
      case 2:
        giveText(context, rows, row.userInfo);
        break;
      case 3:
        sqlite3_result_int(context, row.category);
        break;
      case 4:
        sqlite3_result_int(context, row.type);
        break;
      case 5:
        giveText(context, rows, row.payload);
        break;
      default:
        sqlite3_result_int64(context, row.createdAt);
        break;
    }
  }
};

struct Analytics {
  static constexpr const char* kName = "batch_analytics";
  static constexpr const char* kDeclaration = "CREATE TABLE x(name, payload, created_at)";

  static std::size_t size(const RowBatch& rows) { return rows.analytics.size(); }

  static void column(sqlite3_context* context, const RowBatch& rows, std::size_t index,
                     int column) {
    const AnalyticsRow& row = rows.analytics[index];
    switch (column) {
      case 0:
        giveText(context, rows, row.name);
        break;
      case 1:
        giveText(context, rows, row.payload);
        break;
      default:
        sqlite3_result_int64(context, row.createdAt);
        break;
    }
  }
};

// A read-only virtual table that is there without being created.
template <typename Rows>
struct RowTable {
  struct Table : sqlite3_vtab {
    const RowBatch* const* rows = nullptr;
  };
  struct Cursor : sqlite3_vtab_cursor {
    std::size_t index = 0;
  };

  static const RowBatch& rowsOf(const sqlite3_vtab_cursor* cursor) {
    return **static_cast<const Table*>(cursor->pVtab)->rows;
  }

  static int connect(sqlite3* connection, void* rows, int, const char* const*,
                     sqlite3_vtab** out, char**) {
    const int code = sqlite3_declare_vtab(connection, Rows::kDeclaration);
    if (code != SQLITE_OK) return code;
    auto* table = new (std::nothrow) Table();
    if (table == nullptr) return SQLITE_NOMEM;
    table->rows = static_cast<const RowBatch* const*>(rows);
    *out = table;
    return SQLITE_OK;
  }
  static int disconnect(sqlite3_vtab* table) {
    delete static_cast<Table*>(table);
    return SQLITE_OK;
  }
  static int bestIndex(sqlite3_vtab*, sqlite3_index_info* info) {
    info->estimatedCost = 1;
    return SQLITE_OK;
  }
  static int open(sqlite3_vtab*, sqlite3_vtab_cursor** out) {
    *out = new (std::nothrow) Cursor();
    return *out != nullptr ? SQLITE_OK : SQLITE_NOMEM;
  }
  static int close(sqlite3_vtab_cursor* cursor) {
    delete static_cast<Cursor*>(cursor);
    return SQLITE_OK;
  }
  static int filter(sqlite3_vtab_cursor* cursor, int, const char*, int, sqlite3_value**) {
    static_cast<Cursor*>(cursor)->index = 0;
    return SQLITE_OK;
  }
  static int next(sqlite3_vtab_cursor* cursor) {
    ++static_cast<Cursor*>(cursor)->index;
    return SQLITE_OK;
  }
  static int isAtEnd(sqlite3_vtab_cursor* cursor) {
    return static_cast<Cursor*>(cursor)->index >= Rows::size(rowsOf(cursor)) ? 1 : 0;
  }
  static int column(sqlite3_vtab_cursor* cursor, sqlite3_context* context, int column) {
    Rows::column(context, rowsOf(cursor), static_cast<Cursor*>(cursor)->index, column);
    return SQLITE_OK;
  }
  static int rowID(sqlite3_vtab_cursor* cursor, sqlite3_int64* id) {
    *id = static_cast<sqlite3_int64>(static_cast<Cursor*>(cursor)->index);
    return SQLITE_OK;
  }

  static const sqlite3_module& module() {
    static const sqlite3_module module = [] {
      sqlite3_module made{};
      made.iVersion = 1;
      made.xConnect = connect;
      made.xBestIndex = bestIndex;
      made.xDisconnect = disconnect;
      made.xOpen = open;
      made.xClose = close;
      made.xFilter = filter;
      made.xNext = next;
      made.xEof = isAtEnd;
      made.xColumn = column;
      made.xRowid = rowID;
      return made;
    }();
    return module;
  }
};

template <typename Rows>
int registerTable(sqlite3* connection, const RowBatch* const* rows) {
  return sqlite3_create_module_v2(connection, Rows::kName, &RowTable<Rows>::module(),
                                  const_cast<const RowBatch**>(rows), nullptr);
}

}  // namespace

int registerRowTables(sqlite3* connection, const RowBatch* const* rows) {
  const int code = registerTable<Messages>(connection, rows);
  return code != SQLITE_OK ? code : registerTable<Analytics>(connection, rows);
}

}  // namespace ostrel
