#pragma once

#include "platform/linux/store/StoreRows.h"

struct sqlite3;

namespace ostrel {

/// Makes the rows of `*rows` readable in SQL as the tables `batch_messages` and
/// `batch_analytics`, with the columns of the tables that they go to. A single
/// INSERT ... SELECT then writes a batch: 0.85 µs a row in place of 1.16 µs by
/// one statement each. `*rows` is read while such a statement runs. Returns
/// SQLite's code.
int registerRowTables(sqlite3* connection, const RowBatch* const* rows);

}  // namespace ostrel
