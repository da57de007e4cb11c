#pragma once
// Helpers of the pack tests of the store: records to send, and a plain
// SQLite connection on the database file to look at (and tamper with) the
// stored rows beside the store's own session.

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <optional>
#include <stdexcept>
#include <string>

#include "framework/json.h"
#include "protocol/pack_info.h"

namespace pack_testing {

// A complete record.
inline Ipc::PackInfo complete(const std::string& id, const std::string& folder, std::int32_t status,
                              const std::string& name = "name") {
  Ipc::PackInfoPartial p;
  p.name = name;
  p.owner = "anna";
  p.created = 1700000000;
  p.modified = 1700003600;
  p.docCount = 3;
  return Ipc::PackInfo(id, folder, status, p);
}

// A request that names the pack and carries one use entry.
inline Ipc::PackInfo useRequest(const std::string& id, Ipc::UseInfo::State state, const std::string& host,
                                std::uint32_t process = 7, const std::string& user = "u") {
  Ipc::PackInfo p(id);
  p.uses.append(Ipc::UseInfo(state, host, user, process));
  return p;
}

// A second connection on the database file, outside the engine layer.
class RawDb {
 public:
  explicit RawDb(const std::string& file) {
    if (sqlite3_open_v2(file.c_str(), &db_, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
      sqlite3_close(db_);
      throw std::runtime_error("cannot open " + file);
    }
    sqlite3_busy_timeout(db_, 10000);
  }
  ~RawDb() { sqlite3_close(db_); }
  RawDb(const RawDb&) = delete;
  RawDb& operator=(const RawDb&) = delete;

  // The stored JSON text of a pack; none without a row.
  std::optional<std::string> blob(const std::string& id) const {
    sqlite3_stmt* s = prepare("SELECT blob FROM info WHERE id = ?1");
    sqlite3_bind_blob(s, 1, id.data(), static_cast<int>(id.size()), SQLITE_TRANSIENT);
    std::optional<std::string> text;
    if (sqlite3_step(s) == SQLITE_ROW) {
      text.emplace(static_cast<const char*>(sqlite3_column_blob(s, 0)),
                   static_cast<std::size_t>(sqlite3_column_bytes(s, 0)));
    }
    sqlite3_finalize(s);
    return text;
  }
  json::Object object(const std::string& id) const {
    const auto text = blob(id);
    if (!text) throw std::runtime_error("no row " + id);
    return json::strToObject(*text);
  }
  void setBlob(const std::string& id, const std::string& text) {
    sqlite3_stmt* s = prepare("UPDATE info SET blob = ?2 WHERE id = ?1");
    sqlite3_bind_blob(s, 1, id.data(), static_cast<int>(id.size()), SQLITE_TRANSIENT);
    sqlite3_bind_blob(s, 2, text.data(), static_cast<int>(text.size()), SQLITE_TRANSIENT);
    const int rc = sqlite3_step(s);
    sqlite3_finalize(s);
    if (rc != SQLITE_DONE || sqlite3_changes(db_) != 1) throw std::runtime_error("cannot set the blob of " + id);
  }
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
  std::int64_t count(const std::string& sql) const {
    sqlite3_stmt* s = prepare(sql);
    const std::int64_t n = sqlite3_step(s) == SQLITE_ROW ? sqlite3_column_int64(s, 0) : -1;
    sqlite3_finalize(s);
    return n;
  }

 private:
  sqlite3_stmt* prepare(const std::string& sql) const {
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &s, nullptr) != SQLITE_OK) {
      throw std::runtime_error(std::string("cannot prepare: ") + sqlite3_errmsg(db_));
    }
    return s;
  }

  sqlite3* db_ = nullptr;
};

}  // namespace pack_testing
