#include "store/stale_files.h"

#include <cstdio>
#include <exception>
#include <random>

#include "framework/log.h"
#include "store/catalog.h"
#include "store/db_local.h"

namespace DB {

const std::string& processTempPrefix() {
  static const std::string prefix = [] {
    std::random_device source;
    const std::uint64_t tag = (std::uint64_t{source()} << 32) | source();
    char hex[17];
    std::snprintf(hex, sizeof hex, "%016llx", static_cast<unsigned long long>(tag));
    return std::string(DBLocal::kTempPrefix) + hex + '.';
  }();
  return prefix;
}

StaleFilesReport removeStaleTempFiles(sys::Env& env, const Paths& paths, sys::WallClock::time_point before,
                                      std::stop_token stop) {
  StaleFilesReport report;
  std::vector<std::string> keys;
  try {
    keys = databaseKeys(env, paths);
  } catch (const std::exception& e) {
    Log::Lock(Log::Warning).logStreamLine() << "Stale temporary files: the databases cannot be listed: " << e.what();
    return report;
  }
  for (const std::string& key : keys) {
    const sys::Path data = paths.dataFolder(key);
    try {
      if (env.stat(data).type != sys::FileType::Folder) continue;
      for (const sys::DirEntry& id : env.list(data)) {
        if (stop.stop_requested()) return report;
        if (id.type != sys::FileType::Folder) continue;
        for (const sys::DirEntry& file : env.list(data / id.name)) {
          if (file.type != sys::FileType::Regular || !file.name.starts_with(DBLocal::kTempPrefix)) continue;
          if (file.name.starts_with(processTempPrefix())) continue;  // a write of this process
          const sys::Path path = data / id.name / file.name;
          const sys::FileInfo info = env.stat(path);
          if (info.type != sys::FileType::Regular || info.modified >= before) continue;
          if (env.remove(path)) {
            ++report.removed;
            report.bytes += info.size;
          }
        }
      }
    } catch (const std::exception& e) {
      if (g_LogVerbose) {
        Log::Lock(Log::Debug).logStreamLine()
            << "Stale temporary files: skipped \"" << data.string() << "\": " << e.what();
      }
    }
  }
  // One line whatever the sweep found, so that its end can be seen (an
  // operator, or a test that waits for the sweep before looking).
  if (report.removed > 0) {
    Log::Lock(Log::Notice).logStreamLine() << "Removed " << report.removed << " temporary file(s) (" << report.bytes
                                           << " bytes) of data-file writes that a stop of the server interrupted";
  } else {
    Log::Lock(Log::Notice).logStreamLine() << "No temporary files of interrupted data-file writes found";
  }
  return report;
}

}  // namespace DB
