#pragma once
// Translation of SQLite's result codes into the engine's error vocabulary
// (engine_errors.h). The whole mapping is one table in sqlite_errors.cpp,
// repeated in docs/architecture.md.
//
// Thread safety: pure functions; throwSqlite reads the connection's error
// message, so call it on the thread that uses the connection.

#include <cstdint>
#include <source_location>

struct sqlite3;

namespace engine {

// The engine code for a SQLite result code (extended or primary). 0 for
// SQLITE_OK, SQLITE_ROW and SQLITE_DONE. Codes the table does not know give
// DB::err::kInternalError.
std::int32_t translateSqliteResult(int rc) noexcept;

// Throws DB::DBExc with the translated code and the caller's site. The
// SQLite message of the connection (may be null) is logged: at debug level
// for the retryable conflicts, which are expected under load, at warning
// level otherwise, since the exception text carries only the code.
[[noreturn]] void throwSqlite(sqlite3* db, int rc, const std::source_location& where);

}  // namespace engine
