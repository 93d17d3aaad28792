#include "platform/linux/store/StoreFile.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <ctime>

#include "platform/linux/store/StoreSchema.h"

namespace vx::lnx {

namespace {

// Set before anything is read: page_size holds for a file that is begun now.
constexpr const char* kPragmas[] = {"PRAGMA page_size = 16384",
                                    "PRAGMA journal_mode = WAL",
                                    "PRAGMA synchronous = FULL",
                                    "PRAGMA wal_autocheckpoint = 1000",
                                    "PRAGMA journal_size_limit = 67108864",
                                    "PRAGMA cache_size = -1024",
                                    "PRAGMA temp_store = MEMORY"};

// One connection on one thread, and nobody who asks how much memory SQLite uses: it may leave out
// its locks.
void configureOnce() {
  static const bool configured = sqlite3_config(SQLITE_CONFIG_MULTITHREAD) == SQLITE_OK &&
                                 sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0) == SQLITE_OK;
  (void)configured;
}

bool isDamage(int code) {
  const int primary = code & 0xFF;
  return primary == SQLITE_NOTADB || primary == SQLITE_CORRUPT;
}

}  // namespace

Result<UniqueFd> lockStore(const std::string& directory) {
  constexpr std::string_view kHint = "set STATE_DIRECTORY to a folder that can be written";
  if (mkdir(directory.c_str(), 0750) != 0 && errno != EEXIST)
    return Status::lastError("cannot create the state directory " + directory).withHint(kHint);
  const std::string path = directory + "/telemetry.lock";
  UniqueFd lock(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0640));
  if (!lock) return Status::lastError("cannot open " + path).withHint(kHint);
  if (flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
    return Status::failure("another vxreportingd uses the store in " + directory +
                           "; stop it, or set STATE_DIRECTORY to a folder of its own");
  }
  return lock;
}

OpenedStore openStoreDatabase(const std::string& path) {
  configureOnce();
  sqlite3* database = nullptr;
  int code = sqlite3_open_v2(
      path.c_str(), &database,
      SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE,
      nullptr);
  OpenedStore opened{Database(database), Status(), StoreFault::None};
  auto fail = [&](int failure) {
    const char* why = database != nullptr ? sqlite3_errmsg(database) : sqlite3_errstr(failure);
    const StoreFault fault = isDamage(failure) ? StoreFault::Damaged : StoreFault::Unusable;
    return OpenedStore{nullptr, Status::failure("cannot use " + path + ": " + why), fault};
  };
  if (code != SQLITE_OK) return fail(code);
  sqlite3_busy_timeout(database, 1000);
  for (const char* pragma : kPragmas) {
    code = execute(database, pragma);
    if (code != SQLITE_OK) return fail(code);
  }
  Statement versionQuery(database, "PRAGMA user_version");
  if (!versionQuery.row()) return fail(sqlite3_extended_errcode(database));
  const int64_t version = versionQuery.integer(0);
  versionQuery.reset();
  if (version > kStoreSchemaVersion) {
    return {nullptr,
            Status::failure(path + " was written by a newer version of the service (schema " +
                            std::to_string(version) + "); move it away or install that version"),
            StoreFault::Unusable};
  }
  code = bringSchemaUpToDate(database, version);
  if (code != SQLITE_OK) return fail(code);
  return opened;
}

Status quickCheck(sqlite3* database) {
  Statement check(database, "PRAGMA quick_check(1)");
  if (!check.row()) return Status::failure(sqlite3_errmsg(database));
  const std::string found = check.text(0);
  return found == "ok" ? Status() : Status::failure(found);
}

Result<std::string> moveAside(const std::string& path) {
  char stamp[32];
  const std::time_t now = std::time(nullptr);
  std::tm parts{};
  localtime_r(&now, &parts);
  std::strftime(stamp, sizeof stamp, "%Y%m%d-%H%M%S", &parts);
  std::string target = path + ".damaged-" + stamp;
  for (int n = 2; access(target.c_str(), F_OK) == 0; ++n)
    target = path + ".damaged-" + stamp + "-" + std::to_string(n);
  if (std::rename(path.c_str(), target.c_str()) != 0)
    return Status::lastError("cannot move " + path + " aside");
  for (const char* suffix : {"-wal", "-shm"}) {
    (void)std::rename((path + suffix).c_str(), (target + suffix).c_str());  // there may be none
  }
  return target;
}

}  // namespace vx::lnx
