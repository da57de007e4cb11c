#include "engine/restore.h"

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

namespace engine {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kCopyChunk = 4 * 1024 * 1024;

// The copy in the destination folder, removed unless it was put in place.
class StagedFile {
 public:
  StagedFile(sys::Env& env, fs::path file) : env_(env), file_(std::move(file)) {}
  ~StagedFile() {
    if (file_.empty()) return;
    for (const auto& f : {file_, walFile(file_), shmFile(file_), journalFile(file_)}) {
      try {
        env_.remove(f);
      } catch (const std::system_error&) {
        // The restore's own failure is the one reported.
      }
    }
  }
  StagedFile(const StagedFile&) = delete;
  StagedFile& operator=(const StagedFile&) = delete;
  const fs::path& path() const { return file_; }
  void placed() { file_.clear(); }

 private:
  sys::Env& env_;
  fs::path file_;
};

// The destination's write-ahead log and index, set aside while the restored
// file takes the database file's place and brought back if that fails: a
// log may hold committed transactions that no checkpoint has moved into
// the file yet. Once the new file is in place they are stale (replayed
// onto the restored file they would corrupt it) and are removed.
class SetAside {
 public:
  SetAside(sys::Env& env, const fs::path& target) : env_(env) {
    try {
      for (const auto& f : {walFile(target), shmFile(target), journalFile(target)}) {
        if (env_.stat(f).type == sys::FileType::Missing) continue;
        fs::path aside = f;
        aside += ".replaced";
        env_.rename(f, aside);
        moved_.emplace_back(f, aside);
      }
    } catch (...) {
      bringBack();
      throw;
    }
  }
  ~SetAside() {
    if (placed_) {
      removeAside();
    } else {
      bringBack();
    }
  }
  SetAside(const SetAside&) = delete;
  SetAside& operator=(const SetAside&) = delete;
  void placed() { placed_ = true; }

 private:
  void bringBack() noexcept { settle(false); }
  void removeAside() noexcept { settle(true); }
  void settle(bool remove) noexcept {
    for (const auto& [original, aside] : moved_) {
      try {
        if (remove) {
          env_.remove(aside);
        } else {
          env_.rename(aside, original);
        }
      } catch (const std::system_error& e) {
        Log::Lock(Log::Error).logStreamLine() << "Engine: restore could not " << (remove ? "remove" : "bring back")
                                              << " \"" << aside.string() << "\": " << e.what();
      }
    }
    moved_.clear();
  }

  sys::Env& env_;
  std::vector<std::pair<fs::path, fs::path>> moved_;
  bool placed_ = false;
};

[[noreturn]] void refuse(const fs::path& backupFolder, const std::string& reason, const std::source_location& where) {
  Log::Lock(Log::Warning).logStreamLine()
      << "Engine: restore from \"" << backupFolder.string() << "\" refused: " << reason;
  DB::throwEngineError(DB::err::kBadBackupFormat, where);
}

bool isOurs(const FileHeader& header) { return header.applicationId == kApplicationId; }

// The database file of the backup: the one under the configured name, or
// else the only file that carries our identity (a backup taken while the
// server used another file name). Only a regular file is taken: a link
// could lead anywhere on the machine, and a link or folder under the
// configured name is refused rather than passed over for another file.
fs::path findDatabase(sys::Env& env, const fs::path& folder, const std::string& fileName,
                      const std::source_location& where) {
  const auto named = onFiles(where, [&] { return env.stat(folder / fileName).type; });
  if (named == sys::FileType::Regular) return folder / fileName;
  if (named != sys::FileType::Missing) refuse(folder, "\"" + fileName + "\" is not a regular file", where);
  const auto entries = onFiles(where, [&] { return env.list(folder); });
  std::optional<fs::path> found;
  for (const auto& entry : entries) {
    if (entry.type != sys::FileType::Regular) continue;
    const auto header = readHeader(env, folder / entry.name);
    if (!header || !isOurs(*header)) continue;
    if (found) refuse(folder, "two files of this server in it and none named \"" + fileName + "\"", where);
    found = folder / entry.name;
  }
  if (!found) refuse(folder, "no database file \"" + fileName + "\" of this server in it", where);
  return *found;
}

// The header's facts that the copy relies on: a SQLite page size (a power
// of two from 512 to 65,536; another value would divide by zero or
// misplace every page) and, when the header records one, a page count the
// file's size can hold.
FileHeader checkHeader(sys::Env& env, const fs::path& backupFolder, const fs::path& file,
                       const std::source_location& where) {
  const std::string name = "\"" + file.filename().string() + "\"";
  const auto header = readHeader(env, file);
  if (!header) refuse(backupFolder, name + " is not a database of this engine", where);
  if (!isOurs(*header) || header->userVersion < 1)
    refuse(backupFolder, name + " is not a database of this server", where);
  if (header->userVersion > kFormatVersion) {
    refuse(backupFolder,
           name + " has format version " + std::to_string(header->userVersion) + ", newer than this server's " +
               std::to_string(kFormatVersion),
           where);
  }
  const std::uint32_t page = header->pageSize;
  if (page < 512 || page > 65536 || (page & (page - 1)) != 0) {
    refuse(backupFolder, name + " has an invalid page size (" + std::to_string(page) + ")", where);
  }
  const auto size = onFiles(where, [&] { return env.stat(file, true).size; });
  if (header->pageCount && size < std::uint64_t{*header->pageCount} * page) {
    refuse(backupFolder,
           name + " is truncated (" + std::to_string(size) + " bytes of " +
               std::to_string(std::uint64_t{*header->pageCount} * page) + ")",
           where);
  }
  return *header;
}

void copyFile(sys::Env& env, const fs::path& from, const fs::path& to, std::uint32_t pageSize,
              const StatusCallback& status, const std::source_location& where) {
  onFiles(where, [&] {
    const auto in = env.open(from, sys::OpenMode::Read);
    const auto out = env.open(to, sys::OpenMode::CreateOrTruncate);
    const auto total = static_cast<std::uint32_t>((in->size() + pageSize - 1) / pageSize);
    std::vector<char> buffer(kCopyChunk);
    std::uint64_t copied = 0;
    std::uint64_t lastPercent = 0;
    for (std::size_t n; (n = in->read(buffer.data(), buffer.size())) > 0;) {
      out->write(buffer.data(), n);
      copied += n;
      const auto done = static_cast<std::uint32_t>(copied / pageSize);
      const std::uint64_t percent = total == 0 ? 100 : std::uint64_t{done} * 100 / total;
      if (status && percent > lastPercent) {
        status({SnapshotOperation::Restore, StatusKind::Progress, done, total});
        lastPercent = percent;
      }
    }
    out->sync();
    out->close();
  });
}

// SQLite's quick check on the staged copy (never on the backup itself,
// which stays as it was unpacked).
void checkContent(sys::Env& env, const fs::path& backupFolder, const fs::path& staged, const Instance& instance,
                  const std::source_location& where) {
  try {
    auto db = openConnection(env, staged, OpenMode::Existing, instance.settings().busyTimeout, where);
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
             "the database fails the integrity check (" +
                 (verdict.empty() ? std::string(sqlite3_errstr(rc)) : verdict) + ")",
             where);
    }
  } catch (const DB::DBExc& e) {
    switch (e.code()) {
      case DB::err::kInvalidDatabase:
      case DB::err::kInvalidDatabaseVersion:
      case DB::err::kDatabaseCorrupted:
        refuse(backupFolder, "the database cannot be read (" + std::string(e.what()) + ")", where);
      default:
        throw;
    }
  }
  removeCompanions(env, staged, where);
}

}  // namespace

void restoreInstance(Instance& instance, const fs::path& backupFolder, const fs::path& destinationFolder,
                     const StatusCallback& status, const SchemaCheck&, const std::source_location& where) {
  if (instance.state() != Instance::State::Created) DB::throwEngineError(DB::err::kAfterInitialization, where);
  sys::Env& env = *instance.settings().env;
  const auto& fileName = instance.settings().databaseFileName;
  const fs::path source = findDatabase(env, backupFolder, fileName, where);
  const FileHeader header = checkHeader(env, backupFolder, source, where);

  onFiles(where, [&] { env.createFolders(destinationFolder); });
  const fs::path target = destinationFolder / fileName;
  fs::path stagedName = target;
  stagedName += ".restoring";
  StagedFile staged(env, stagedName);

  if (status) status({SnapshotOperation::Restore, StatusKind::Begin, std::nullopt, std::nullopt});
  copyFile(env, source, staged.path(), header.pageSize, status, where);
  checkContent(env, backupFolder, staged.path(), instance, where);

  // Nobody has the destination open (the instance is not initialised).
  onFiles(where, [&] {
    SetAside companions(env, target);
    env.rename(staged.path(), target);
    staged.placed();
    companions.placed();
  });
  syncFolder(env, destinationFolder, where);
  if (status) status({SnapshotOperation::Restore, StatusKind::Complete, std::nullopt, std::nullopt});
}

}  // namespace engine
