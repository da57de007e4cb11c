#pragma once
// Online backup of an instance's database.
//
// backupInstance writes a consistent copy of the attached database, under
// the instance's database file name, into a folder, while other sessions go
// on reading and writing. The copy is one self-contained SQLite file (the
// write-ahead log's content is in it) and is on disk when the call returns.
//
// The copy runs page by page on a connection of its own that holds one read
// transaction from the first page to the last: the copy is the snapshot of
// that moment, and writers never make it start over.
//
// Thread safety: any thread; the status callback runs on the caller's
// thread.
// Failures: DB::DBExc (kNotInitialized / kTermInProgress for an instance
// that is not running, kDatabaseNotFound when nothing is attached, the
// translated SQLite or file-system failure otherwise). Whatever the failure,
// including an exception from the callback, no partial copy stays behind.

#include <filesystem>
#include <source_location>

#include "engine/progress.h"

namespace engine {

class Instance;

// Pages copied per step (4 MiB with the default page size).
inline constexpr int kBackupPagesPerStep = 1024;

// Reports Begin, Progress (pages copied, pages in all; each time the whole
// percent grows) and Complete, with operation Backup.
void backupInstance(Instance& instance, const std::filesystem::path& targetFolder, const StatusCallback& status,
                    int pagesPerStep = kBackupPagesPerStep,
                    const std::source_location& where = std::source_location::current());

}  // namespace engine
