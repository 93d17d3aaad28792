#include "tools/report/StoreReader.h"

#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include "platform/linux/store/StoreSchema.h"
#include "platform/linux/store/StoreViews.h"

namespace vx::report {

namespace {

constexpr double kBeginningOfTime = -1e18;

std::string pathOf(const Options& options) {
  if (const auto named = options.value("--store")) return *named;
  const char* const listed = std::getenv("STATE_DIRECTORY");
  std::string folder = listed != nullptr ? listed : "";
  folder = folder.substr(0, folder.find(':'));
  return (folder.empty() ? "/var/lib/vxreporting" : folder) + "/telemetry.db";
}

// A file: name of SQLite's, in which some characters mean something.
std::string uriOf(const std::string& path, const char* parameters) {
  std::string uri = "file:";
  for (const char c : path) {
    if (c == '%' || c == '?' || c == '#') {
      char escaped[4];
      std::snprintf(escaped, sizeof escaped, "%%%02X", static_cast<unsigned>(c));
      uri += escaped;
    } else {
      uri += c;
    }
  }
  return uri + parameters;
}

}  // namespace

double timeOf(const std::string& text) {
  char* end = nullptr;
  const double number = std::strtod(text.c_str(), &end);
  const std::string unit = end;
  const auto now = static_cast<double>(std::time(nullptr));
  if (end != text.c_str() && number >= 0) {
    if (unit == "s") return now - number;
    if (unit == "m") return now - 60 * number;
    if (unit == "h") return now - 3600 * number;
    if (unit == "d") return now - 86400 * number;
  }
  sqlite3* memory = nullptr;
  sqlite3_open(":memory:", &memory);
  const lnx::Database database(memory);
  Statement parse(memory,
                  "SELECT (julianday(?1) - 2440587.5) * 86400.0 WHERE ?1 LIKE '____-__-__%'");
  parse.bind(std::string_view(text));
  if (!parse.row() || parse.isNull(0)) throw UsageError();
  return parse.real(0);
}

StoreReader::StoreReader(const Options& options)
    : path_(pathOf(options)),
      since_(options.value("--since") ? timeOf(*options.value("--since")) : kBeginningOfTime) {
  open();
  Statement version(database_.get(), "PRAGMA user_version");
  if (!version.row()) fail(version.code());
  const int64_t schema = version.integer(0);
  if (schema > lnx::kStoreSchemaVersion) {
    throw Failure(path_ + " was written by a newer version of the service (schema " +
                  std::to_string(schema) + "); use the vxreport of that version");
  }
  if (schema < lnx::kStoreSchemaVersion && schema > 0) {
    throw Failure(path_ + " was written by an earlier version of the service (schema " +
                  std::to_string(schema) + "); it is brought up to date when the service opens it");
  }
  for (const lnx::StoreView& view : lnx::storeViews()) {
    const int code = Statement(database_.get(), std::string("SELECT * FROM ") + view.name).code();
    if (code == SQLITE_ERROR)
      throw Failure(path_ + " is a database, but not a store of the service");
    if (code != SQLITE_OK) fail(code);
  }
  lnx::execute(database_.get(), "BEGIN");
}

void StoreReader::open() {
  struct stat found {};
  if (stat(path_.c_str(), &found) != 0) {
    const char* const hint =
        errno == ENOENT ? "; name one with --store, or set STATE_DIRECTORY" : "";
    throw Failure("cannot read the store " + path_ + ": " + std::strerror(errno) + hint);
  }
  if (!S_ISREG(found.st_mode)) throw Failure(path_ + " is not a file");
  if (access(path_.c_str(), R_OK) != 0)
    throw Failure("cannot read the store " + path_ + ": " + std::strerror(errno));
  // Where nothing may be written, its log cannot be shared with others. Without one nobody writes.
  struct stat log {};
  const bool alone = stat((path_ + "-wal").c_str(), &log) != 0;
  const std::string folder = path_.substr(0, path_.find_last_of('/') + 1);
  const bool sealed = access(folder.empty() ? "." : folder.c_str(), W_OK) != 0;
  sqlite3* opened = nullptr;
  const int code =
      sqlite3_open_v2(uriOf(path_, alone && sealed ? "?immutable=1" : "").c_str(), &opened,
                      SQLITE_OPEN_READONLY | SQLITE_OPEN_URI | SQLITE_OPEN_EXRESCODE, nullptr);
  database_.reset(opened);
  if (code != SQLITE_OK) fail(code);
  sqlite3_busy_timeout(opened, 5000);
}

void StoreReader::fail(int code) const {
  const std::string why = sqlite3_errmsg(database_.get());
  if ((code & 0xFF) == SQLITE_NOTADB) throw Failure(path_ + " is not a store of the service");
  if ((code & 0xFF) == SQLITE_CORRUPT) {
    throw Failure(path_ + " is damaged (" + why +
                  "); the service takes over what can be read of it when it starts");
  }
  throw Failure("cannot read the store " + path_ + ": " + why);
}

Statement StoreReader::query(const std::string& sql) {
  Statement statement(database_.get(), sql);
  if (statement.code() != SQLITE_OK) fail(statement.code());
  return statement;
}

void StoreReader::check(const Statement& ended) const {
  if (ended.code() != SQLITE_DONE) fail(ended.code());
}

int64_t StoreReader::sessionOf(const std::string& word) {
  const bool exactly = word.starts_with('@');
  Statement find = query(std::string("SELECT max(relay_session) FROM sessions WHERE ") +
                         (exactly ? "relay_session" : "session_id") + " = ?");
  find.bind(numberOf(word.substr(exactly ? 1 : 0)));
  if (!find.row()) fail(find.code());
  if (find.isNull(0)) throw Failure("there is no session " + word + " in " + path_);
  return find.integer(0);
}

}  // namespace vx::report
