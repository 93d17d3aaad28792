// The schema of the database: its tables and views, and how an older file gets them.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <optional>

#include "base/Status.h"
#include "platform/linux/journal/JournalFormat.h"

namespace vx::lnx {

inline constexpr int64_t kStoreSchemaVersion = 4;

// Brings a database of `version` (0: an empty one) up to kStoreSchemaVersion, in one transaction. A
// database that has no epoch gets this one. SQLITE_OK or SQLite's extended error code.
int bringSchemaUpToDate(sqlite3* database, int64_t version, const JournalEpoch& epochIfNew);

// Whether the tables and views are there that the service writes and others read. SQLITE_OK,
// SQLITE_ERROR, or why it cannot be told.
int findSchema(sqlite3* database);

// Makes the keys of later rows those of another epoch; earlier ones keep theirs.
Status adoptEpoch(sqlite3* database, const JournalEpoch& epoch);

// The epoch of the rows that are written now; none when that cannot be read.
std::optional<JournalEpoch> epochOf(sqlite3* database);

}  // namespace vx::lnx
