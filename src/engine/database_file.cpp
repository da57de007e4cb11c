#include "engine/database_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <fstream>
#include <string>

#include "engine/connection.h"
#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "framework/log.h"
#include "framework/unique_fd.h"

namespace engine {
namespace {

namespace fs = std::filesystem;

[[noreturn]] void throwErrno(int error, const std::source_location& where) {
  DB::throwEngineError(engineCodeOfErrno(error), where);
}

std::uint32_t bigEndian32(const unsigned char* p) {
  return (static_cast<std::uint32_t>(p[0]) << 24) | (static_cast<std::uint32_t>(p[1]) << 16) |
         (static_cast<std::uint32_t>(p[2]) << 8) | static_cast<std::uint32_t>(p[3]);
}

fs::path withSuffix(const fs::path& file, const char* suffix) {
  fs::path result = file;
  result += suffix;
  return result;
}

void removeIfPresent(const fs::path& file, const std::source_location& where) {
  if (::unlink(file.c_str()) != 0 && errno != ENOENT) throwErrno(errno, where);
}

}  // namespace

std::int32_t engineCodeOfErrno(int error) noexcept {
  switch (error) {
    case ENOSPC:
    case EDQUOT: return DB::err::kDiskFull;
    case EACCES:
    case EPERM:
    case EROFS: return DB::err::kFileAccessDenied;
    case ENOENT: return DB::err::kFileNotFound;
    case ENOMEM: return DB::err::kOutOfMemory;
    default: return DB::err::kDiskIO;
  }
}

void checkIdentity(sqlite3* db, const fs::path& file, const std::source_location& where) {
  const auto applicationId = queryInt(db, "PRAGMA application_id", where);
  const auto version = queryInt(db, "PRAGMA user_version", where);
  if (applicationId != kApplicationId || version < 1) {
    Log::Lock(Log::Warning).logStreamLine() << "Engine: \"" << file.string()
                                            << "\" is not a database of this server (application id "
                                            << applicationId << ", version " << version << "); left untouched";
    DB::throwEngineError(DB::err::kInvalidDatabase, where);
  }
  if (version > kFormatVersion) {
    Log::Lock(Log::Warning).logStreamLine() << "Engine: \"" << file.string() << "\" has format version " << version
                                            << ", newer than this server's " << kFormatVersion
                                            << "; left untouched";
    DB::throwEngineError(DB::err::kInvalidDatabaseVersion, where);
  }
}

void createDatabaseFile(const fs::path& file, std::chrono::milliseconds busyTimeout,
                        const std::source_location& where) {
  std::error_code ec;
  fs::create_directories(file.parent_path(), ec);
  if (ec) throwErrno(ec.value(), where);
  if (fs::exists(file, ec)) DB::throwEngineError(DB::err::kDatabaseDuplicate, where);

  // Leftovers of an earlier creation that did not finish belong to nobody.
  const auto building = withSuffix(file, ".creating");
  removeIfPresent(building, where);
  removeCompanions(building, where);
  try {
    {
      auto db = openConnection(building, OpenMode::CreateNew, busyTimeout, where);
      const std::string stamp = "PRAGMA application_id=" + std::to_string(kApplicationId) +
                                "; PRAGMA user_version=" + std::to_string(kFormatVersion) + ";";
      execute(db.get(), stamp.c_str(), where);
      // Moves everything into the main file; closing the last connection
      // then removes the write-ahead log.
      execute(db.get(), "PRAGMA wal_checkpoint(TRUNCATE)", where);
    }
    syncFile(building, where);
    // link() fails when the name exists, so a file that appeared meanwhile
    // is never replaced.
    if (::link(building.c_str(), file.c_str()) != 0) {
      const int error = errno;
      if (error == EEXIST) DB::throwEngineError(DB::err::kDatabaseDuplicate, where);
      if (error != EPERM && error != EOPNOTSUPP) throwErrno(error, where);
      // A file system without hard links: rename, after a last look.
      if (fs::exists(file, ec)) DB::throwEngineError(DB::err::kDatabaseDuplicate, where);
      if (::rename(building.c_str(), file.c_str()) != 0) throwErrno(errno, where);
    }
    ::unlink(building.c_str());
    syncFolder(file.parent_path(), where);
  } catch (...) {
    std::error_code ignored;
    for (const auto& f : {building, walFile(building), shmFile(building), journalFile(building)}) {
      fs::remove(f, ignored);
    }
    throw;
  }
}

fs::path walFile(const fs::path& file) { return withSuffix(file, "-wal"); }
fs::path shmFile(const fs::path& file) { return withSuffix(file, "-shm"); }
fs::path journalFile(const fs::path& file) { return withSuffix(file, "-journal"); }

void removeCompanions(const fs::path& file, const std::source_location& where) {
  removeIfPresent(walFile(file), where);
  removeIfPresent(shmFile(file), where);
  removeIfPresent(journalFile(file), where);
}

std::optional<FileHeader> readHeader(const fs::path& file) {
  std::ifstream in(file, std::ios::binary);
  std::array<unsigned char, 100> bytes{};
  if (!in.read(reinterpret_cast<char*>(bytes.data()), bytes.size())) return std::nullopt;
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

void syncFile(const fs::path& file, const std::source_location& where) {
  const UniqueFd fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
  if (fd.get() < 0) throwErrno(errno, where);
  if (::fsync(fd.get()) != 0) throwErrno(errno, where);
}

void syncFolder(const fs::path& folder, const std::source_location& where) {
  const UniqueFd fd(::open(folder.empty() ? "." : folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (fd.get() < 0) throwErrno(errno, where);
  if (::fsync(fd.get()) != 0) throwErrno(errno, where);
}

}  // namespace engine
