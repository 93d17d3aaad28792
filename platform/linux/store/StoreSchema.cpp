#include "platform/linux/store/StoreSchema.h"

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <initializer_list>

namespace vx::lnx {

namespace {

// Identifiers are given out in the order of arrival and never reused while the newest row is there,
// so "oldest first" is the order of id.
constexpr const char* kTables = R"sql(
CREATE TABLE relay_sessions(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, session_id INTEGER NOT NULL, client_type INTEGER, client_version REAL,
  client_name TEXT, service_name TEXT, batch_event INTEGER, contains_realtime_events INTEGER, user_info TEXT NOT NULL);
CREATE TABLE relay_messages(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, relay_session INTEGER NOT NULL, category INTEGER NOT NULL,
  type INTEGER NOT NULL, payload TEXT NOT NULL);
CREATE TABLE power_records(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, client_identifier INTEGER NOT NULL, name TEXT NOT NULL,
  record TEXT NOT NULL);
CREATE TABLE store_ledger(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, event TEXT NOT NULL, table_name TEXT, rows INTEGER, detail TEXT);
CREATE VIEW session_messages AS
  SELECT m.id, datetime(m.time, 'unixepoch', 'localtime') AS at, s.session_id, s.service_name,
         json_extract(s.user_info, '$.HostApplicationDisplayID') AS application, m.category, m.type, m.payload
  FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session;
)sql";

// An event says what a relay message says and a little more. Its entry names that message and keeps
// what its text has behind the message's (`,"k":1}`); without a message, it keeps the whole text.
constexpr const char* kEvents = R"sql(
CREATE TABLE event_names(id INTEGER PRIMARY KEY, name TEXT NOT NULL UNIQUE);
CREATE TABLE analytics_entries(
  id INTEGER PRIMARY KEY, time REAL NOT NULL, name INTEGER NOT NULL, message INTEGER, payload TEXT NOT NULL);
CREATE VIEW analytics_events AS
  SELECT e.id, e.time, (SELECT n.name FROM event_names n WHERE n.id = e.name) AS name,
         CASE WHEN e.message IS NULL THEN e.payload
              ELSE (SELECT substr(m.payload, 1, length(m.payload) - 1) FROM relay_messages m WHERE m.id = e.message)
                   || e.payload END AS payload
  FROM analytics_entries e;
CREATE VIEW client_uptimes AS
  SELECT id, datetime(time, 'unixepoch', 'localtime') AS at, json_extract(payload, '$.processName') AS process,
         json_extract(payload, '$.seconds') AS seconds
  FROM analytics_events WHERE name = 'com.quorvel.sonik.vxreportingclientuptime';
PRAGMA user_version = 2;
)sql";

// Version 1 kept every event's name and text in a table of their own.
constexpr const char* kEventsBefore = R"sql(
DROP VIEW client_uptimes;
ALTER TABLE analytics_events RENAME TO events_before;
)sql";
constexpr const char* kMoveEvents = R"sql(
INSERT INTO event_names(name) SELECT DISTINCT name FROM events_before;
INSERT INTO analytics_entries(id, time, name, payload)
  SELECT b.id, b.time, n.id, b.payload FROM events_before b JOIN event_names n ON n.name = b.name ORDER BY b.id;
DROP TABLE events_before;
)sql";

int executeInOrder(sqlite3* database, std::initializer_list<const char*> statements) {
  int code = execute(database, "BEGIN IMMEDIATE");
  for (const char* sql : statements) {
    if (code == SQLITE_OK) code = execute(database, sql);
  }
  if (code == SQLITE_OK) return execute(database, "COMMIT");
  execute(database, "ROLLBACK");
  return code;
}

std::string sqliteProblem(const std::string& path, int code, const char* message) {
  return "cannot use " + path + ": " + (message != nullptr ? message : sqlite3_errstr(code));
}

bool isDamage(int code) {
  const int primary = code & 0xFF;
  return primary == SQLITE_NOTADB || primary == SQLITE_CORRUPT;
}

}  // namespace

Statement::Statement(sqlite3* database, std::string_view sql) {
  sqlite3_stmt* made = nullptr;
  code_ = sqlite3_prepare_v3(database, sql.data(), static_cast<int>(sql.size()),
                             SQLITE_PREPARE_PERSISTENT, &made, nullptr);
  statement_.reset(made);
}

Statement& Statement::bind(int64_t value) {
  sqlite3_bind_int64(statement_.get(), next_++, value);
  return *this;
}

Statement& Statement::bind(double value) {
  sqlite3_bind_double(statement_.get(), next_++, value);
  return *this;
}

Statement& Statement::bind(std::string_view text) {
  sqlite3_bind_text64(statement_.get(), next_++, text.data(), text.size(), SQLITE_STATIC,
                      SQLITE_UTF8);
  return *this;
}

Statement& Statement::bindNull() {
  sqlite3_bind_null(statement_.get(), next_++);
  return *this;
}

int Statement::run() {
  if (statement_ == nullptr) return code_ != SQLITE_OK ? code_ : SQLITE_MISUSE;
  sqlite3_step(statement_.get());
  next_ = 1;
  return sqlite3_reset(statement_.get());
}

bool Statement::row() {
  return statement_ != nullptr && sqlite3_step(statement_.get()) == SQLITE_ROW;
}

std::string Statement::text(int column) const {
  const unsigned char* text = sqlite3_column_text(statement_.get(), column);
  return text != nullptr ? reinterpret_cast<const char*>(text) : "";
}

void Statement::reset() {
  sqlite3_reset(statement_.get());
  next_ = 1;
}

int execute(sqlite3* database, const char* sql) {
  return sqlite3_exec(database, sql, nullptr, nullptr, nullptr);
}

OpenOutcome openStoreDatabase(const std::string& path, Database& database, std::string& problem) {
  // One connection on one thread, and nobody who asks how much memory SQLite uses: it may leave out
  // its locks.
  static const bool configured = sqlite3_config(SQLITE_CONFIG_MULTITHREAD) == SQLITE_OK &&
                                 sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0) == SQLITE_OK;
  (void)configured;
  sqlite3* opened = nullptr;
  int code = sqlite3_open_v2(
      path.c_str(), &opened,
      SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE,
      nullptr);
  database.reset(opened);
  auto fail = [&](int failure) {
    problem = sqliteProblem(path, failure, opened != nullptr ? sqlite3_errmsg(opened) : nullptr);
    return isDamage(failure) ? OpenOutcome::Damaged : OpenOutcome::Unusable;
  };
  if (code != SQLITE_OK) return fail(code);
  sqlite3_busy_timeout(opened, 1000);
  for (const char* pragma :
       {"PRAGMA page_size = 16384", "PRAGMA journal_mode = WAL", "PRAGMA synchronous = FULL",
        "PRAGMA wal_autocheckpoint = 1000", "PRAGMA journal_size_limit = 67108864",
        "PRAGMA cache_size = -1024", "PRAGMA temp_store = MEMORY"}) {
    code = execute(opened, pragma);
    if (code != SQLITE_OK) return fail(code);
  }
  Statement versionQuery(opened, "PRAGMA user_version");
  if (!versionQuery.row()) return fail(sqlite3_extended_errcode(opened));
  const int64_t version = versionQuery.integer(0);
  versionQuery.reset();
  if (version > kStoreSchemaVersion) {
    problem = path + " was written by a newer version of the service (schema " +
              std::to_string(version) + "); move it away or install that version";
    return OpenOutcome::Unusable;
  }
  if (version == 0) code = executeInOrder(opened, {kTables, kEvents});
  if (version == 1) code = executeInOrder(opened, {kEventsBefore, kEvents, kMoveEvents});
  if (code != SQLITE_OK) return fail(code);
  return OpenOutcome::Ready;
}

bool quickCheck(sqlite3* database, std::string& found) {
  Statement check(database, "PRAGMA quick_check(1)");
  if (!check.row()) {
    found = sqlite3_errmsg(database);
    return false;
  }
  found = check.text(0);
  check.reset();
  return found == "ok";
}

std::string moveAside(const std::string& path, std::string& problem) {
  char stamp[32];
  const std::time_t now = std::time(nullptr);
  std::tm parts{};
  localtime_r(&now, &parts);
  std::strftime(stamp, sizeof stamp, "%Y%m%d-%H%M%S", &parts);
  std::string target = path + ".damaged-" + stamp;
  for (int n = 2; access(target.c_str(), F_OK) == 0; ++n)
    target = path + ".damaged-" + stamp + "-" + std::to_string(n);
  if (std::rename(path.c_str(), target.c_str()) != 0) {
    problem = "cannot move " + path + " aside: " + std::strerror(errno);
    return {};
  }
  for (const char* suffix : {"-wal", "-shm"}) {
    (void)std::rename((path + suffix).c_str(), (target + suffix).c_str());  // there may be none
  }
  return target;
}

}  // namespace vx::lnx
