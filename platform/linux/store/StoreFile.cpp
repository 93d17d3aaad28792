#include "platform/linux/store/StoreFile.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <optional>
#include <string_view>
#include <utility>

#include "base/LockFile.h"
#include "platform/linux/store/StoreSchema.h"

namespace vx::lnx {

namespace {

// Of a file that is begun now; to one that is there the second would be a write.
constexpr const char* kPragmasOfNew[] = {"PRAGMA page_size = 8192",
                                         "PRAGMA auto_vacuum = INCREMENTAL"};
constexpr const char* kPragmas[] = {"PRAGMA journal_mode = WAL", "PRAGMA synchronous = FULL",
                                    "PRAGMA journal_size_limit = 4194304",
                                    "PRAGMA cache_size = -1024", "PRAGMA temp_store = MEMORY"};

// One connection on one thread, and nobody who asks how much memory SQLite uses: it may leave out
// its locks.
void configureOnce() {
  static const bool configured = sqlite3_config(SQLITE_CONFIG_MULTITHREAD) == SQLITE_OK &&
                                 sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0) == SQLITE_OK;
  (void)configured;
}

// errno of the last call that failed on the file; 0: none has.
int systemErrorOf(sqlite3* database) {
  int error = 0;
  if (database != nullptr) sqlite3_file_control(database, "main", SQLITE_FCNTL_LAST_ERRNO, &error);
  return error;
}

}  // namespace

StoreFault faultOf(int code, int systemError) {
  const int primary = code & 0xFF;
  const bool damaged = primary == SQLITE_NOTADB || primary == SQLITE_CORRUPT;
  return damaged && systemError == 0 ? StoreFault::Damaged : StoreFault::Unusable;
}

StoreFault faultOfFinding(const std::string& finding) {
  constexpr std::string_view kCode = "error code";
  const std::size_t at = finding.find(kCode);
  if (at == std::string::npos) return StoreFault::Damaged;
  const std::size_t digits = finding.find_first_of("0123456789", at + kCode.size());
  if (digits == std::string::npos) return StoreFault::Damaged;
  return faultOf(std::atoi(finding.c_str() + digits));
}

StoreLock lockStore(const std::string& directory) {
  constexpr std::string_view kHint = "set STATE_DIRECTORY to a folder that can be written";
  if (mkdir(directory.c_str(), 0750) != 0 && errno != EEXIST) {
    return {{},
            Status::lastError("cannot create the state directory " + directory).withHint(kHint)};
  }
  const std::string path = directory + kLockName;
  Result<UniqueFd> lock = openLockFile(path);
  if (!lock.ok()) return {{}, lock.status().withHint(kHint)};
  if (flock(lock->get(), LOCK_EX | LOCK_NB) != 0) {
    if (errno != EWOULDBLOCK) return {{}, Status::lastError("cannot lock " + path)};
    return {{},
            Status::failure("another vxreportingd uses the store in " + directory +
                            "; stop it, or set STATE_DIRECTORY to a folder of its own"),
            true};
  }
  return {std::move(*lock), {}};
}

OpenedStore openStoreDatabase(const std::string& path, const JournalEpoch& epochIfNew) {
  configureOnce();
  sqlite3* database = nullptr;
  int code = sqlite3_open_v2(
      path.c_str(), &database,
      SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE,
      nullptr);
  OpenedStore opened{Database(database), Status(), StoreFault::None, {}};
  auto fail = [&](int failure) {
    const char* why = database != nullptr ? sqlite3_errmsg(database) : sqlite3_errstr(failure);
    return OpenedStore{nullptr,
                       Status::failure("cannot use " + path + ": " + why),
                       faultOf(failure, systemErrorOf(database)),
                       {}};
  };
  if (code != SQLITE_OK) return fail(code);
  sqlite3_busy_timeout(database, 1000);
  // Before anything is written: a newer one is left as it is.
  Statement versionQuery(database, "PRAGMA user_version");
  if (!versionQuery.row()) return fail(sqlite3_extended_errcode(database));
  const int64_t version = versionQuery.integer(0);
  versionQuery.reset();
  if (version > kStoreSchemaVersion) {
    return {nullptr,
            Status::failure(path + " was written by a newer version of the service (schema " +
                            std::to_string(version) + ")"),
            StoreFault::Newer,
            {}};
  }
  for (const char* pragma : kPragmasOfNew) {
    if (version == 0 && code == SQLITE_OK) code = execute(database, pragma);
  }
  for (const char* pragma : kPragmas) {
    if (code == SQLITE_OK) code = execute(database, pragma);
  }
  if (code != SQLITE_OK) return fail(code);
  // The log and its index stay when the file is closed, empty: without them nobody could read it
  // who may not write into the folder.
  int keep = 1;
  sqlite3_file_control(database, "main", SQLITE_FCNTL_PERSIST_WAL, &keep);
  // A checkpoint at every 4 MiB of log, whatever the size of a page.
  Statement pageSize(database, "PRAGMA page_size");
  if (!pageSize.row()) return fail(sqlite3_extended_errcode(database));
  sqlite3_wal_autocheckpoint(database, static_cast<int>((4 << 20) / pageSize.integer(0)));
  pageSize.reset();
  code = bringSchemaUpToDate(database, version, epochIfNew);
  if (code == SQLITE_OK) code = findSchema(database);
  // What the statement says is not wrong: the tables are not those of its version.
  if (code == SQLITE_ERROR || (code & 0xFF) == SQLITE_CONSTRAINT) {
    OpenedStore failed = fail(code);
    if (systemErrorOf(database) == 0) failed.fault = StoreFault::Damaged;
    return failed;
  }
  if (code != SQLITE_OK) return fail(code);
  const std::optional<JournalEpoch> epoch = epochOf(database);
  if (!epoch) {
    code = sqlite3_extended_errcode(database);
    return fail((code & 0xFF) == SQLITE_DONE || code == SQLITE_OK ? SQLITE_CORRUPT : code);
  }
  opened.epoch = *epoch;
  return opened;
}

namespace {

StoreCheck checkOnce(sqlite3* database, Function<bool()>& goOn) {
  constexpr int kOperations = 20000;
  const auto mustEnd = [](void* question) {
    return (*static_cast<Function<bool()>*>(question))() ? 0 : 1;
  };
  sqlite3_progress_handler(database, goOn ? kOperations : 0, mustEnd, &goOn);
  Statement check(database, "PRAGMA quick_check(1)");
  const bool ended = check.row();
  sqlite3_progress_handler(database, 0, nullptr, nullptr);
  if (!ended && sqlite3_errcode(database) == SQLITE_INTERRUPT)
    return {Status::posix("the check was cut short", ECANCELED), StoreFault::Unusable};
  const int error = systemErrorOf(database);
  if (!ended) {
    return {Status::failure(sqlite3_errmsg(database)),
            faultOf(sqlite3_extended_errcode(database), error)};
  }
  const std::string found = check.text(0);
  if (found == "ok") return {};
  // Not every finding says why a page could not be read.
  return {Status::failure(found), error != 0 ? StoreFault::Unusable : faultOfFinding(found)};
}

}  // namespace

StoreCheck quickCheck(sqlite3* database, Function<bool()> goOn) {
  StoreCheck check = checkOnce(database, goOn);
  // What is damaged is so a second time too.
  return check.fault == StoreFault::Damaged ? checkOnce(database, goOn) : check;
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
