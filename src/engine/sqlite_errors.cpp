#include "engine/sqlite_errors.h"

#include <sqlite3.h>

#include <array>

#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/transaction.h"
#include "framework/log.h"

namespace engine {
namespace {

struct Mapping {
  int sqlite;
  std::int32_t engine;
};

namespace err = DB::err;

// Extended codes are looked up first, then the primary code (the low byte).
// Conflicts on the write lock are write conflicts, so runInTransaction
// retries them: a stale snapshot (BUSY_SNAPSHOT), a busy write lock (BUSY,
// also after the busy timeout), a WAL-index race (PROTOCOL). Statements
// aborted by a rollback (ABORT) and a schema changed under a statement
// (SCHEMA) ask for a new attempt as well.
constexpr std::array kExtended{
    Mapping{SQLITE_BUSY_SNAPSHOT, err::kWriteConflict},
    Mapping{SQLITE_BUSY_RECOVERY, err::kWriteConflict},
    Mapping{SQLITE_BUSY_TIMEOUT, err::kWriteConflict},
    Mapping{SQLITE_IOERR_NOMEM, err::kOutOfMemory},
    Mapping{SQLITE_IOERR_ACCESS, err::kFileAccessDenied},
    Mapping{SQLITE_CONSTRAINT_PRIMARYKEY, err::kKeyDuplicate},
    Mapping{SQLITE_CONSTRAINT_UNIQUE, err::kKeyDuplicate},
    Mapping{SQLITE_CONSTRAINT_NOTNULL, err::kNullInvalid},
    Mapping{SQLITE_CANTOPEN_NOTEMPDIR, err::kFileAccessDenied},
    Mapping{SQLITE_CANTOPEN_ISDIR, err::kFileAccessDenied},
};

constexpr std::array kPrimary{
    Mapping{SQLITE_OK, err::kSuccess},
    Mapping{SQLITE_ROW, err::kSuccess},
    Mapping{SQLITE_DONE, err::kSuccess},
    Mapping{SQLITE_ERROR, err::kInvalidParameter},
    Mapping{SQLITE_INTERNAL, err::kInternalError},
    Mapping{SQLITE_PERM, err::kFileAccessDenied},
    Mapping{SQLITE_ABORT, err::kRollbackRequired},
    Mapping{SQLITE_BUSY, err::kWriteConflict},
    Mapping{SQLITE_LOCKED, err::kWriteConflict},
    Mapping{SQLITE_NOMEM, err::kOutOfMemory},
    Mapping{SQLITE_READONLY, err::kDatabaseFileReadOnly},
    Mapping{SQLITE_INTERRUPT, err::kTermInProgress},
    Mapping{SQLITE_IOERR, err::kDiskIO},
    Mapping{SQLITE_CORRUPT, err::kDatabaseCorrupted},
    Mapping{SQLITE_NOTFOUND, err::kInternalError},
    Mapping{SQLITE_FULL, err::kDiskFull},
    Mapping{SQLITE_CANTOPEN, err::kFileAccessDenied},
    Mapping{SQLITE_PROTOCOL, err::kWriteConflict},
    Mapping{SQLITE_SCHEMA, err::kRollbackRequired},
    Mapping{SQLITE_TOOBIG, err::kColumnTooBig},
    Mapping{SQLITE_CONSTRAINT, err::kInvalidParameter},
    Mapping{SQLITE_MISMATCH, err::kInvalidParameter},
    Mapping{SQLITE_MISUSE, err::kInvalidParameter},
    Mapping{SQLITE_NOLFS, err::kDiskIO},
    Mapping{SQLITE_AUTH, err::kFileAccessDenied},
    Mapping{SQLITE_RANGE, err::kInvalidParameter},
    Mapping{SQLITE_NOTADB, err::kInvalidDatabase},
};

}  // namespace

std::int32_t translateSqliteResult(int rc) noexcept {
  for (const auto& m : kExtended) {
    if (m.sqlite == rc) return m.engine;
  }
  const int primary = rc & 0xff;
  for (const auto& m : kPrimary) {
    if (m.sqlite == primary) return m.engine;
  }
  return err::kInternalError;
}

void throwSqlite(sqlite3* db, int rc, const std::source_location& where) {
  const auto code = translateSqliteResult(rc);
  const bool expected = DB::Transaction::isRetryableCode(code);
  if (!expected || g_LogVerbose) {
    Log::Lock entry(expected ? Log::Debug : Log::Warning);
    entry.logStreamLine() << "Engine: SQLite result " << rc << " (" << sqlite3_errstr(rc) << ")"
                          << (db != nullptr ? ": " : "") << (db != nullptr ? sqlite3_errmsg(db) : "") << " reported as "
                          << code;
  }
  throw DB::DBExc(code == err::kSuccess ? err::kInternalError : code, where);
}

}  // namespace engine
