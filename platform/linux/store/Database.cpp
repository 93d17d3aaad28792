#include "platform/linux/store/Database.h"

namespace vx::lnx {

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

Statement& Statement::bind(std::span<const uint8_t> bytes) {
  sqlite3_bind_blob64(statement_.get(), next_++, bytes.data(), bytes.size(), SQLITE_STATIC);
  return *this;
}

Statement& Statement::bindNull() {
  sqlite3_bind_null(statement_.get(), next_++);
  return *this;
}

Statement& Statement::bindCopyOf(const Statement& row, int column) {
  sqlite3_bind_value(statement_.get(), next_++, sqlite3_column_value(row.statement_.get(), column));
  return *this;
}

int Statement::run() {
  if (statement_ == nullptr) return code_ != SQLITE_OK ? code_ : SQLITE_MISUSE;
  sqlite3_step(statement_.get());
  next_ = 1;
  return sqlite3_reset(statement_.get());
}

bool Statement::row() {
  if (statement_ == nullptr) return false;
  code_ = sqlite3_step(statement_.get());
  return code_ == SQLITE_ROW;
}

std::span<const uint8_t> Statement::blob(int column) const {
  const void* bytes = sqlite3_column_blob(statement_.get(), column);
  const int size = sqlite3_column_bytes(statement_.get(), column);
  return {static_cast<const uint8_t*>(bytes), static_cast<std::size_t>(size)};
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

}  // namespace vx::lnx
