// The tables that the service writes, column by column: a column's name, its type in the schema and
// where its value comes from stand in one line.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/linux/store/Database.h"

namespace vx::lnx {

template <class Row>
struct Column {
  const char* name;
  const char* type;
  void (*bind)(Statement& insert, const Row& row);
};

// Immutable. Every table has an `id INTEGER PRIMARY KEY`, before its columns or as the first of
// them. Identifiers are given out in the order of arrival and never reused while the newest row is
// there, so "oldest first" is the order of id.
template <class Row>
struct Table {
  const char* name;
  std::span<const Column<Row>> columns;

  std::string createSql() const {
    const bool givesId = std::string_view(columns.front().name) == "id";
    std::string parts = givesId ? "" : "id INTEGER PRIMARY KEY";
    for (const Column<Row>& column : columns)
      parts += (parts.empty() ? "" : ",\n  ") + std::string(column.name) + " " + column.type;
    return std::string("CREATE TABLE ") + name + "(\n  " + parts + ");\n";
  }
  std::string insertSql() const {
    std::string names;
    std::string places;
    for (const Column<Row>& column : columns) {
      names += (names.empty() ? "" : ", ") + std::string(column.name);
      places += places.empty() ? "?" : ",?";
    }
    return std::string("INSERT INTO ") + name + "(" + names + ") VALUES(" + places + ")";
  }
};

// The prepared INSERT of a table. Confined to its database's thread.
template <class Row>
class Insertion {
 public:
  Insertion(sqlite3* database, const Table<Row>& table)
      : columns_(table.columns), statement_(database, table.insertSql()) {}
  // SQLITE_OK or SQLite's extended error code. The row's texts must stay until it returns.
  int run(const Row& row) {
    for (const Column<Row>& column : columns_) column.bind(statement_, row);
    return statement_.run();
  }

 private:
  const std::span<const Column<Row>> columns_;
  Statement statement_;
};

// Which call a row goes back to, and who made it: NULL where none was recorded.
struct KeyColumns {
  std::optional<int64_t> call;
  std::optional<int64_t> place;
  std::optional<int64_t> user;
};

struct RelaySessionRow {
  double time = 0;
  int64_t sessionID = 0;
  std::optional<int64_t> clientType;
  std::optional<double> clientVersion;
  std::string_view clientName;
  std::string_view serviceName;
  std::optional<int64_t> batchEvent;
  std::optional<int64_t> containsRealtimeEvents;
  std::string_view userInfo;
  KeyColumns key;
};
struct RelayMessageRow {
  int64_t id = 0;
  double time = 0;
  int64_t relaySession = 0;
  uint16_t category = 0;
  uint16_t type = 0;
  std::string_view payload;
  KeyColumns key;
  // The event that says the same, if there is one.
  std::optional<int64_t> eventName;
  std::optional<int64_t> eventPlace;
  std::optional<int64_t> eventMicroseconds;  // later than the message
  std::optional<std::string_view> eventTail;
};
struct EventRow {
  int64_t id = 0;
  double time = 0;
  int64_t name = 0;
  std::string_view payload;
  KeyColumns key;
  std::optional<int64_t> relaySession;  // of the message that it says
};
struct PowerRow {
  double time = 0;
  int64_t clientIdentifier = 0;
  std::string_view name;
  std::string_view record;
  KeyColumns key;
};
struct LedgerRow {
  double time = 0;
  std::string_view event;
  std::optional<std::string_view> table;
  int64_t rows = 0;
  std::string_view detail;
};

extern const Table<RelaySessionRow> kRelaySessions;
extern const Table<RelayMessageRow> kRelayMessages;
extern const Table<EventRow> kAnalyticsEntries;
extern const Table<PowerRow> kPowerRecords;
extern const Table<LedgerRow> kStoreLedger;

}  // namespace vx::lnx
