#include "engine/database_file.h"

#include <array>
#include <cerrno>
#include <string>

#include "engine/connection.h"
#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "framework/log.h"

namespace engine {
namespace {

namespace fs = std::filesystem;

std::uint32_t bigEndian32(const unsigned char* p) {
  return (static_cast<std::uint32_t>(p[0]) << 24) | (static_cast<std::uint32_t>(p[1]) << 16) |
         (static_cast<std::uint32_t>(p[2]) << 8) | static_cast<std::uint32_t>(p[3]);
}

fs::path withSuffix(const fs::path& file, const char* suffix) {
  fs::path result = file;
  result += suffix;
  return result;
}

// Removes the file and its companions, quietly: a clean-up on a failure
// path, where the first failure is the one to report.
void removeQuietly(sys::Env& env, const fs::path& file) noexcept {
  for (const auto& f : {file, walFile(file), shmFile(file), journalFile(file)}) {
    try {
      env.remove(f);
    } catch (const std::system_error&) {
      // Left for the next attempt, which removes leftovers first.
    }
  }
}

}  // namespace

std::int32_t engineCodeOfErrno(int error) noexcept {
  switch (error) {
    case ENOSPC:
    case EDQUOT:
      return DB::err::kDiskFull;
    case EACCES:
    case EPERM:
    case EROFS:
      return DB::err::kFileAccessDenied;
    case ENOENT:
      return DB::err::kFileNotFound;
    case ENOMEM:
      return DB::err::kOutOfMemory;
    default:
      return DB::err::kDiskIO;
  }
}

void checkIdentity(sqlite3* db, const fs::path& file, const std::source_location& where) {
  const auto applicationId = queryInt(db, "PRAGMA application_id", where);
  const auto version = queryInt(db, "PRAGMA user_version", where);
  if (applicationId != kApplicationId || version < 1) {
    Log::Lock(Log::Warning).logStreamLine()
        << "Engine: \"" << file.string() << "\" is not a database of this server (application id " << applicationId
        << ", version " << version << "); left untouched";
    DB::throwEngineError(DB::err::kInvalidDatabase, where);
  }
  if (version > kFormatVersion) {
    Log::Lock(Log::Warning).logStreamLine() << "Engine: \"" << file.string() << "\" has format version " << version
                                            << ", newer than this server's " << kFormatVersion << "; left untouched";
    DB::throwEngineError(DB::err::kInvalidDatabaseVersion, where);
  }
}

void createDatabaseFile(sys::Env& env, const fs::path& file, std::chrono::milliseconds busyTimeout,
                        const std::source_location& where) {
  onFiles(where, [&] {
    // A folder made here is synced into its parent, as the file is below.
    for (const auto& made : env.createFolders(file.parent_path())) env.syncFolder(made.parent_path());
  });
  if (onFiles(where, [&] { return env.stat(file).type; }) != sys::FileType::Missing) {
    DB::throwEngineError(DB::err::kDatabaseDuplicate, where);
  }

  // Leftovers of an earlier creation that did not finish belong to nobody.
  const auto building = withSuffix(file, ".creating");
  onFiles(where, [&] { env.remove(building); });
  removeCompanions(env, building, where);
  try {
    {
      auto db = openConnection(env, building, OpenMode::CreateNew, busyTimeout, where);
      const std::string stamp = "PRAGMA application_id=" + std::to_string(kApplicationId) +
                                "; PRAGMA user_version=" + std::to_string(kFormatVersion) + ";";
      execute(db.get(), stamp.c_str(), where);
      // Moves everything into the main file; closing the last connection
      // then removes the write-ahead log.
      execute(db.get(), "PRAGMA wal_checkpoint(TRUNCATE)", where);
    }
    syncFile(env, building, where);
    // link() fails when the name exists, so a file that appeared meanwhile
    // is never replaced.
    try {
      env.link(building, file);
    } catch (const std::system_error& e) {
      const int error = e.code().value();
      if (error == EEXIST) DB::throwEngineError(DB::err::kDatabaseDuplicate, where);
      if (error != EPERM && error != EOPNOTSUPP) throw;
      // A file system without hard links: rename, after a last look.
      if (env.stat(file).type != sys::FileType::Missing) DB::throwEngineError(DB::err::kDatabaseDuplicate, where);
      env.rename(building, file);
    }
    env.remove(building);
    env.syncFolder(file.parent_path());
  } catch (const std::system_error& e) {
    removeQuietly(env, building);
    DB::throwEngineError(engineCodeOfErrno(e.code().value()), where);
  } catch (...) {
    removeQuietly(env, building);
    throw;
  }
}

void removeCreationLeftovers(sys::Env& env, const fs::path& file) noexcept {
  const auto building = withSuffix(file, ".creating");
  std::size_t removed = 0;
  for (const auto& f : {building, walFile(building), shmFile(building), journalFile(building)}) {
    try {
      if (env.stat(f).type == sys::FileType::Missing) continue;
      env.remove(f);
      ++removed;
    } catch (const std::system_error&) {
      // Left for the next attach.
    }
  }
  if (removed == 0) return;
  try {
    Log::Lock(Log::Notice).logStreamLine()
        << "Engine: removed " << removed << " file(s) that an unfinished creation of \"" << file.string()
        << "\" left behind";
  } catch (const std::exception&) {
    // The files are gone; only the line is missing.
  }
}

fs::path walFile(const fs::path& file) { return withSuffix(file, "-wal"); }
fs::path shmFile(const fs::path& file) { return withSuffix(file, "-shm"); }
fs::path journalFile(const fs::path& file) { return withSuffix(file, "-journal"); }

void removeCompanions(sys::Env& env, const fs::path& file, const std::source_location& where) {
  onFiles(where, [&] {
    for (const auto& f : {walFile(file), shmFile(file), journalFile(file)}) env.remove(f);
  });
}

std::optional<FileHeader> readHeader(sys::Env& env, const fs::path& file) {
  std::array<unsigned char, 100> bytes{};
  try {
    const auto in = env.open(file, sys::OpenMode::Read);
    if (in->readAt(0, bytes.data(), bytes.size()) != bytes.size()) return std::nullopt;
  } catch (const std::system_error&) {
    return std::nullopt;
  }
  static constexpr char kMagic[] = "SQLite format 3";  // with its terminating zero: 16 bytes
  for (std::size_t i = 0; i < sizeof kMagic; ++i) {
    if (bytes[i] != static_cast<unsigned char>(kMagic[i])) return std::nullopt;
  }
  FileHeader header;
  const std::uint32_t pageSize = (static_cast<std::uint32_t>(bytes[16]) << 8) | bytes[17];
  header.pageSize = pageSize == 1 ? 65536 : pageSize;
  const auto changeCounter = bigEndian32(&bytes[24]);
  const auto pageCount = bigEndian32(&bytes[28]);
  const auto validFor = bigEndian32(&bytes[92]);
  if (pageCount != 0 && changeCounter == validFor) header.pageCount = pageCount;
  header.userVersion = static_cast<std::int32_t>(bigEndian32(&bytes[60]));
  header.applicationId = static_cast<std::int32_t>(bigEndian32(&bytes[68]));
  return header;
}

void syncFile(sys::Env& env, const fs::path& file, const std::source_location& where) {
  onFiles(where, [&] { env.open(file, sys::OpenMode::Read)->sync(); });
}

void syncFolder(sys::Env& env, const fs::path& folder, const std::source_location& where) {
  onFiles(where, [&] { env.syncFolder(folder); });
}

}  // namespace engine
