// The database file: opening it, its tables and views, and small wrappers around SQLite's C
// interface.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

namespace vx::lnx {

inline constexpr int kStoreSchemaVersion = 2;

struct DatabaseCloser {
  void operator()(sqlite3* database) const { sqlite3_close_v2(database); }
};
using Database = std::unique_ptr<sqlite3, DatabaseCloser>;

// A prepared statement that is bound, stepped and reset over and over. Confined to its database's
// thread.
class Statement {
 public:
  Statement() = default;
  Statement(sqlite3* database, std::string_view sql);
  int code() const { return code_; }  // of the preparation

  Statement& bind(int64_t value);
  Statement& bind(double value);
  // The text must stay until run().
  Statement& bind(std::string_view text);
  Statement& bindNull();
  // Steps a statement without rows and makes it ready for the next use. SQLITE_OK or SQLite's
  // extended error code.
  int run();
  // Steps to the next row; false at the end or on an error.
  bool row();
  int64_t integer(int column) const { return sqlite3_column_int64(statement_.get(), column); }
  double real(int column) const { return sqlite3_column_double(statement_.get(), column); }
  std::string text(int column) const;
  void reset();

 private:
  struct Finalizer {
    void operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }
  };
  std::unique_ptr<sqlite3_stmt, Finalizer> statement_;
  int next_ = 1;
  int code_ = SQLITE_OK;
};

int execute(sqlite3* database, const char* sql);

enum class OpenOutcome : uint8_t {
  Ready,
  Damaged,   // not a database, or not one that can be read: to be moved aside
  Unusable,  // the folder or file cannot be used; `problem` says why
};

// Opens or creates the file, sets its modes and brings its schema up to date.
OpenOutcome openStoreDatabase(const std::string& path, Database& database, std::string& problem);

// True when `PRAGMA quick_check` finds nothing; what it found otherwise.
bool quickCheck(sqlite3* database, std::string& found);

// Moves the file and its companions out of the way, to "<path>.damaged-YYYYMMDD-HHMMSS[-n]". The
// new name, or empty and a `problem`.
std::string moveAside(const std::string& path, std::string& problem);

}  // namespace vx::lnx
