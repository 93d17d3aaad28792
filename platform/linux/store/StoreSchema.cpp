#include "platform/linux/store/StoreSchema.h"

#include <string>
#include <vector>

#include "platform/linux/store/Database.h"
#include "platform/linux/store/StoreTables.h"

namespace vx::lnx {

namespace {

constexpr const char* kMessageView = R"sql(
CREATE VIEW session_messages AS
  SELECT m.id, datetime(m.time, 'unixepoch', 'localtime') AS at, s.session_id, s.service_name,
         json_extract(s.user_info, '$.HostApplicationDisplayID') AS application, m.category, m.type, m.payload
  FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session;
)sql";

// An event says what a relay message says and a little more. Its entry names that message and keeps
// what its text has after the message's (`,"k":1}`); without a message, it keeps the whole text.
constexpr const char* kEventNames =
    "CREATE TABLE event_names(id INTEGER PRIMARY KEY, name TEXT NOT NULL UNIQUE);";
constexpr const char* kEventViews = R"sql(
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

using Script = std::vector<std::string>;

Script wholeSchema() {
  return {kRelaySessions.createSql(),
          kRelayMessages.createSql(),
          kPowerRecords.createSql(),
          kStoreLedger.createSql(),
          kMessageView,
          kEventNames,
          kAnalyticsEntries.createSql(),
          kEventViews};
}

Script fromVersion1() {
  return {kEventsBefore, kEventNames, kAnalyticsEntries.createSql(), kEventViews, kMoveEvents};
}

int executeInOneTransaction(sqlite3* database, const Script& script) {
  int code = execute(database, "BEGIN IMMEDIATE");
  for (const std::string& sql : script) {
    if (code == SQLITE_OK) code = execute(database, sql.c_str());
  }
  if (code == SQLITE_OK) code = execute(database, "COMMIT");
  if (code != SQLITE_OK) execute(database, "ROLLBACK");
  return code;
}

}  // namespace

int bringSchemaUpToDate(sqlite3* database, int64_t version) {
  if (version == kStoreSchemaVersion) return SQLITE_OK;
  Script script = version == 0 ? wholeSchema() : fromVersion1();
  script.push_back("PRAGMA user_version = " + std::to_string(kStoreSchemaVersion));
  return executeInOneTransaction(database, script);
}

}  // namespace vx::lnx
