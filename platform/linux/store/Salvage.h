// What can still be read of a damaged store.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <string>

namespace vx::lnx {

// Copies into a fresh store the rows of a damaged one that SQLite can read: of each table the
// newest until the first that cannot be read, and the oldest likewise. In transactions of few rows.
// The epochs of their keys take the place of the fresh store's. How many rows; 0 when the file is
// no database at all.
int64_t takeOverRows(const std::string& damaged, sqlite3* fresh);

}  // namespace vx::lnx
