// Small wrappers around SQLite's C interface.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace vx::lnx {

struct DatabaseCloser {
  void operator()(sqlite3* database) const { sqlite3_close_v2(database); }
};
using Database = std::unique_ptr<sqlite3, DatabaseCloser>;

// A prepared statement that is bound, stepped and reset over and over. Owned by whoever prepared
// it; confined to its database's thread.
class Statement {
 public:
  Statement() = default;
  Statement(sqlite3* database, std::string_view sql);

  Statement& bind(int64_t value);
  Statement& bind(double value);
  // The text must stay until run().
  Statement& bind(std::string_view text);
  // A blob, which must stay until run().
  Statement& bind(std::span<const uint8_t> bytes);
  Statement& bindNull();
  // A column of another statement's row, whatever its type.
  Statement& bindCopyOf(const Statement& row, int column);
  // NULL for none.
  template <class T>
  Statement& bind(const std::optional<T>& value) {
    return value ? bind(*value) : bindNull();
  }
  // Steps a statement without rows and makes it ready for the next use. SQLITE_OK or SQLite's
  // extended error code.
  int run();
  // Steps to the next row; false at the end or on an error.
  bool row();
  // Of the last step: SQLITE_ROW, SQLITE_DONE, or SQLite's extended error code.
  int code() const { return code_; }
  int64_t integer(int column) const { return sqlite3_column_int64(statement_.get(), column); }
  double real(int column) const { return sqlite3_column_double(statement_.get(), column); }
  std::string text(int column) const;
  bool isNull(int column) const {
    return sqlite3_column_type(statement_.get(), column) == SQLITE_NULL;
  }
  // Until the next step.
  std::span<const uint8_t> blob(int column) const;
  int columns() const { return sqlite3_column_count(statement_.get()); }
  const char* name(int column) const { return sqlite3_column_name(statement_.get(), column); }
  int type(int column) const { return sqlite3_column_type(statement_.get(), column); }
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

}  // namespace vx::lnx
