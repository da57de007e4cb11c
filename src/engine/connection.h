#pragma once
// SQLite connections as the engine layer opens them (internal to the layer).
//
// Every connection to a database file is opened the same way: read-write,
// extended result codes, a busy timeout, write-ahead logging with
// synchronous=FULL (a committed transaction survives a power loss), a
// bounded page cache, and a WAL that is cut back after big transactions.
//
// Thread safety: a connection is used by one thread at a time (SQLite's
// multi-thread mode); the functions here keep no state.
// Failures: DB::DBExc with the translated code; nothing is left open.

#include <sqlite3.h>

#include <chrono>
#include <filesystem>
#include <memory>
#include <source_location>

#include "framework/env.h"

namespace engine {

struct ConnectionCloser {
  void operator()(sqlite3* db) const noexcept;
};
using ConnectionPtr = std::unique_ptr<sqlite3, ConnectionCloser>;

// Page cache of one connection, in KiB. A full scan with SQLite's default
// grows a connection by about 2 MiB; with a thousand connections open that
// would be 2 GiB, so the cache is kept small and the operating system's
// page cache does the rest.
inline constexpr int kConnectionCacheKiB = 256;
// After a checkpoint the WAL file is cut back to this size, so that one big
// value does not leave a write-ahead log of its size behind.
inline constexpr std::int64_t kWalSizeLimit = 64 * 1024 * 1024;

enum class OpenMode { Existing, CreateNew };

// Process-wide SQLite settings, applied once before the first connection
// opens (openConnection calls it; other openers must too).
void configureLibrary() noexcept;

// Opens and configures a connection. Existing: the file must exist
// (kFileNotFound otherwise) and be a database of this server
// (checkIdentity, before anything is written to it). CreateNew: the file is
// created; the caller makes sure that nobody else uses the name and stamps
// its identity.
ConnectionPtr openConnection(sys::Env& env, const std::filesystem::path& file, OpenMode mode,
                             std::chrono::milliseconds busyTimeout, const std::source_location& where);

// Runs SQL without results (one or more statements); throws on failure.
void execute(sqlite3* db, const char* sql, const std::source_location& where);

// The integer result of a one-value query such as "PRAGMA user_version".
std::int64_t queryInt(sqlite3* db, const char* sql, const std::source_location& where);

}  // namespace engine
