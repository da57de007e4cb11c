#pragma once
// The database file of one client database: its identity, its creation and
// durable file operations (internal to the engine layer).
//
// A database file is a SQLite database whose application_id is
// kApplicationId and whose user_version is the format version, from 1 to
// kFormatVersion. Any other file (another format, another application's
// database, an empty or half-created file, a newer format) is refused before
// anything is written to it, so it is never overwritten.
//
// Every file operation goes through the given sys::Env.
// Thread safety: no shared state.
// Failures: DB::DBExc with an engine code; a file-system failure becomes the
// code of its error number (engineCodeOfErrno).

#include <sqlite3.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <source_location>
#include <system_error>

#include "engine/db_exc.h"
#include "framework/env.h"

namespace engine {

inline constexpr std::int32_t kApplicationId = 0x43764442;  // "CvDB"
inline constexpr std::int32_t kFormatVersion = 1;

// Throws kInvalidDatabase when the connection's file is not a database of
// this server (or not SQLite at all), kInvalidDatabaseVersion when its
// format is newer than kFormatVersion.
void checkIdentity(sqlite3* db, const std::filesystem::path& file, const std::source_location& where);

// Creates a new, empty database file with its identity, all at once: either
// the complete file appears under the name or nothing does (it is built
// under a temporary name beside it and linked into place), so a crash never
// leaves a file that would be refused later. Missing parent folders are
// created. Throws kDatabaseDuplicate when the file exists (it is not
// touched), kFileAccessDenied / kDiskIO / kDiskFull on file-system failures.
void createDatabaseFile(sys::Env& env, const std::filesystem::path& file, std::chrono::milliseconds busyTimeout,
                        const std::source_location& where);

// Removes what a creation of file that never finished left beside it (the
// file it was building, which may be a second link to file itself, and
// that file's companions). Call only where no creation of file can be
// running: when the database is first attached. Never throws; a file that
// cannot be removed is left for the next time.
void removeCreationLeftovers(sys::Env& env, const std::filesystem::path& file) noexcept;

// The companions SQLite keeps beside a database file.
std::filesystem::path walFile(const std::filesystem::path& file);
std::filesystem::path shmFile(const std::filesystem::path& file);
std::filesystem::path journalFile(const std::filesystem::path& file);
// Removes the companions; throws kFileAccessDenied / kDiskIO when one exists
// and cannot be removed.
void removeCompanions(sys::Env& env, const std::filesystem::path& file, const std::source_location& where);

// What the first 100 bytes of a SQLite file say; nullopt when the file
// cannot be read or is no SQLite file.
struct FileHeader {
  std::uint32_t pageSize = 0;
  std::optional<std::uint32_t> pageCount;  // when the header's count is valid
  std::int32_t userVersion = 0;
  std::int32_t applicationId = 0;
};
std::optional<FileHeader> readHeader(sys::Env& env, const std::filesystem::path& file);

// The engine code of an operating-system error number (ENOSPC: kDiskFull,
// EACCES / EPERM / EROFS: kFileAccessDenied, ENOENT: kFileNotFound, others
// kDiskIO).
std::int32_t engineCodeOfErrno(int error) noexcept;

// Forces a file's content, or a folder's entries, to disk.
void syncFile(sys::Env& env, const std::filesystem::path& file, const std::source_location& where);
void syncFolder(sys::Env& env, const std::filesystem::path& folder, const std::source_location& where);

// Runs f, turning a file-system failure into DB::DBExc with its code.
template <typename F>
auto onFiles(const std::source_location& where, F&& f) -> decltype(f()) {
  try {
    return f();
  } catch (const std::system_error& e) {
    DB::throwEngineError(engineCodeOfErrno(e.code().value()), where);
  }
}

}  // namespace engine
