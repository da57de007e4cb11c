#include "engine/connection.h"

#include <mutex>
#include <string>
#include <string_view>

#include "engine/database_file.h"
#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/sqlite_errors.h"
#include "framework/log.h"

namespace engine {
namespace {

struct StatementFinalizer {
  void operator()(sqlite3_stmt* s) const noexcept { sqlite3_finalize(s); }
};
using StatementPtr = std::unique_ptr<sqlite3_stmt, StatementFinalizer>;

StatementPtr prepareOne(sqlite3* db, const char* sql, const std::source_location& where) {
  sqlite3_stmt* raw = nullptr;
  const int rc = sqlite3_prepare_v2(db, sql, -1, &raw, nullptr);
  StatementPtr stmt(raw);
  if (rc != SQLITE_OK) throwSqlite(db, rc, where);
  return stmt;
}

std::string queryText(sqlite3* db, const char* sql, const std::source_location& where) {
  auto stmt = prepareOne(db, sql, where);
  const int rc = sqlite3_step(stmt.get());
  if (rc != SQLITE_ROW) throwSqlite(db, rc == SQLITE_DONE ? SQLITE_INTERNAL : rc, where);
  const auto* text = sqlite3_column_text(stmt.get(), 0);
  return text != nullptr ? reinterpret_cast<const char*>(text) : std::string();
}

}  // namespace

void configureLibrary() noexcept {
  static std::once_flag once;
  std::call_once(once, [] {
    // SQLite's memory statistics take a global lock on every allocation;
    // nothing here reads them, and they cost several percent of a read.
    // The setting only takes before the library is initialised, that is
    // before the first connection opens.
    const int rc = sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0);
    if (rc != SQLITE_OK) {
      Log::Lock(Log::Warning).logStreamLine() << "Engine: SQLite's memory statistics stay on (result " << rc << ")";
    }
  });
}

void ConnectionCloser::operator()(sqlite3* db) const noexcept {
  // Statements are finalised by their owners first; close_v2 would otherwise
  // keep the connection as a zombie until they are.
  const int rc = sqlite3_close_v2(db);
  if (rc != SQLITE_OK) {
    Log::Lock(Log::Warning).logStreamLine() << "Engine: closing a connection failed with SQLite result " << rc;
  }
}

ConnectionPtr openConnection(sys::Env& env, const std::filesystem::path& file, OpenMode mode,
                             std::chrono::milliseconds busyTimeout, const std::source_location& where) {
  if (mode == OpenMode::Existing) {
    sys::FileType type = sys::FileType::Missing;
    try {
      type = env.stat(file, true).type;
    } catch (const std::system_error& e) {
      DB::throwEngineError(engineCodeOfErrno(e.code().value()), where);
    }
    if (type != sys::FileType::Regular) {
      DB::throwEngineError(type == sys::FileType::Missing ? DB::err::kFileNotFound : DB::err::kFileAccessDenied, where);
    }
  }
  configureLibrary();
  int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE;
  if (mode == OpenMode::CreateNew) flags |= SQLITE_OPEN_CREATE;
  sqlite3* raw = nullptr;
  const int rc = sqlite3_open_v2(file.c_str(), &raw, flags, nullptr);
  ConnectionPtr db(raw);
  if (rc != SQLITE_OK) throwSqlite(db.get(), rc, where);
  sqlite3_extended_result_codes(db.get(), 1);
  sqlite3_busy_timeout(db.get(), static_cast<int>(busyTimeout.count()));

  // The identity is checked before anything is written: a file that is not
  // ours is refused untouched.
  if (mode == OpenMode::Existing) checkIdentity(db.get(), file, where);
  const auto journal = queryText(db.get(), "PRAGMA journal_mode=WAL", where);
  if (journal != "wal") {
    Log::Lock(Log::Warning).logStreamLine()
        << "Engine: \"" << file.string() << "\" refuses write-ahead logging (journal mode " << journal << ")";
    DB::throwEngineError(DB::err::kInvalidDatabase, where);
  }
  const std::string pragmas = "PRAGMA synchronous=FULL; PRAGMA cache_size=-" + std::to_string(kConnectionCacheKiB) +
                              "; PRAGMA journal_size_limit=" + std::to_string(kWalSizeLimit) +
                              "; PRAGMA secure_delete=FAST;";
  execute(db.get(), pragmas.c_str(), where);
  return db;
}

void execute(sqlite3* db, const char* sql, const std::source_location& where) {
  const int rc = sqlite3_exec(db, sql, nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) throwSqlite(db, rc, where);
}

std::int64_t queryInt(sqlite3* db, const char* sql, const std::source_location& where) {
  auto stmt = prepareOne(db, sql, where);
  const int rc = sqlite3_step(stmt.get());
  if (rc != SQLITE_ROW) throwSqlite(db, rc == SQLITE_DONE ? SQLITE_INTERNAL : rc, where);
  return sqlite3_column_int64(stmt.get(), 0);
}

}  // namespace engine
