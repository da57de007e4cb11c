#pragma once
// maint::restoreOne / restoreFolder: a database put back into the state a
// backup archive (".cvbak") recorded.
//
// restoreOne, in order:
//  1. The archive: archivePath, or the database's default backup file when
//     it is empty ("\" becomes "/", a relative path lies below the backup
//     folder). A missing archive fails at once ("Database restore for
//     \"<name>\" can not find the backup file: \"<path>\"").
//  2. An exclusive maintenance hold on the database: it waits, with its
//     waiting messages, until every client of the database has left.
//  3. 0 "Starting decompression ...". The archive's entries are unpacked
//     into "unpacked/" of the working folder, "Decompression N% complete
//     (i/n)" every five points (none after the last entry). Before that,
//     the archive's uncompressed size plus its database file (copied once
//     more into place) must fit in the free space of the database root.
//  4. "originDB.txt" names the database the archive was taken from. When it
//     differs from name: with keepName it is only logged; otherwise the
//     restore goes to the recorded database (a valid name, or the restore
//     fails naming the archive), under a second exclusive hold.
//  5. The previous files of the database folder (its files and its data
//     folder) and of the log folder, when that is another folder, are set
//     aside into holding folders of the working folder (FileReplacer).
//  6. The engine places the archive's database file ("Metadata restore
//     ..." texts); a file that is not a usable database of this server is
//     refused with "The backup format is not compatible with the engine
//     version". 100 "Replacing binaries...": the archive's data folder
//     takes the place of the database's.
//  7. Everything new is on disk; the replacement is committed, "Database
//     restored for \"<name>\" from \"<archive>\"" is logged and the working
//     folder, with the previous files, is removed.
// Any failure before 7 puts the previous files back (and removes the
// working folder); a restore journal (restore_journal.h) makes the same
// hold across a crash.
//
// restoreFolder restores every archive directly in folder (the backup
// folder when empty), in listing order, each into the database its file
// name (or its origin file) names; other entries are logged ("Can not
// restore <path> since it does not look like a backup file. Skipped") and
// skipped. The first failure ends it; databases restored before stay.
//
// Runs on a maintenance thread. Failures: std::exception with a clear text;
// OperationStopped when stop was requested (between entries).

#include <functional>
#include <memory>
#include <stop_token>
#include <string>

#include "engine/db_instances.h"
#include "engine/progress.h"
#include "engine/restore.h"

namespace maint {

struct RestoreOptions {
  // What the restored database must hold to be usable by the store.
  engine::SchemaCheck schemaCheck;
};

// The archive a restore of key reads for target (rules of step 1).
std::string restoreSource(const DB::Paths& paths, const std::string& target, const std::string& key);

// Returns the key of the database restored.
std::string restoreOne(const std::shared_ptr<DB::DBInstances>& pool, const std::string& archivePath,
                       const std::string& name, bool keepName, DB::DBProgressCallback& progress,
                       const RestoreOptions& options = {}, std::stop_token stop = {});

// Returns the keys restored, in order.
std::vector<std::string> restoreFolder(const std::shared_ptr<DB::DBInstances>& pool, const std::string& folder,
                                       DB::DBProgressCallback& progress, const RestoreOptions& options = {},
                                       std::stop_token stop = {});

// The second line of folder's "originDB.txt" (up to CR or LF); empty when
// the file is missing or has a single line.
std::string readOriginName(sys::Env& env, const sys::Path& folder);

}  // namespace maint
