#pragma once
// Database names, database keys and the paths derived from them.
//
// A client names a database with free text in which "\" separates the
// levels of a hierarchy. folderName() turns that text into the database key:
// the one string under which the engine pool, the store and maintenance know
// the database, and under which it is listed and backed up. Keys keep "\" as
// their separator; only the path functions below turn it into "/".
//
// All functions are pure functions of their input; they touch no file and
// may run on any thread.

#include <string>
#include <string_view>

namespace DB {

inline constexpr const char* kRootDbName = "root.db";
inline constexpr const char* kBackupSubfolder = "db.backup/";
inline constexpr const char* kTempSubfolder = "db.temp/";
inline constexpr const char* kDataSubfolder = "d/";
inline constexpr const char* kBackupExtension = ".cvbak";
inline constexpr const char* kOriginFileName = "originDB.txt";
// Names of the files that a data-file write builds before it renames them
// into place: never data files themselves.
inline constexpr std::string_view kDataTempPrefix = ".cvtmp.";

// The database key of a client-given name. Total: every text gives a key.
std::string folderName(std::string_view name);

// Whether a client-given database name may be used at all: false for a
// name that would leave the database root (a component "." or "..") or
// that holds a NUL byte; false as well for a name with an empty component
// (a leading separator, doubled separators, more than one trailing one),
// which would give a second key for an existing database's folder, and for
// a name whose first component is one of the server's own folders
// (see isDBFolderName). "\" and "/" both separate components; the empty
// name and a lone separator are valid (the root database). Names read back
// from backup files must pass this test too. why, when given, receives the
// reason.
bool isValidDatabaseName(std::string_view name, std::string* why = nullptr);

// The path of a key below a root: each "\" of the key becomes "/", empty
// components are dropped (a leading separator never makes the path
// absolute), and the result ends with "/". The key must come from
// folderName() of a valid name (or from nameFromRelativeFolder): "." and
// ".." are not checked here. Paths (settings/paths.h) applies it to the
// configured roots.
std::string keyPath(std::string_view key);

// The backup file name of a key (no folder), and the key read back from a
// backup file name ("" when the name is not a backup file's).
std::string backupFileName(std::string_view key);
std::string nameFromBackupFile(std::string_view fileName);

// Whether a folder directly below DBRoot may hold databases.
bool isDBFolderName(std::string_view entryName);

// The key of a database found on disk from its folder's path relative to
// DBRoot (components joined with "/"): components joined with "\", passed
// through folderName.
std::string nameFromRelativeFolder(std::string_view relativePath);

}  // namespace DB
