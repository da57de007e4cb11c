#pragma once
// maint::cleanUp: removes the data of a database that nothing uses any more.
//
// The client names the ids still in use; every other entry of the
// database's data folder ("d/": one folder per data id, and any plain file
// or link there) whose last write is more than six hours old is removed,
// with everything below it. Younger entries are kept, whoever wrote them.
// The current time is read once, before the walk; a folder's last write
// time is its modification time, which changes whenever an entry inside it
// is added, renamed or removed, so a data file written into an id makes it
// young again.
//
// Runs under a shared maintenance hold (beside the database's clients, not
// beside another maintenance operation). The age check and the removal of
// one entry hold that id's data lock exclusive (DBInstances::dataLock), and
// every data-file write holds it shared, so a write acknowledged to a
// client is never removed by a cleanup running at that moment. A link is
// removed as a link; what it points to is never touched.
//
// Progress: 0 "Erasing unused data...", then "Removing data chunks N%
// complete (processed/total), E erased" whenever N has grown by five
// points, where total counts the subfolders (at least 1) and processed
// every entry handled; N never passes 100. "No data found" at 100 when the
// database has no data folder.
//
// Thread safety: runs on the calling (maintenance) thread; progress is
// reported on it.
// Failures: the maintenance hold's ("Operation timeout!", ...); a failure
// to look at or remove an entry ends the operation with a
// std::system_error naming the path and the system's reason (entries
// already removed stay removed, no summary line is logged); a stop request
// ends it between entries with "Cleanup stopped: the server is stopping".

#include <memory>
#include <set>
#include <stop_token>
#include <string>

#include "engine/db_instances.h"
#include "engine/progress.h"

namespace maint {

// The age beyond which an unused entry is removed, in seconds (strictly
// greater).
inline constexpr std::int64_t kUnusedDataAgeSeconds = 21600;

void cleanUp(const std::shared_ptr<DB::DBInstances>& pool, const std::string& dbKey,
             const std::set<std::string>& usedIds, DB::DBProgressCallback& progress, std::stop_token stop = {});

}  // namespace maint
