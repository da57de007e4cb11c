#include "store/db_local.h"

#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <set>
#include <system_error>
#include <utility>

#include "engine/db_exc.h"
#include "engine/db_instances.h"
#include "engine/engine_errors.h"
#include "engine/transaction.h"
#include "framework/log.h"
#include "maintenance/backup.h"
#include "maintenance/cleanup.h"
#include "maintenance/restore.h"
#include "settings/config.h"
#include "settings/names.h"
#include "store/catalog.h"
#include "store/schema.h"
#include "store/store_exc.h"

namespace DB {
namespace {

namespace fs = std::filesystem;

// The folders from root (exclusive) down to folder that do not exist yet,
// the deepest last. folder lies below root by construction of the paths.
std::vector<fs::path> missingFoldersBelow(sys::Env& env, const std::string& root, const std::string& folder) {
  std::vector<fs::path> missing;
  if (root.empty() || folder.size() <= root.size() || folder.compare(0, root.size(), root) != 0) return missing;
  fs::path level(root);
  std::size_t start = root.size();
  while (start < folder.size()) {
    const auto end = folder.find('/', start);
    const auto part = folder.substr(start, end == std::string::npos ? std::string::npos : end - start);
    start = end == std::string::npos ? folder.size() : end + 1;
    if (part.empty()) continue;
    level /= part;
    if (env.stat(level).type == sys::FileType::Missing) missing.push_back(level);
  }
  return missing;
}

// Removes the folders, deepest first, each only when it is empty: whatever
// another connection put into one meanwhile (a database of a longer name,
// a data file) keeps it.
void removeEmptyFolders(sys::Env& env, const std::vector<fs::path>& folders) noexcept {
  std::set<fs::path> done;
  for (auto it = folders.rbegin(); it != folders.rend(); ++it) {
    try {
      if (!done.insert(*it).second) continue;
      if (env.stat(*it).type == sys::FileType::Folder) env.remove(*it);  // fails when not empty
    } catch (const std::exception&) {
      // Kept: somebody put something there, or it cannot be removed.
    }
  }
}

void removeFileAndCompanions(sys::Env& env, const std::string& file) noexcept {
  for (const char* suffix : {"", "-wal", "-shm", "-journal"}) {
    try {
      env.remove(file + suffix);
    } catch (const std::system_error&) {
      // The creation's own failure is the one reported.
    }
  }
}

}  // namespace

DBLocal::DBLocal(std::shared_ptr<DBInstances> pool, std::string_view dbName)
    : pool_(std::move(pool)),
      env_(pool_->env()),
      name_(folderName(dbName)),
      folder_(pool_->paths().databaseFolder(name_)),
      dbFile_(pool_->paths().mainFile(name_)) {}

DBLocal::~DBLocal() { disconnect(); }

std::uint64_t DBLocal::sessionId() const noexcept { return session_ ? session_->id() : 0; }

engine::Session& DBLocal::session(const std::source_location& where) {
  if (groupSession_ != nullptr) return *groupSession_;
  if (!session_) throwEngineError(err::kInvalidDatabaseId, where);
  return *session_;
}

bool DBLocal::fileAccessible() const {
  try {
    return env_.readWritable(dbFile_);
  } catch (const std::system_error& e) {
    // Taking such a file for missing would lead to a creation attempt on top
    // of an existing database; it is the operator's to repair.
    throw StoreExc(err::kFileAccessDenied, "Database file \"" + dbFile_ + "\" is not accessible (" +
                                               e.code().message() + "); it is left as it is");
  }
}

bool DBLocal::exists(bool mustExist) {
  disconnect();
  const bool found = fileAccessible();
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << (found ? "DB:exists Found existing database in " : "DB:exists No database found in ") << name_;
  }
  if (mustExist && !found) return false;

  // A failed creation removes the folders it made, and only those; which
  // they are is known only before the new instance makes its folders.
  std::vector<fs::path> newFolders;
  sys::Env& env = env_;
  const Paths& paths = pool_->paths();
  if (!found) {
    newFolders = missingFoldersBelow(env, paths.root(), folder_);
    auto logs = missingFoldersBelow(env, paths.logRoot(), paths.logFolder(name_));
    newFolders.insert(newFolders.end(), logs.begin(), logs.end());
  }
  bool creationFailed = false;
  try {
    session_ =
        pool_->newSession(name_, [&](engine::Session& fresh) { attachOrCreate(*pool_, fresh, found, creationFailed); });
  } catch (...) {
    // Whatever failed (the creation, or the instance's folders already: a
    // name too long for the file system), the folders this attempt made
    // go again; only empty ones are removed, so a database that another
    // connection created there meanwhile keeps its folder.
    if (!found) removeEmptyFolders(env, newFolders);
    throw;
  }
  openDB();
  return true;
}

void DBLocal::attachOrCreate(DBInstances& pool, engine::Session& fresh, bool found, bool& creationFailed) {
  // Another connection may have created the database since the first
  // look, its instance closed again meanwhile; while the pool opens the
  // database nobody else gets a session on it, so a second look decides.
  if (!found && !fileAccessible()) {
    createDB(pool, fresh, creationFailed);
    return;
  }
  fresh.attachDatabase(dbFile_);  // kWrnDatabaseAttached is a success too
  const auto tables = schema::present(fresh);
  if (!tables.info && !tables.meta) {
    // A creation that was cut off (a crash) between the file and its
    // tables: nothing can be in it yet, so the tables are made now.
    Transaction txn(fresh);
    schema::create(fresh);
    txn.commit();
    Log::Lock(Log::Notice).logStreamLine() << "Tables created in existing empty database \"" << name_ << '"';
  }
}

void DBLocal::createDB(DBInstances& pool, engine::Session& fresh, bool& creationFailed) {
  bool fileIsOurs = true;
  try {
    try {
      fresh.createDatabase(dbFile_);
    } catch (const DBExc& e) {
      // The file appeared after the second look: it is somebody's database.
      if (e.code() == err::kDatabaseDuplicate) fileIsOurs = false;
      throw;
    }
    Transaction txn(fresh);
    schema::create(fresh);
    txn.commit();
  } catch (...) {
    Log::Lock(Log::Error).logStreamLine() << "Failed to create new database in \"" << name_ << '"';
    pool.discardInstance(name_, fresh);
    // Only what this creation made goes: the database file it created and
    // the folders that did not exist before (removed by exists() when they
    // are empty). A database file that was there before is never touched.
    if (fileIsOurs) removeFileAndCompanions(env_, dbFile_);
    creationFailed = true;
    throw;
  }
  if (g_LogVerbose) Log::Lock(Log::Debug).logStreamLine() << "DB:createDB S:" << fresh.id() << " Created database";
  Log::Lock(Log::Notice).logStreamLine() << "New database created in \"" << name_ << '"';
}

void DBLocal::openDB() {
  auto& s = session();
  s.openDatabase();
  const auto tables = schema::present(s);
  if (!tables.info || !tables.meta) {
    throw StoreExc(err::kInvalidDatabase, "Database file \"" + dbFile_ + "\" lacks its table \"" +
                                              (tables.info ? schema::kMetaTable : schema::kInfoTable) + '"');
  }
  if (g_LogVerbose) Log::Lock(Log::Debug).logStreamLine() << "DB:openDB S:" << s.id() << " Opened database";
}

bool DBLocal::disconnect() noexcept {
  if (!session_) return false;
  if (g_LogVerbose) {
    try {
      Log::Lock(Log::Debug).logStreamLine() << "DB:disconnect S:" << session_->id() << " Closing session";
    } catch (const std::exception&) {
      // Out of memory for a debug line: the session is given back anyway.
    }
  }
  // A store that closes after the service stopped finds the pool stopped:
  // its session then simply ends.
  pool_->endSession(name_, std::move(session_));
  return true;
}

}  // namespace DB

namespace DB {

void DBLocal::cleanUp(const std::set<std::string>& usedIds, std::unique_ptr<DBProgressCallback> callback,
                      std::stop_token stop) {
  maint::cleanUp(pool_, name_, usedIds, *callback, std::move(stop));
}

void DBLocal::backup(const std::string& target, bool all, std::unique_ptr<DBProgressCallback> callback,
                     std::stop_token stop) {
  if (!all) {
    maint::backupOne(pool_, name_, target, dbFile_, *callback, stop);
    return;
  }
  // One target folder for every database; empty stays empty, so that each
  // goes to its own default backup file.
  const std::string folder = target.empty() ? std::string() : normaliseFolder(target);
  for (const std::string& key : databaseKeys(env_, pool_->paths())) {
    if (stop.stop_requested()) throw std::runtime_error("Backup stopped: the server is stopping");
    // The hold needs the database's instance running: a session of our own
    // opens it (ours is open already).
    DBLocal other(pool_, key);
    if (key != name_ && !other.exists(true)) continue;
    maint::backupOne(pool_, key, folder, dbFile_, *callback, stop);
  }
}

void DBLocal::restore(const std::string& target, bool all, std::unique_ptr<DBProgressCallback> callback,
                      std::stop_token stop) {
  // The restore waits for every session of the database to end: this
  // connection's own goes first.
  const bool wasOpen = disconnect();
  maint::RestoreOptions options;
  // A database file without the tables the store uses would leave the
  // database unusable until the next restore.
  options.schemaCheck = schema::whatIsMissing;
  if (all) {
    maint::restoreFolder(pool_, target, *callback, options, stop);
  } else {
    maint::restoreOne(pool_, target, name_, true, *callback, options, stop);
  }
  // After a failure the connection stays without a session.
  if (wasOpen) exists(false);
}

}  // namespace DB
