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

inline constexpr const char* kLockName = "/telemetry.lock";

// Creates the folder if need be. The lock lasts as long as the descriptor.
struct StoreLock {
  UniqueFd fd;    // none unless the status is ok
  Status status;  // why there is none
  bool heldByAnother = false;
};
StoreLock lockStore(const std::string& directory);

enum class StoreFault : uint8_t {
  None,
  Damaged,   // not a database, or not a whole one: to be moved aside
  Newer,     // of a later version of the service: to be left alone
  Unusable,  // cannot be read or written now; says nothing about what is in it
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

struct StoreCheck {
  Status status;  // what `PRAGMA quick_check` found, or why it could not look
  StoreFault fault = StoreFault::None;
};
// Is cut short (ECANCELED) when `goOn`, which is asked every few milliseconds, says no.
StoreCheck quickCheck(sqlite3* database, Function<bool()> goOn = nullptr);

// What an SQLite error says about the file. `systemError`: errno of the last call that failed on it
// (SQLITE_FCNTL_LAST_ERRNO), because SQLite says of a read error that the file is malformed.
StoreFault faultOf(int code, int systemError = 0);
// The same of what the check found: among that is a page that could not be read.
StoreFault faultOfFinding(const std::string& finding);

// Moves the file and its companions out of the way, to "<path>.damaged-YYYYMMDD-HHMMSS[-n]". The
// new name.
Result<std::string> moveAside(const std::string& path);

}  // namespace vx::lnx
