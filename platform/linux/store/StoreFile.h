// The store's files: the lock, opening and checking the database, moving a damaged one aside.
#pragma once

#include <cstdint>
#include <string>

#include "base/Function.h"
#include "base/Status.h"
#include "base/UniqueFd.h"
#include "platform/linux/journal/JournalFormat.h"
#include "platform/linux/store/Database.h"

namespace vx::lnx {

// Creates the folder if need be. A failure when another process holds the lock, or the folder
// cannot be used. The lock lasts as long as the descriptor.
Result<UniqueFd> lockStore(const std::string& directory);

enum class StoreFault : uint8_t {
  None,
  Damaged,   // not a database, or not one that can be read: to be moved aside
  Unusable,  // the folder or file cannot be used
};

struct OpenedStore {
  Database database;  // null unless the status is ok
  Status status;
  StoreFault fault = StoreFault::None;
  JournalEpoch epoch{};
};

// Opens or creates the file, sets its modes and brings its schema up to date. A store that has no
// epoch yet gets this one.
OpenedStore openStoreDatabase(const std::string& path, const JournalEpoch& epochIfNew);

// Fails, with what was found, unless `PRAGMA quick_check` finds nothing; ECANCELED when `goOn`,
// which is asked every few milliseconds, says no.
Status quickCheck(sqlite3* database, Function<bool()> goOn = nullptr);

// Moves the file and its companions out of the way, to "<path>.damaged-YYYYMMDD-HHMMSS[-n]". The
// new name.
Result<std::string> moveAside(const std::string& path);

}  // namespace vx::lnx
