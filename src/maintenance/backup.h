#pragma once
// maint::backupOne: one database into one backup archive (".cvbak").
//
// The engine writes a consistent copy of the database (the snapshot of one
// moment, taken while other clients go on reading and writing) into the
// database's working folder below "db.temp/"; an "originDB.txt" beside it
// records the requesting connection's database file and the name of the
// database backed up (two lines, CRLF between them, nothing after); then
// the working folder and the database's data folder are packed into a ZIP
// archive: the working folder's files under their relative names, the data
// files under "d\" and theirs, elements joined with "\". The working folder
// is removed afterwards, whatever happens.
//
// The archive path: an empty target is the database's default backup file
// (the backup folder joined with its backup file name); "\" in a target
// becomes "/", a relative target lies below the backup folder; a target
// that ends with "/" or names an existing folder gets the backup file name
// of the database; any other target is a file, with ".cvbak" appended
// unless it ends with exactly that. A target inside a database's folder is
// refused: nothing is ever written beside a database's files. The archive
// is built under a temporary name beside its destination and renamed over
// it only when complete and on disk (an older archive of that name stays
// until then); no partial archive ever carries the real name.
//
// Progress: 0 "Starting backup for \"<name>\" ...", the waiting messages of
// the maintenance hold, "Metadata backup started...", "Metadata backup: N%
// completed (done/total)" in pages, "Metadata backup finished", then
// "Compressing metadata N% complete (i/n)" and "Compressing binaries N%
// complete (i/n)" every five points per folder. A data file that cannot be
// read is left out (counted for progress, and logged when verbose).
//
// Runs on the calling (maintenance) thread under a shared maintenance hold
// (beside the database's clients, not beside another maintenance
// operation); the database must be open (its instance running).
// Failures: std::exception with a clear text (the hold's, the engine's,
// "Failed to create destination file \"...\"", "Compression error: ...",
// a refused target); afterwards no archive of this run and no working
// folder remain, and the hold is released. A stop request ends it between
// pages and between chunks.

#include <memory>
#include <stop_token>
#include <string>

#include "engine/db_instances.h"
#include "engine/progress.h"

namespace maint {

// The archive a backup of the database writes for target (rules above).
std::string archivePath(const DB::Paths& paths, sys::Env& env, const std::string& target, const std::string& dbKey);

// Backs the database up into archivePath(target); requesterDbFile is the
// database file of the connection that asked (the origin file's first line).
// Returns the archive's path.
std::string backupOne(const std::shared_ptr<DB::DBInstances>& pool, const std::string& dbKey, const std::string& target,
                      const std::string& requesterDbFile, DB::DBProgressCallback& progress, std::stop_token stop = {});

// A path for a log line: in double quotes, every '"' and '&' inside
// preceded by '&'.
std::string quoted(const std::string& path);

}  // namespace maint
