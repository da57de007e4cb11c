#pragma once
// A plain SQLite connection on a database file, beside the server's own
// sessions: to look at what was stored, to tamper with it, and to make
// files the server must refuse. Header-only; an executable that includes it
// links SQLite.
//
// Ownership: owns its connection. Thread safety: one thread at a time.
// Failures: a file that cannot be opened or a statement that cannot be
// prepared throws std::runtime_error; exec() returns SQLite's result code.

#include <sqlite3.h>

#include <cstdint>
#include <filesystem>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

namespace testing_support {

class RawDb {
 public:
  // Opens (and with create, makes) the file; waits up to ten seconds for
  // the server's locks.
  explicit RawDb(const std::filesystem::path& file, bool create = false) {
    const int flags = SQLITE_OPEN_READWRITE | (create ? SQLITE_OPEN_CREATE : 0);
    if (sqlite3_open_v2(file.c_str(), &db_, flags, nullptr) != SQLITE_OK) {
      sqlite3_close(db_);
      throw std::runtime_error("cannot open " + file.string());
    }
    sqlite3_busy_timeout(db_, 10000);
  }
  ~RawDb() { sqlite3_close(db_); }
  RawDb(const RawDb&) = delete;
  RawDb& operator=(const RawDb&) = delete;

  // The connection itself, for code under test that takes one.
  sqlite3* handle() const { return db_; }

  // Runs one or more statements; SQLite's result code.
  int exec(const std::string& sql) { return sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr); }

  // Runs one statement with the parameters bound as blobs; the first column
  // of its first row as bytes, nothing without a row.
  std::optional<std::string> value(const std::string& sql, const std::vector<std::string>& blobs = {}) const {
    sqlite3_stmt* s = prepare(sql);
    for (std::size_t i = 0; i < blobs.size(); ++i) {
      sqlite3_bind_blob(s, static_cast<int>(i + 1), blobs[i].data(), static_cast<int>(blobs[i].size()),
                        SQLITE_TRANSIENT);
    }
    std::optional<std::string> out;
    if (sqlite3_step(s) == SQLITE_ROW) {
      const auto* bytes = static_cast<const char*>(sqlite3_column_blob(s, 0));
      out.emplace(bytes ? bytes : "", static_cast<std::size_t>(sqlite3_column_bytes(s, 0)));
    }
    sqlite3_finalize(s);
    return out;
  }
  std::int64_t number(const std::string& sql) const { return std::stoll(value(sql).value_or("-1")); }

  // The lines of EXPLAIN QUERY PLAN, joined by "; ".
  std::string plan(const std::string& sql) const {
    sqlite3_stmt* s = prepare("EXPLAIN QUERY PLAN " + sql);
    std::string lines;
    while (sqlite3_step(s) == SQLITE_ROW) {
      if (!lines.empty()) lines += "; ";
      lines += reinterpret_cast<const char*>(sqlite3_column_text(s, 3));
    }
    sqlite3_finalize(s);
    return lines;
  }

 private:
  sqlite3_stmt* prepare(const std::string& sql) const {
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &s, nullptr) != SQLITE_OK) {
      throw std::runtime_error("cannot prepare " + sql + ": " + sqlite3_errmsg(db_));
    }
    return s;
  }

  sqlite3* db_ = nullptr;
};

}  // namespace testing_support
