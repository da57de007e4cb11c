#include "engine/statement.h"

#include "engine/sqlite_errors.h"

namespace engine {

Statement::Statement(sqlite3* db, sqlite3_stmt* stmt, bool* inUse) noexcept : db_(db), stmt_(stmt), inUse_(inUse) {}

Statement::Statement(Statement&& other) noexcept : db_(other.db_), stmt_(other.stmt_), inUse_(other.inUse_) {
  other.stmt_ = nullptr;
  other.inUse_ = nullptr;
}

Statement::~Statement() {
  if (stmt_ == nullptr) return;
  if (inUse_ != nullptr) {
    sqlite3_reset(stmt_);
    sqlite3_clear_bindings(stmt_);
    *inUse_ = false;
  } else {
    sqlite3_finalize(stmt_);
  }
}

void Statement::check(int rc, const std::source_location& where) const {
  if (rc != SQLITE_OK) throwSqlite(db_, rc, where);
}

Statement& Statement::bindBlob(int index, std::string_view bytes, const std::source_location& where) {
  // A null pointer would bind NULL instead of an empty blob.
  static constexpr char kEmpty = 0;
  const char* data = bytes.empty() ? &kEmpty : bytes.data();
  check(sqlite3_bind_blob64(stmt_, index, data, bytes.size(), SQLITE_TRANSIENT), where);
  return *this;
}

Statement& Statement::bindBlob(int index, std::span<const std::byte> bytes, const std::source_location& where) {
  return bindBlob(index, std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()), where);
}

Statement& Statement::bindText(int index, std::string_view text, const std::source_location& where) {
  static constexpr char kEmpty = 0;
  const char* data = text.empty() ? &kEmpty : text.data();
  check(sqlite3_bind_text64(stmt_, index, data, text.size(), SQLITE_TRANSIENT, SQLITE_UTF8), where);
  return *this;
}

Statement& Statement::bindInt64(int index, std::int64_t value, const std::source_location& where) {
  check(sqlite3_bind_int64(stmt_, index, value), where);
  return *this;
}

Statement& Statement::bindNull(int index, const std::source_location& where) {
  check(sqlite3_bind_null(stmt_, index), where);
  return *this;
}

Statement& Statement::bindZeroBlob(int index, std::int64_t size, const std::source_location& where) {
  if (size < 0) check(SQLITE_RANGE, where);
  check(sqlite3_bind_zeroblob64(stmt_, index, static_cast<sqlite3_uint64>(size)), where);
  return *this;
}

bool Statement::step(const std::source_location& where) {
  const int rc = sqlite3_step(stmt_);
  if (rc == SQLITE_ROW) return true;
  if (rc == SQLITE_DONE) return false;
  // Resetting hands the read snapshot back at once, not only when the
  // handle goes.
  sqlite3_reset(stmt_);
  throwSqlite(db_, rc, where);
}

void Statement::run(const std::source_location& where) {
  while (step(where)) {
  }
}

void Statement::reset() noexcept { sqlite3_reset(stmt_); }

bool Statement::columnIsNull(int column) const noexcept { return sqlite3_column_type(stmt_, column) == SQLITE_NULL; }

std::int64_t Statement::columnInt64(int column) const noexcept { return sqlite3_column_int64(stmt_, column); }

std::string Statement::columnText(int column) const { return std::string(columnBytes(column)); }

std::string_view Statement::columnBytes(int column) const noexcept {
  const void* data = sqlite3_column_blob(stmt_, column);
  const auto size = sqlite3_column_bytes(stmt_, column);
  if (data == nullptr || size <= 0) return {};
  return {static_cast<const char*>(data), static_cast<std::size_t>(size)};
}

std::int64_t Statement::columnSize(int column) const noexcept { return sqlite3_column_bytes(stmt_, column); }

}  // namespace engine
