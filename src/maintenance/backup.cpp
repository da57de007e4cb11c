#include "maintenance/backup.h"

#include <functional>
#include <stdexcept>
#include <vector>

#include "engine/backup.h"
#include "engine/instance_for_maintenance.h"
#include "framework/log.h"
#include "maintenance/archive_writer.h"
#include "maintenance/engine_status.h"
#include "maintenance/temp_folder.h"
#include "settings/config.h"
#include "settings/names.h"

namespace maint {
namespace {

// The files below folder, recursively in listing order, as (path, entry
// name) with the name's elements joined by '\' after prefix. Links, other
// special files and the temporary files of data-file writes (a write under
// way, or one a crash cut short) are left out.
void collect(sys::Env& env, const sys::Path& folder, const std::string& prefix,
             std::vector<std::pair<sys::Path, std::string>>& out) {
  for (const sys::DirEntry& e : env.list(folder)) {
    if (e.type == sys::FileType::Folder) {
      collect(env, folder / e.name, prefix + e.name + '\\', out);
    } else if (e.type == sys::FileType::Regular && !e.name.starts_with(DB::kDataTempPrefix)) {
      out.emplace_back(folder / e.name, prefix + e.name);
    }
  }
}

// Progress of one packed folder: "<prefix>N% complete (i/n)" every five
// points, the first always.
class PackProgress {
 public:
  PackProgress(DB::DBProgressCallback& progress, std::string prefix, std::size_t count)
      : progress_(progress), prefix_(std::move(prefix)), total_(count == 0 ? 1 : count) {}
  void done() {
    ++done_;
    const auto percent = static_cast<std::int64_t>(done_ * 100 / total_);
    if (percent < reported_ + 5) return;
    reported_ = percent;
    progress_.onProgress(static_cast<std::uint32_t>(percent), prefix_ + std::to_string(percent) + "% complete (" +
                                                                  std::to_string(done_) + "/" + std::to_string(total_) +
                                                                  ")");
  }

 private:
  DB::DBProgressCallback& progress_;
  std::string prefix_;
  std::uint64_t total_;
  std::uint64_t done_ = 0;
  std::int64_t reported_ = -100;
};

// Whether folder is (or lies inside) a database's folder: a folder that
// holds the database file, or one below it.
bool insideADatabase(sys::Env& env, const DB::Paths& paths, sys::Path folder) {
  for (; !folder.empty(); folder = folder.parent_path()) {
    if (env.stat(folder / paths.dbFileName(), true).type == sys::FileType::Regular) return true;
    if (folder == folder.parent_path()) break;
  }
  return false;
}

}  // namespace

std::string quoted(const std::string& path) {
  std::string out = "\"";
  for (const char c : path) {
    if (c == '"' || c == '&') out += '&';
    out += c;
  }
  return out + '"';
}

std::string archivePath(const DB::Paths& paths, sys::Env& env, const std::string& target, const std::string& dbKey) {
  if (target.empty()) return paths.backupFile(dbKey);
  std::string t = target;
  for (char& c : t) {
    if (c == '\\') c = '/';
  }
  // A service has no meaningful working folder: relative targets lie below
  // the backup folder.
  if (t.front() != '/') t = paths.backupFolder() + t;
  if (t.back() == '/' || env.stat(t, true).type == sys::FileType::Folder) {
    return normaliseFolder(t) + DB::backupFileName(dbKey);
  }
  if (!t.ends_with(DB::kBackupExtension)) t += DB::kBackupExtension;
  return t;
}

std::string backupOne(const std::shared_ptr<DB::DBInstances>& pool, const std::string& dbKey, const std::string& target,
                      const std::string& requesterDbFile, DB::DBProgressCallback& progress, std::stop_token stop) {
  sys::Env& env = pool->env();
  const DB::Paths& paths = pool->paths();
  const std::string archive = archivePath(paths, env, target, dbKey);
  if (!paths.allowsMaintenancePath(archive)) {
    throw std::runtime_error("Backup target \"" + archive +
                             "\" lies outside the folders that MaintenanceFolders allows");
  }
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DB:backup starting for \"" << dbKey << "\". File: " << archive;
  }
  progress.onProgress(0, "Starting backup for \"" + dbKey + "\" ...");
  if (insideADatabase(env, paths, sys::Path(archive).parent_path())) {
    throw std::runtime_error("Backup target \"" + archive + "\" lies in a database's folder; choose another");
  }

  const sys::Path work = paths.tempFolder(dbKey);
  const DB::InstanceForMaintenance hold(pool, dbKey, &progress, false, stop);
  // Leftovers of an earlier run go first; the working folder is ours alone
  // (no database lives below "db.temp/").
  TempFolder working(env, work);
  env.removeAll(work);
  engine::backupInstance(*hold.instance(), work, engineStatus(progress));
  if (stop.stop_requested()) throw OperationStopped("Backup stopped: the server is stopping");
  {
    const auto origin = env.open(work / DB::kOriginFileName, sys::OpenMode::CreateOrTruncate);
    const std::string text = requesterDbFile + "\r\n" + dbKey;
    origin->write(text.data(), text.size());
    origin->close();
  }

  std::vector<std::pair<sys::Path, std::string>> metadata;
  std::vector<std::pair<sys::Path, std::string>> binaries;
  collect(env, work, "", metadata);
  const sys::Path data = paths.dataFolder(dbKey);
  if (env.stat(data, true).type == sys::FileType::Folder) collect(env, data, "d\\", binaries);

  ArchiveWriter writer(env, archive);
  for (auto& [file, name] : metadata) writer.add(file, name);
  for (auto& [file, name] : binaries) writer.add(file, name);
  PackProgress packedMetadata(progress, "Compressing metadata ", metadata.size());
  PackProgress packedBinaries(progress, "Compressing binaries ", binaries.size());
  writer.onEntry([&](const ArchiveWriter::EntryReport& r) {
    if (r.skipped && g_LogVerbose) {
      Log::Lock(Log::Debug).logStreamLine() << "Compression (backup) skipping failed file " << quoted(r.file.string());
    }
    (r.index < metadata.size() ? packedMetadata : packedBinaries).done();
  });
  writer.commit(stop);
  Log::Lock(Log::Notice).logStreamLine() << "Database backup completed for \"" << dbKey << "\" into \"" << archive
                                         << '"';
  return archive;
}

}  // namespace maint
