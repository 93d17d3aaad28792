#include "platform/linux/store/StoreSchema.h"

#include <algorithm>
#include <ranges>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/store/Database.h"
#include "platform/linux/store/StoreTables.h"
#include "platform/linux/store/StoreViews.h"

namespace vx::lnx {

namespace {

constexpr std::string_view kEventsView = "analytics_events";

constexpr const char* kEventNames =
    "CREATE TABLE event_names(id INTEGER PRIMARY KEY, name TEXT NOT NULL UNIQUE);";

// The epochs within which the (call, place) of a row is its name: each of the rows after the given
// ones, up to those of the next. And every so many rows, the highest call so far and the last id of
// messages and events (see KnownRows).
constexpr const char* kBookkeeping = R"sql(
CREATE TABLE store_epochs(id INTEGER PRIMARY KEY, epoch BLOB NOT NULL,
  after_row INTEGER NOT NULL DEFAULT 0, after_power INTEGER NOT NULL DEFAULT 0, after_session INTEGER NOT NULL DEFAULT 0);
CREATE TABLE store_marks(id INTEGER PRIMARY KEY, call INTEGER NOT NULL, last_row INTEGER NOT NULL);
)sql";

// What follows is fixed: it makes of an older file what its successor was, whatever the tables
// above become.

// Version 1 kept every event's name and text in a table of their own.
constexpr const char* kFromVersion1 = R"sql(
ALTER TABLE analytics_events RENAME TO events_before;
CREATE TABLE event_names(id INTEGER PRIMARY KEY, name TEXT NOT NULL UNIQUE);
CREATE TABLE analytics_entries(
  id INTEGER PRIMARY KEY,
  time REAL NOT NULL,
  name INTEGER NOT NULL,
  message INTEGER,
  payload TEXT NOT NULL);
INSERT INTO event_names(name) SELECT DISTINCT name FROM events_before;
INSERT INTO analytics_entries(id, time, name, payload)
  SELECT b.id, b.time, n.id, b.payload FROM events_before b JOIN event_names n ON n.name = b.name ORDER BY b.id;
DROP TABLE events_before;
)sql";

// Version 2 kept an entry of its own for each event, and could not tell where a row came from. An
// entry that was left out after its message's text was no JSON.
constexpr const char* kFromVersion2 = R"sql(
ALTER TABLE relay_sessions ADD COLUMN call INTEGER;
ALTER TABLE relay_sessions ADD COLUMN place INTEGER;
ALTER TABLE relay_sessions ADD COLUMN uid INTEGER;
ALTER TABLE relay_sessions ADD COLUMN ended_at REAL;
ALTER TABLE relay_sessions ADD COLUMN ended_how TEXT;
ALTER TABLE relay_messages ADD COLUMN call INTEGER;
ALTER TABLE relay_messages ADD COLUMN place INTEGER;
ALTER TABLE relay_messages ADD COLUMN uid INTEGER;
ALTER TABLE relay_messages ADD COLUMN event_name INTEGER;
ALTER TABLE relay_messages ADD COLUMN event_place INTEGER;
ALTER TABLE relay_messages ADD COLUMN event_microseconds INTEGER;
ALTER TABLE relay_messages ADD COLUMN event_tail TEXT;
ALTER TABLE analytics_entries ADD COLUMN call INTEGER;
ALTER TABLE analytics_entries ADD COLUMN place INTEGER;
ALTER TABLE analytics_entries ADD COLUMN uid INTEGER;
ALTER TABLE analytics_entries ADD COLUMN relay_session INTEGER;
ALTER TABLE power_records ADD COLUMN call INTEGER;
ALTER TABLE power_records ADD COLUMN place INTEGER;
ALTER TABLE power_records ADD COLUMN uid INTEGER;
UPDATE analytics_entries SET message = NULL WHERE message IS NOT NULL AND substr(payload, 1, 1) = '{';
CREATE TABLE store_epochs(id INTEGER PRIMARY KEY, epoch BLOB NOT NULL,
  after_row INTEGER NOT NULL DEFAULT 0, after_power INTEGER NOT NULL DEFAULT 0, after_session INTEGER NOT NULL DEFAULT 0);
CREATE TABLE store_marks(id INTEGER PRIMARY KEY, call INTEGER NOT NULL, last_row INTEGER NOT NULL);
)sql";

using Script = std::vector<std::string>;

// Version 3 had other views.
Script scriptFrom(int64_t version) {
  Script script;
  // A view that reads a table would keep it from being changed.
  for (const StoreView& view : storeViews() | std::views::reverse) {
    // Of the first version, one of them was a table.
    if (version != 1 || std::string_view(view.name) != kEventsView)
      script.push_back(std::string("DROP VIEW IF EXISTS ") + view.name);
  }
  if (version <= 0) {
    for (const std::string& table :
         {kRelaySessions.createSql(), kRelayMessages.createSql(), kPowerRecords.createSql(),
          kStoreLedger.createSql(), std::string(kEventNames), kAnalyticsEntries.createSql(),
          std::string(kBookkeeping)})
      script.push_back(table);
  }
  if (version == 1) script.emplace_back(kFromVersion1);
  if (version == 1 || version == 2) script.emplace_back(kFromVersion2);
  for (const StoreView& view : storeViews()) script.push_back(view.createSql());
  return script;
}

int beginEpoch(sqlite3* database, const JournalEpoch& epoch) {
  Statement insert(database,
                   "INSERT INTO store_epochs(epoch) SELECT ?"
                   " WHERE NOT EXISTS (SELECT 1 FROM store_epochs)");
  return insert.bind(std::span<const uint8_t>(epoch)).run();
}

}  // namespace

Status adoptEpoch(sqlite3* database, const JournalEpoch& epoch) {
  Statement insert(database,
                   "INSERT INTO store_epochs(epoch, after_row, after_power, after_session)"
                   " SELECT ?, max(ifnull((SELECT max(id) FROM relay_messages), 0),"
                   " ifnull((SELECT max(id) FROM analytics_entries), 0)),"
                   " ifnull((SELECT max(id) FROM power_records), 0),"
                   " ifnull((SELECT max(id) FROM relay_sessions), 0)");
  if (insert.bind(std::span<const uint8_t>(epoch)).run() == SQLITE_OK) return {};
  return Status::failure(sqlite3_errmsg(database));
}

std::optional<JournalEpoch> epochOf(sqlite3* database) {
  Statement query(database, "SELECT epoch FROM store_epochs ORDER BY id DESC LIMIT 1");
  if (!query.row()) return std::nullopt;
  JournalEpoch epoch{};
  const std::span<const uint8_t> bytes = query.blob(0);
  std::copy_n(bytes.begin(), std::min(bytes.size(), epoch.size()), epoch.begin());
  return epoch;
}

int findSchema(sqlite3* database) {
  int code = SQLITE_OK;
  for (const StoreView& view : storeViews()) {
    if (code == SQLITE_OK)
      code = Statement(database, std::string("SELECT * FROM ") + view.name).code();
  }
  for (const std::string& sql :
       {kRelaySessions.insertSql(), kRelayMessages.insertSql(), kAnalyticsEntries.insertSql(),
        kPowerRecords.insertSql(), kStoreLedger.insertSql(),
        std::string("INSERT INTO event_names(id, name) VALUES(?, ?)"),
        std::string("INSERT INTO store_marks(id, call, last_row) VALUES(?, ?, ?)"),
        std::string("SELECT epoch, after_row, after_power, after_session FROM store_epochs")}) {
    if (code == SQLITE_OK) code = Statement(database, sql).code();
  }
  return code;
}

int bringSchemaUpToDate(sqlite3* database, int64_t version, const JournalEpoch& epochIfNew) {
  if (version == kStoreSchemaVersion) return SQLITE_OK;
  Script script = scriptFrom(version);
  script.push_back("PRAGMA user_version = " + std::to_string(kStoreSchemaVersion));
  int code = execute(database, "BEGIN IMMEDIATE");
  for (const std::string& sql : script) {
    if (code == SQLITE_OK) code = execute(database, sql.c_str());
  }
  if (code == SQLITE_OK) code = beginEpoch(database, epochIfNew);
  if (code == SQLITE_OK) code = execute(database, "COMMIT");
  if (code != SQLITE_OK) execute(database, "ROLLBACK");
  return code;
}

}  // namespace vx::lnx
