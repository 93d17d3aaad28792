#include "platform/linux/store/Salvage.h"

#include <algorithm>
#include <vector>

#include "platform/linux/store/Database.h"

namespace vx::lnx {

namespace {

// Names before those who refer to them.
constexpr const char* kTables[] = {"event_names",       "relay_sessions", "relay_messages",
                                   "analytics_entries", "power_records",  "store_ledger"};
constexpr int64_t kRowsPerTransaction = 500;

std::vector<std::string> columnsOf(sqlite3* database, const std::string& table) {
  std::vector<std::string> names;
  Statement query(database, "SELECT name FROM pragma_table_info('" + table + "')");
  while (query.row()) names.push_back(query.text(0));
  return names;
}

class TableCopy {
 public:
  TableCopy(sqlite3* from, sqlite3* to, std::string table)
      : from_(from), to_(to), table_(std::move(table)) {
    const std::vector<std::string> there = columnsOf(from, table_);
    for (const std::string& name : columnsOf(to, table_)) {
      if (std::ranges::find(there, name) == there.end()) continue;
      columns_ += (columns_.empty() ? "" : ",") + name;
      places_ += places_.empty() ? "?" : ",?";
      ++count_;
    }
  }
  int64_t run() { return count_ == 0 ? 0 : copy("DESC") + copy("ASC"); }

 private:
  // Until the end or the first row that cannot be read, or is there already.
  int64_t copy(const char* order) {
    Statement read(from_, "SELECT " + columns_ + " FROM " + table_ + " ORDER BY id " + order);
    Statement insert(
        to_, "INSERT OR IGNORE INTO " + table_ + "(" + columns_ + ") VALUES(" + places_ + ")");
    int64_t rows = 0;
    bool more = true;
    while (more && execute(to_, "BEGIN IMMEDIATE") == SQLITE_OK) {
      const int64_t before = rows;
      do {
        more = read.row();
        for (int i = 0; more && i < count_; ++i) insert.bindCopyOf(read, i);
        more = more && insert.run() == SQLITE_OK && sqlite3_changes(to_) == 1;
        rows += more ? 1 : 0;
      } while (more && rows - before < kRowsPerTransaction);
      if (execute(to_, "COMMIT") != SQLITE_OK) {
        execute(to_, "ROLLBACK");
        return before;
      }
    }
    return rows;
  }

  sqlite3* const from_;
  sqlite3* const to_;
  const std::string table_;
  std::string columns_;
  std::string places_;
  int count_ = 0;
};

void takeOverEpochs(sqlite3* damaged, sqlite3* fresh) {
  if (!Statement(damaged, "SELECT epoch FROM store_epochs").row()) return;
  if (execute(fresh, "DELETE FROM store_epochs") == SQLITE_OK)
    TableCopy(damaged, fresh, "store_epochs").run();
}

}  // namespace

int64_t takeOverRows(const std::string& damaged, sqlite3* fresh) {
  sqlite3* opened = nullptr;
  const int code =
      sqlite3_open_v2(damaged.c_str(), &opened, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX,
                      nullptr);  // to write: its log is part of it
  const Database from(opened);
  if (code != SQLITE_OK) return 0;
  int64_t rows = 0;
  for (const char* table : kTables) rows += TableCopy(opened, fresh, table).run();
  takeOverEpochs(opened, fresh);
  return rows;
}

}  // namespace vx::lnx
