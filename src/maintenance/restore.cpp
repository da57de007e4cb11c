#include "maintenance/restore.h"

#include <optional>
#include <sstream>
#include <stdexcept>

#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/instance_for_maintenance.h"
#include "framework/log.h"
#include "maintenance/archive_reader.h"
#include "maintenance/backup.h"
#include "maintenance/engine_status.h"
#include "maintenance/file_replacer.h"
#include "maintenance/restore_journal.h"
#include "maintenance/temp_folder.h"
#include "settings/config.h"
#include "settings/names.h"

namespace maint {
namespace {

std::string toSlashes(std::string path) {
  for (char& c : path) {
    if (c == '\\') c = '/';
  }
  return path;
}

// "Decompression N% complete (i/n)" after entry i of n, every five points;
// none after the last entry.
ArchiveReader::Progress decompressionProgress(DB::DBProgressCallback& progress) {
  return [&progress, reported = std::int64_t{-100}](std::size_t done, std::size_t count) mutable {
    if (done >= count) return;
    const auto percent = static_cast<std::int64_t>(done * 100 / count);
    if (percent < reported + 5) return;
    reported = percent;
    progress.onProgress(static_cast<std::uint32_t>(percent), "Decompression " + std::to_string(percent) +
                                                                 "% complete (" + std::to_string(done) + "/" +
                                                                 std::to_string(count) + ")");
  };
}

// Creates folder and its missing parents, each new level's name on disk
// (synced into its parent) before anything that must survive a power loss
// is put below it.
void createDurably(sys::Env& env, const sys::Path& folder) {
  for (const sys::Path& level : env.createFolders(folder)) env.syncFolder(level.parent_path());
}

// The unpacked tree and the database file copied once more into place must
// fit on the database root's file system.
void checkSpace(sys::Env& env, const DB::Paths& paths, const ArchiveReader& reader, const std::string& archive) {
  std::uint64_t needed = reader.totalSize();
  for (const auto& e : reader.entries()) {
    if (e.name == paths.dbFileName()) needed += e.size;
  }
  const std::uint64_t free = env.freeSpace(paths.root());
  if (needed > free) {
    throw std::runtime_error("Not enough free space to restore from \"" + archive + "\": it needs " +
                             std::to_string(needed) + " bytes, the file system of \"" + paths.root() + "\" has " +
                             std::to_string(free));
  }
}

// The database the archive records, when it is another than key and the
// restore follows it; refuses a recorded name no client could use.
std::optional<std::string> recordedKey(const DB::Paths& paths, const std::string& recorded, const std::string& key,
                                       bool keepName, const std::string& archive) {
  if (recorded.empty() || recorded == key) return std::nullopt;
  if (keepName) {
    Log::Lock(Log::Notice).logStreamLine() << "Restore found different DB name in backup file (" << recorded
                                           << "), but will restore to the requested DB: " << key;
    return std::nullopt;
  }
  std::string why;
  if (!paths.acceptsName(recorded, &why)) {
    throw std::runtime_error("The backup file \"" + archive + "\" records an invalid database name (" + why + ")");
  }
  const std::string recordedAsKey = DB::folderName(recorded);
  if (recordedAsKey == key) return std::nullopt;
  Log::Lock(Log::Notice).logStreamLine() << "Restore will use DB name from backup file (" << recorded << ") instead of "
                                         << key;
  return recordedAsKey;
}

// The engine's refusal of the archive's database file, in the client's
// words.
void placeDatabase(engine::Instance& instance, const RestoreLayout& at, DB::DBProgressCallback& progress,
                   const RestoreOptions& options) {
  try {
    engine::restoreInstance(instance, at.unpacked, at.dbFolder, engineStatus(progress), options.schemaCheck);
  } catch (const DB::DBExc& e) {
    if (e.code() == DB::err::kBadBackupFormat) {
      throw DB::DBExc("The backup format is not compatible with the engine version");
    }
    throw;
  }
}

// The previous files of the database and log folders, set aside for the
// time of a restore and brought back unless it commits. The journal goes
// ahead of every step: "aside" before the first file moves, "placing" once
// every move is on disk, "committed" once the new files are. Rolling back
// follows the journal too (rollBack), so a crash in the middle of it is
// finished by the recovery at the next start; a rollback that fails keeps
// the working folder, journal included, for that recovery.
class Replacement {
 public:
  Replacement(sys::Env& env, const RestoreLayout& at, RestoreJournal& journal, TempFolder& working)
      : env_(env), at_(at), journal_(journal), working_(working) {
    journal_.write(RestoreState::Aside);
    // Where the previous files go must exist on disk before they go there.
    createDurably(env, at.dbHolding);
    if (at.separateLog) createDurably(env, at.logHolding);
    // Each replacer puts back its own moves if it fails half way, and the
    // other's if a later step of this constructor fails.
    db_.emplace(env, at.dbFolder, at.dbHolding, kDataFolderName);
    if (at.separateLog) log_.emplace(env, at.logFolder, at.logHolding, "");
    // The moves on disk: where the files went, then where they left.
    for (const sys::Path& folder : {at.dbHolding, at.logHolding, at.dbFolder, at.logFolder}) {
      if (env.stat(folder).type == sys::FileType::Folder) env.syncFolder(folder);
    }
    try {
      journal_.write(RestoreState::Placing);
    } catch (...) {
      // The new state may have reached the disk; the replacers are about to
      // move files back, which only the state "aside" describes.
      try {
        journal_.write(RestoreState::Aside);
      } catch (const std::exception&) {
      }
      throw;
    }
    armed_ = true;
  }
  ~Replacement() {
    if (!armed_) return;
    // The replacers would remove what stands in the folders and move the
    // previous files back in one go; the journal's order is kept instead.
    db_->commit();
    if (log_) log_->commit();
    try {
      rollBack(env_, at_, journal_);
    } catch (const std::exception& e) {
      working_.dismiss();
      try {
        Log::Lock(Log::Error).logStreamLine()
            << "Critical: Failed to restore original file(s) at \"" << at_.dbFolder.string()
            << "\"! Database may be left in unpredictable state. (" << e.what()
            << "; the next start of the server tries again from \"" << at_.work.string() << "\")";
      } catch (...) {
      }
    }
  }
  Replacement(const Replacement&) = delete;
  Replacement& operator=(const Replacement&) = delete;

  // The restored files must be on disk before this.
  void commit() {
    journal_.write(RestoreState::Committed);
    armed_ = false;
    db_->commit();
    if (log_) log_->commit();
  }

 private:
  sys::Env& env_;
  const RestoreLayout& at_;
  RestoreJournal& journal_;
  TempFolder& working_;
  std::optional<FileReplacer> db_;
  std::optional<FileReplacer> log_;
  bool armed_ = false;
};

}  // namespace

std::string restoreSource(const DB::Paths& paths, const std::string& target, const std::string& key) {
  if (target.empty()) return paths.backupFile(key);
  const std::string t = toSlashes(target);
  return t.front() == '/' ? t : paths.backupFolder() + t;
}

std::string readOriginName(sys::Env& env, const sys::Path& folder) {
  std::string text;
  try {
    text = env.readFile(folder / DB::kOriginFileName);
  } catch (const std::system_error&) {
    return {};
  }
  const auto firstEnd = text.find('\n');
  if (firstEnd == std::string::npos) return {};
  std::string second = text.substr(firstEnd + 1);
  const auto end = second.find_first_of("\r\n");
  if (end != std::string::npos) second.resize(end);
  return second;
}

std::string restoreOne(const std::shared_ptr<DB::DBInstances>& pool, const std::string& archivePath,
                       const std::string& name, bool keepName, DB::DBProgressCallback& progress,
                       const RestoreOptions& options, std::stop_token stop) {
  sys::Env& env = pool->env();
  const DB::Paths& paths = pool->paths();
  std::string key = name;
  const std::string archive = restoreSource(paths, archivePath, key);
  if (!paths.allowsMaintenancePath(archive)) {
    throw DB::DBExc("Database restore for \"" + key + "\" refused the backup file \"" + archive +
                    "\": it lies outside the folders that MaintenanceFolders allows");
  }
  if (g_LogVerbose) Log::Lock(Log::Debug).logStreamLine() << "DB:restore starting. File: " << archive;
  if (env.stat(archive, true).type != sys::FileType::Regular) {
    throw DB::DBExc("Database restore for \"" + key + "\" can not find the backup file: \"" + archive + "\"");
  }

  const DB::InstanceForMaintenance hold(pool, key, &progress, true, stop);
  // Recovery at the start has dealt with any journal; what is left here is
  // debris of an operation that never touched the database.
  const sys::Path work = paths.tempFolder(key);
  TempFolder working(env, work);
  env.removeAll(work);
  // The journal will live here: the folder's name must be on disk first.
  createDurably(env, work);

  progress.onProgress(0, "Starting decompression ...");
  RestoreLayout at = restoreLayout(paths, work, key);
  {
    ArchiveReader reader(env, archive);
    checkSpace(env, paths, reader, archive);
    reader.unpackTo(at.unpacked, decompressionProgress(progress), stop);
  }

  std::optional<DB::InstanceForMaintenance> second;
  if (const auto other = recordedKey(paths, readOriginName(env, at.unpacked), key, keepName, archive)) {
    key = *other;
    at = restoreLayout(paths, work, key);
    second.emplace(pool, key, &progress, true, stop);
  }
  if (stop.stop_requested()) throw OperationStopped("Restore stopped: the server is stopping");

  // From here on the journal says how to undo or finish what was done, if
  // the process ends before the working folder is gone.
  RestoreJournal journal(env, work, key);
  Replacement replacement(env, at, journal, working);

  createDurably(env, at.dbFolder);
  placeDatabase(*(second ? second->instance() : hold.instance()), at, progress, options);
  progress.onProgress(100, "Replacing binaries...");
  const sys::Path data = at.unpacked / kDataFolderName;
  if (env.stat(data).type == sys::FileType::Folder) {
    env.createFolders(at.dbFolder);
    env.rename(data, at.dbFolder / kDataFolderName);
  }
  // The unpacked files were synced as they were written; the engine synced
  // its file and its folder. What remains is the data folder's new name.
  env.syncFolder(at.dbFolder);
  replacement.commit();

  Log::Lock(Log::Notice).logStreamLine() << "Database restored for \"" << key << "\" from \"" << archive << '"';
  working.cleanUp();
  return key;
}

std::vector<std::string> restoreFolder(const std::shared_ptr<DB::DBInstances>& pool, const std::string& folder,
                                       DB::DBProgressCallback& progress, const RestoreOptions& options,
                                       std::stop_token stop) {
  sys::Env& env = pool->env();
  const DB::Paths& paths = pool->paths();
  std::string from = folder.empty() ? paths.backupFolder() : toSlashes(folder);
  if (from.front() != '/') from = paths.backupFolder() + from;
  if (!paths.allowsMaintenancePath(from)) {
    throw DB::DBExc("Restore refused the folder \"" + from +
                    "\": it lies outside the folders that MaintenanceFolders allows");
  }
  std::vector<std::string> restored;
  for (const sys::DirEntry& e : env.list(from)) {
    const sys::Path file = sys::Path(from) / e.name;
    const std::string name = DB::nameFromBackupFile(e.name);
    if (e.type != sys::FileType::Regular || name.empty() || !paths.acceptsName(name)) {
      Log::Lock(Log::Notice).logStreamLine()
          << "Can not restore " << quoted(file.string()) << " since it does not look like a backup file. Skipped";
      continue;
    }
    if (stop.stop_requested()) throw OperationStopped("Restore stopped: the server is stopping");
    restored.push_back(restoreOne(pool, file.string(), DB::folderName(name), false, progress, options, stop));
  }
  return restored;
}

}  // namespace maint
