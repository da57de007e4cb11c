#include "maintenance/cleanup.h"

#include <algorithm>
#include <chrono>
#include <mutex>
#include <stdexcept>

#include "engine/instance_for_maintenance.h"
#include "framework/log.h"

namespace maint {
namespace {

std::int64_t seconds(sys::WallClock::time_point t) {
  return std::chrono::duration_cast<std::chrono::seconds>(t.time_since_epoch()).count();
}

}  // namespace

void cleanUp(const std::shared_ptr<DB::DBInstances>& pool, const std::string& dbKey,
             const std::set<std::string>& usedIds, DB::DBProgressCallback& progress, std::stop_token stop) {
  if (g_LogVerbose) Log::Lock(Log::Debug).logStreamLine() << "DBLocal:cleanUp started for " << dbKey;
  const DB::InstanceForMaintenance hold(pool, dbKey, &progress, false, stop);
  sys::Env& env = pool->env();
  const std::int64_t now = env.nowSeconds();
  progress.onProgress(0, "Erasing unused data...");

  const sys::Path folder = pool->paths().dataFolder(dbKey);
  if (env.stat(folder, true).type != sys::FileType::Folder) {
    progress.onProgress(100, "No data found");
    return;
  }
  const std::vector<sys::DirEntry> entries = env.list(folder);
  std::uint64_t total = static_cast<std::uint64_t>(
      std::count_if(entries.begin(), entries.end(), [](const auto& e) { return e.type == sys::FileType::Folder; }));
  if (total == 0) total = 1;

  std::uint64_t processed = 0;
  std::uint64_t erased = 0;
  std::uint64_t tooRecent = 0;
  std::int64_t reported = -100;
  for (const sys::DirEntry& entry : entries) {
    if (stop.stop_requested()) throw std::runtime_error("Cleanup stopped: the server is stopping");
    if (!usedIds.contains(entry.name)) {
      // Checked and removed under the id's data lock: a write into it
      // either came before (and made it young) or waits until it is gone.
      const auto idLock = pool->dataLock(dbKey, entry.name);
      const std::unique_lock removing(*idLock);
      const sys::Path path = folder / entry.name;
      const sys::FileInfo info = env.stat(path);
      if (info.type != sys::FileType::Missing) {
        if (now - seconds(info.modified) > kUnusedDataAgeSeconds) {
          env.removeAll(path);
          ++erased;
        } else {
          ++tooRecent;
        }
      }
    }
    ++processed;
    // Plain files count as processed but not in total, so the share could
    // pass 100; the protocol promises 0 to 100.
    const auto percent = static_cast<std::int64_t>(std::min<std::uint64_t>(processed * 100 / total, 100));
    if (percent >= reported + 5) {
      progress.onProgress(static_cast<std::uint32_t>(percent), "Removing data chunks " + std::to_string(percent) +
                                                                   "% complete (" + std::to_string(processed) + "/" +
                                                                   std::to_string(total) + "), " +
                                                                   std::to_string(erased) + " erased");
      reported = percent;
    }
  }
  Log::Lock(Log::Notice).logStreamLine() << "Database \"" << dbKey << "\" cleaned. " << erased
                                         << " unused ids deleted, " << tooRecent << " unused ids too recent to clean";
}

}  // namespace maint
