#include "engine/backup.h"

#include <sqlite3.h>

#include <chrono>
#include <thread>

#include "engine/connection.h"
#include "engine/database_file.h"
#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/instance.h"
#include "engine/sqlite_errors.h"

namespace engine {
namespace {

namespace fs = std::filesystem;

struct BackupFinisher {
  void operator()(sqlite3_backup* b) const noexcept { sqlite3_backup_finish(b); }
};
using BackupPtr = std::unique_ptr<sqlite3_backup, BackupFinisher>;

// Removes the copy unless the backup reached its end.
class PartialCopy {
 public:
  PartialCopy(sys::Env& env, fs::path file) : env_(env), file_(std::move(file)) {}
  ~PartialCopy() {
    if (file_.empty()) return;
    for (const auto& f : {file_, walFile(file_), shmFile(file_), journalFile(file_)}) {
      try {
        env_.remove(f);
      } catch (const std::system_error&) {
        // The backup's own failure is the one reported.
      }
    }
  }
  PartialCopy(const PartialCopy&) = delete;
  PartialCopy& operator=(const PartialCopy&) = delete;
  void keep() { file_.clear(); }

 private:
  sys::Env& env_;
  fs::path file_;
};

// The destination is a new file that nobody else knows yet: no journal and
// no syncs while it is written, one sync at the end.
ConnectionPtr openCopy(const fs::path& file, const std::source_location& where) {
  configureLibrary();
  sqlite3* raw = nullptr;
  const int rc = sqlite3_open_v2(
      file.c_str(), &raw, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE,
      nullptr);
  ConnectionPtr db(raw);
  if (rc != SQLITE_OK) throwSqlite(db.get(), rc, where);
  execute(db.get(), "PRAGMA journal_mode=OFF; PRAGMA synchronous=OFF;", where);
  return db;
}

}  // namespace

void backupInstance(Instance& instance, const fs::path& targetFolder, const StatusCallback& status, int pagesPerStep,
                    const std::source_location& where) {
  switch (instance.state()) {
    case Instance::State::Initialised:
      break;
    case Instance::State::Created:
      DB::throwEngineError(DB::err::kNotInitialized, where);
    case Instance::State::Terminated:
      DB::throwEngineError(DB::err::kTermInProgress, where);
  }
  const auto source = instance.attachedDatabase();
  if (!source) DB::throwEngineError(DB::err::kDatabaseNotFound, where);
  if (pagesPerStep <= 0) pagesPerStep = kBackupPagesPerStep;

  sys::Env& env = *instance.settings().env;
  onFiles(where, [&] { env.createFolders(targetFolder); });
  const fs::path copy = targetFolder / instance.settings().databaseFileName;
  PartialCopy partial(env, copy);
  {
    // Whatever was there before belongs to an earlier run.
    onFiles(where, [&] {
      for (const auto& f : {copy, walFile(copy), shmFile(copy), journalFile(copy)}) env.remove(f);
    });

    auto from = openConnection(env, *source, OpenMode::Existing, instance.settings().busyTimeout, where);
    // One read transaction for the whole copy: without it every write of
    // another session would make the copy start over.
    execute(from.get(), "BEGIN", where);
    queryInt(from.get(), "SELECT count(*) FROM sqlite_schema", where);

    auto to = openCopy(copy, where);
    if (status) status({SnapshotOperation::Backup, StatusKind::Begin, std::nullopt, std::nullopt});
    BackupPtr backup(sqlite3_backup_init(to.get(), "main", from.get(), "main"));
    if (!backup) throwSqlite(to.get(), sqlite3_extended_errcode(to.get()), where);

    std::uint64_t lastPercent = 0;
    bool reported = false;
    const auto deadline = std::chrono::steady_clock::now() + instance.settings().busyTimeout;
    for (;;) {
      const int rc = sqlite3_backup_step(backup.get(), pagesPerStep);
      if (rc == SQLITE_BUSY || rc == SQLITE_LOCKED) {
        // Only the copy's own file can be locked, and only by someone who
        // has no business there; give them the busy timeout.
        if (std::chrono::steady_clock::now() > deadline) throwSqlite(to.get(), rc, where);
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
        continue;
      }
      if (rc != SQLITE_OK && rc != SQLITE_DONE) {
        backup.reset();
        throwSqlite(to.get(), rc, where);
      }
      const auto total = static_cast<std::uint32_t>(sqlite3_backup_pagecount(backup.get()));
      const auto done = total - static_cast<std::uint32_t>(sqlite3_backup_remaining(backup.get()));
      const std::uint64_t percent = total == 0 ? 100 : std::uint64_t{done} * 100 / total;
      if (status && (!reported || percent > lastPercent)) {
        status({SnapshotOperation::Backup, StatusKind::Progress, done, total});
        reported = true;
        lastPercent = percent;
      }
      if (rc == SQLITE_DONE) break;
    }
    const int finished = sqlite3_backup_finish(backup.release());
    if (finished != SQLITE_OK) throwSqlite(to.get(), finished, where);
    execute(from.get(), "COMMIT", where);
  }
  syncFile(env, copy, where);
  syncFolder(env, targetFolder, where);
  partial.keep();
  if (status) status({SnapshotOperation::Backup, StatusKind::Complete, std::nullopt, std::nullopt});
}

}  // namespace engine
