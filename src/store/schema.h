#pragma once
// The tables of a database and their creation (internal to the store).
//
//   info  pack records: id and folder byte strings of at most 50 bytes,
//         status a signed 32-bit number, blob a JSON text of at most
//         10 MiB; primary key id, index fldStaIdx on (folder, status). A
//         table without rowid: rows live in id order, and the index ends
//         with the primary key, so it gives (folder, status, id) order.
//   meta  named values: id a byte string of at most 255 bytes (primary
//         key), blob a value of any length up to the engine's limit. A
//         rowid table, because long values are streamed through blob I/O,
//         which works on rowid tables only.
//
// Both tables are STRICT and their keys BLOB: a text or NULL key is
// refused, and keys compare as bytes whatever the connection's collation.
// Lengths and ranges are CHECK constraints, so the engine refuses a longer
// value (kInvalidParameter).
//
// Failures: DB::DBExc from the engine.

#include <sqlite3.h>

#include <string>

#include "engine/session.h"

namespace DB::schema {

inline constexpr const char* kInfoTable = "info";
inline constexpr const char* kMetaTable = "meta";
inline constexpr const char* kBlobColumn = "blob";

// The statements of the named values, prepared once per session (the
// session caches them by their text).
namespace sql {
inline constexpr const char* kUpsertMeta =
    "INSERT INTO meta(id, blob) VALUES(?1, ?2) ON CONFLICT(id) DO UPDATE SET blob = excluded.blob";
inline constexpr const char* kUpsertMetaReturningRowid =
    "INSERT INTO meta(id, blob) VALUES(?1, ?2) ON CONFLICT(id) DO UPDATE SET blob = excluded.blob RETURNING rowid";
inline constexpr const char* kDeleteMeta = "DELETE FROM meta WHERE id = ?1";
// The keys from ?1 on, and those in [?1, ?2).
inline constexpr const char* kMetaKeysFrom = "SELECT id FROM meta WHERE id >= ?1 ORDER BY id";
inline constexpr const char* kMetaKeysInRange = "SELECT id FROM meta WHERE id >= ?1 AND id < ?2 ORDER BY id";
// Rowid, length and, when the length is at most
// DBLocal::kInlineValueBytes, the value of the row of key ?1.
const std::string& selectMetaValue();
}  // namespace sql

// Creates both tables and the index, in the caller's transaction.
void create(engine::Session& session);

// Which of the two tables the open database has.
struct Present {
  bool info = false;
  bool meta = false;
};
Present present(engine::Session& session);

// What the database lacks of the tables, columns and index the store reads
// and writes ("info" with id, folder, status and blob; "meta" with id and
// blob, a rowid table; the index fldStaIdx on info(folder, status), neither
// unique nor partial), as a short text such as `column "info.status",
// index "fldStaIdx" on info(folder, status)`; "" when it lacks nothing.
// Restore asks it of a staged copy before placing it: a file with this
// server's identity but other tables would leave the database unusable.
// Names compare without case, as SQLite resolves them.
std::string whatIsMissing(sqlite3* db);

}  // namespace DB::schema
