#include "engine/restore.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "engine/connection.h"
#include "engine/database_file.h"
#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/instance.h"
#include "framework/log.h"
#include "framework/unique_fd.h"

namespace engine {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kCopyChunk = 4 * 1024 * 1024;

// The copy in the destination folder, removed unless it was put in place.
class StagedFile {
 public:
  explicit StagedFile(fs::path file) : file_(std::move(file)) {}
  ~StagedFile() {
    if (file_.empty()) return;
    std::error_code ignored;
    for (const auto& f : {file_, walFile(file_), shmFile(file_), journalFile(file_)}) fs::remove(f, ignored);
  }
  StagedFile(const StagedFile&) = delete;
  StagedFile& operator=(const StagedFile&) = delete;
  const fs::path& path() const { return file_; }
  void placed() { file_.clear(); }

 private:
  fs::path file_;
};

[[noreturn]] void refuse(const fs::path& backupFolder, const std::string& reason, const std::source_location& where) {
  Log::Lock(Log::Warning).logStreamLine() << "Engine: restore from \"" << backupFolder.string()
                                          << "\" refused: " << reason;
  DB::throwEngineError(DB::err::kBadBackupFormat, where);
}

[[noreturn]] void throwErrno(int error, const std::source_location& where) {
  DB::throwEngineError(engineCodeOfErrno(error), where);
}

bool isOurs(const FileHeader& header) { return header.applicationId == kApplicationId; }

// The database file of the backup: the one under the configured name, or
// else the only file that carries our identity (a backup taken while the
// server used another file name).
std::optional<fs::path> findDatabase(const fs::path& folder, const std::string& fileName) {
  std::error_code ec;
  if (fs::is_regular_file(folder / fileName, ec)) return folder / fileName;
  std::optional<fs::path> found;
  for (fs::directory_iterator it(folder, ec), end; !ec && it != end; it.increment(ec)) {
    if (!it->is_regular_file(ec)) continue;
    const auto header = readHeader(it->path());
    if (!header || !isOurs(*header)) continue;
    if (found) return std::nullopt;  // two candidates: none is the one
    found = it->path();
  }
  return found;
}

void checkHeader(const fs::path& backupFolder, const fs::path& file, const std::source_location& where) {
  const auto header = readHeader(file);
  if (!header) refuse(backupFolder, "\"" + file.filename().string() + "\" is not a database of this engine", where);
  if (!isOurs(*header) || header->userVersion < 1) {
    refuse(backupFolder, "\"" + file.filename().string() + "\" is not a database of this server", where);
  }
  if (header->userVersion > kFormatVersion) {
    refuse(backupFolder,
           "\"" + file.filename().string() + "\" has format version " + std::to_string(header->userVersion) +
               ", newer than this server's " + std::to_string(kFormatVersion),
           where);
  }
  std::error_code ec;
  const auto size = fs::file_size(file, ec);
  if (ec) throwErrno(ec.value(), where);
  if (header->pageCount && size < std::uint64_t{*header->pageCount} * header->pageSize) {
    refuse(backupFolder,
           "\"" + file.filename().string() + "\" is truncated (" + std::to_string(size) + " bytes of " +
               std::to_string(std::uint64_t{*header->pageCount} * header->pageSize) + ")",
           where);
  }
}

void copyFile(const fs::path& from, const fs::path& to, std::uint32_t pageSize, const StatusCallback& status,
              const std::source_location& where) {
  UniqueFd in(::open(from.c_str(), O_RDONLY | O_CLOEXEC));
  if (in.get() < 0) throwErrno(errno, where);
  UniqueFd out(::open(to.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
  if (out.get() < 0) throwErrno(errno, where);
  std::error_code ec;
  const auto size = fs::file_size(from, ec);
  if (ec) throwErrno(ec.value(), where);
  const auto total = static_cast<std::uint32_t>((size + pageSize - 1) / pageSize);

  std::vector<char> buffer(kCopyChunk);
  std::uint64_t copied = 0;
  std::uint64_t lastPercent = 0;
  for (;;) {
    const auto n = ::read(in.get(), buffer.data(), buffer.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) throwErrno(errno, where);
    if (n == 0) break;
    for (ssize_t written = 0; written < n;) {
      const auto w = ::write(out.get(), buffer.data() + written, static_cast<std::size_t>(n - written));
      if (w < 0 && errno == EINTR) continue;
      if (w < 0) throwErrno(errno, where);
      written += w;
    }
    copied += static_cast<std::uint64_t>(n);
    const auto done = static_cast<std::uint32_t>(copied / pageSize);
    const std::uint64_t percent = total == 0 ? 100 : std::uint64_t{done} * 100 / total;
    if (status && percent > lastPercent) {
      status({SnapshotOperation::Restore, StatusKind::Progress, done, total});
      lastPercent = percent;
    }
  }
  if (::fdatasync(out.get()) != 0) throwErrno(errno, where);
  if (out.close() != 0) throwErrno(errno, where);
}

// SQLite's quick check on the staged copy (never on the backup itself,
// which stays as it was unpacked).
void checkContent(const fs::path& backupFolder, const fs::path& staged, const Instance& instance,
                  const std::source_location& where) {
  try {
    auto db = openConnection(staged, OpenMode::Existing, instance.settings().busyTimeout, where);
    sqlite3_stmt* raw = nullptr;
    int rc = sqlite3_prepare_v2(db.get(), "PRAGMA quick_check", -1, &raw, nullptr);
    std::string verdict;
    if (rc == SQLITE_OK) {
      rc = sqlite3_step(raw);
      if (rc == SQLITE_ROW) {
        const auto* text = sqlite3_column_text(raw, 0);
        verdict = text != nullptr ? reinterpret_cast<const char*>(text) : "";
      }
    }
    sqlite3_finalize(raw);
    if (verdict != "ok") {
      refuse(backupFolder,
             "the database fails the integrity check (" + (verdict.empty() ? std::string(sqlite3_errstr(rc)) : verdict) +
                 ")",
             where);
    }
  } catch (const DB::DBExc& e) {
    switch (e.code()) {
      case DB::err::kInvalidDatabase:
      case DB::err::kInvalidDatabaseVersion:
      case DB::err::kDatabaseCorrupted:
        refuse(backupFolder, "the database cannot be read (" + std::string(e.what()) + ")", where);
      default: throw;
    }
  }
  removeCompanions(staged, where);
}

}  // namespace

void restoreInstance(Instance& instance, const fs::path& backupFolder, const fs::path& destinationFolder,
                     const StatusCallback& status, const std::source_location& where) {
  if (instance.state() != Instance::State::Created) DB::throwEngineError(DB::err::kAfterInitialization, where);
  const auto& fileName = instance.settings().databaseFileName;
  const auto source = findDatabase(backupFolder, fileName);
  if (!source) refuse(backupFolder, "no database file \"" + fileName + "\" of this server in it", where);
  checkHeader(backupFolder, *source, where);

  std::error_code ec;
  fs::create_directories(destinationFolder, ec);
  if (ec) throwErrno(ec.value(), where);
  const fs::path target = destinationFolder / fileName;
  fs::path stagedName = target;
  stagedName += ".restoring";
  StagedFile staged(stagedName);

  if (status) status({SnapshotOperation::Restore, StatusKind::Begin, std::nullopt, std::nullopt});
  copyFile(*source, staged.path(), readHeader(*source)->pageSize, status, where);
  checkContent(backupFolder, staged.path(), instance, where);

  // Nobody has the destination open (the instance is not initialised), so
  // what lies beside it is stale.
  removeCompanions(target, where);
  if (::rename(staged.path().c_str(), target.c_str()) != 0) throwErrno(errno, where);
  staged.placed();
  syncFolder(destinationFolder, where);
  if (status) status({SnapshotOperation::Restore, StatusKind::Complete, std::nullopt, std::nullopt});
}

}  // namespace engine
