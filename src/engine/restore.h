#pragma once
// Restore of an instance's database from a backup folder.
//
// restoreInstance finds the database file in the backup folder (the
// instance's database file name, or else the one file there that carries
// this server's identity; a regular file, never a link), checks its header
// (ours, not of a newer format, a valid page size, not truncated) and
// copies it into the destination folder under a staged name. A write-ahead
// log beside it ("<file>-wal", as in a folder copied from a live database)
// holds committed transactions the file lacks: it is copied beside the
// staged copy, which SQLite then opens, replaying the log, and checkpoints,
// so the copy holds them all. The copy must pass SQLite's quick integrity
// check and the caller's schema check; then it is placed as the
// destination folder's database file, durably. A stale write-ahead log and
// index of the destination are removed first: replayed onto the restored
// file they would corrupt it.
//
// A log that is no regular file, whose header is damaged, or whose damaged
// frames would drop a transaction it records as committed refuses the
// restore: the backup is never restored with transactions missing in
// silence. What a log holds after its last commit (a transaction still
// being written when the folder was copied) is left out.
//
// The instance must be uninitialised (an exclusive maintenance hold), so no
// connection to the destination is open while the file is replaced.
//
// Thread safety: any thread; the status callback runs on the caller's
// thread.
// Failures: DB::DBExc. kBadBackupFormat when the backup holds no usable
// database file of this engine, or one that the schema check finds
// lacking; kAfterInitialization when the instance is initialised; the
// file-system failure otherwise. On failure the destination's database file
// and its companions are as they were, and no temporary file stays behind;
// the one exception is a failure of the folder's sync after the new file
// took the old one's place, which reports the failure with the new file in
// place. The destination's write-ahead log
// and index are set aside (as "<file>-wal.replaced" and so on) until the
// new file is in place, so a failed placement keeps the committed
// transactions a log may hold.

#include <sqlite3.h>

#include <filesystem>
#include <functional>
#include <source_location>
#include <string>

#include "engine/progress.h"

namespace engine {

class Instance;

// Whether the staged copy holds what the layer above the engine needs (its
// tables, columns, indexes): "" when it does, else a short text of what is
// missing, which refuses the restore (kBadBackupFormat) and goes to the
// log. Called on the caller's thread with a connection to the staged copy,
// after the integrity check; a file with this server's identity but other
// tables would otherwise be placed and leave the database unusable.
using SchemaCheck = std::function<std::string(sqlite3* db)>;

// Reports Begin, Progress (pages copied, pages in all; a log shipped with
// the file counts in pages of its bytes) and Complete, with operation
// Restore.
void restoreInstance(Instance& instance, const std::filesystem::path& backupFolder,
                     const std::filesystem::path& destinationFolder, const StatusCallback& status,
                     const SchemaCheck& schemaCheck = {},
                     const std::source_location& where = std::source_location::current());

}  // namespace engine
