#pragma once
// DB::DBLocal: one client database as one client connection sees it.
//
// A store is built from the name the client gave and is closed until
// exists() opens it: then it holds one engine session (from the pool,
// DBInstances) on the database's instance, with the session's prepared
// statements standing in for cursors. disconnect() and destruction give the
// session back. Operations are spread over files by concern:
//   db_local.cpp      lifecycle: exists, createDB, openDB, disconnect
//   schema.cpp        the two tables and their creation
//   meta_blobs.cpp    named values in table "meta" (configuration parts,
//                     pack contents)
//   data_files.cpp    plain files below the database folder's "d/"
//   pack_records.cpp, pack_use.cpp   pack records in table "info"
//
// Keys of both tables are byte strings compared as bytes (memcmp order);
// they are always bound as blobs.
//
// Ownership: a store belongs to one connection (Listener::ConnDB) and is
// never shared; it is movable neither by copy nor by move, since its
// session is counted in the pool under its key.
// Thread safety: one thread at a time (the connection's commands run one
// after another).
// Failures: DB::DBExc for engine failures and for the store's own refusals
// (see each member); a closed store refuses the table operations with the
// engine code kInvalidDatabaseId. Data-file operations need no session.

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <source_location>
#include <stop_token>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

#include "engine/instance.h"
#include "engine/progress.h"
#include "engine/session.h"
#include "engine/statement.h"
#include "framework/buffers.h"
#include "framework/env.h"
#include "framework/json.h"
#include "protocol/pack_info.h"
#include "settings/names.h"

namespace DB {

class DBInstances;

class DBLocal {
 public:
  // Values at most this long are bound and read whole; longer ones move
  // through the engine's blob streams, so that the server holds a long
  // value once, in the caller's buffer, and never a second copy.
  static constexpr std::int64_t kInlineValueBytes = 64 * 1024;

  // Builds the paths from the name; opens nothing. The pool is the store's
  // context: its sessions, its paths and its Env (every file operation of
  // the store goes through that Env).
  DBLocal(std::shared_ptr<DBInstances> pool, std::string_view dbName);
  ~DBLocal();
  DBLocal(const DBLocal&) = delete;
  DBLocal& operator=(const DBLocal&) = delete;

  // The database key (folderName of the client's name).
  const std::string& name() const noexcept { return name_; }
  // The database folder, ending with "/".
  const std::string& folder() const noexcept { return folder_; }
  const std::string& dbFile() const noexcept { return dbFile_; }
  bool isOpen() const noexcept { return session_ != nullptr; }
  // The session's number for "S:" in log texts; 0 when closed.
  std::uint64_t sessionId() const noexcept;

  // ---- Lifecycle -------------------------------------------------------
  // Gives up an open session first, then finds the database file and opens
  // the database on a new session, creating the database when it is
  // missing and mustExist is false. Returns false (and stays closed) only
  // when the file is missing and mustExist is true.
  // A database file that exists but cannot be read and written by the
  // server is reported (kFileAccessDenied) and left alone. A creation that
  // fails removes only what it made itself and passes its failure on.
  bool exists(bool mustExist);
  // Closes the session and gives it back to the pool; false when the store
  // was closed already. Never throws.
  bool disconnect() noexcept;

  // ---- Named values (table "meta") --------------------------------------
  // The value of key; empty when there is no row or the value is empty.
  MemBuffer loadMetaBlob(const std::string& key);
  // The configuration part of key as a read of it answers: its compact
  // JSON text, "" when there is none. Served from the pool's read cache
  // when nothing wrote the key since it was kept (store/cached_reads.h).
  // Throws json::Exc when the stored bytes are not a JSON object (a pack
  // content under the key); that is never kept.
  using CfgText = std::shared_ptr<const std::string>;
  CfgText cfgPartText(const std::string& key);
  // Inserts or replaces the value of key (in a transaction with retry).
  // Every write of either table drops the key's cached reads before it
  // returns, also when it fails.
  // A key longer than 255 bytes, or a value longer than the engine's
  // length limit, fails with the engine's error.
  void saveMetaBlob(const void* data, std::uint64_t length, const std::string& key);
  // Deletes the row of key; true when there was one.
  bool removeMetaBlob(const std::string& key);
  // The keys that begin with prefix (every key for the empty prefix), in
  // byte order.
  std::vector<std::string> metaBlobsWithPrefix(const std::string& prefix);

  // ---- Data files (below folder() + "d/") --------------------------------
  // The data folder of an id: folder() + "d/" + id + "/". A pure path rule:
  // the operations below check id first, callers with ids of their own
  // (cleanup walks the folder) use it as it is.
  std::string dataDir(const std::string& id) const;
  // The whole file; empty when it does not exist or cannot be opened.
  // Throws "Error reading database file: \"<path>\"" when reading fails.
  MemBuffer loadDataBlob(const std::string& id, const std::string& file);
  // Replaces the file whole: readers see either the old or the new
  // content, and a failed write keeps the old one. Throws "Error writing
  // to database file: \"<path>\"".
  void saveDataBlob(const void* data, std::uint64_t length, const std::string& id, const std::string& file);
  // Copies the data folder of source into that of target, merging into an
  // existing target and replacing files of the same name. Throws "Error
  // renaming data folder <source> to <target>" (also when source has no
  // data folder).
  // Ids and file names must each be one path component: not empty, not
  // "." or "..", without "/", "\" or NUL; file names may not begin with
  // kTempPrefix. Anything else is refused with a DB::DBExc before any file
  // is touched.
  void copyDataFolder(const std::string& source, const std::string& target);

  // Names of the files that a write builds before it renames them into
  // place.
  static constexpr std::string_view kTempPrefix = kDataTempPrefix;

  // ---- Pack records (pack_records.cpp) and pack use (pack_use.cpp) -------
  // A pack is one row of "info" (id, folder, status, and a JSON object with
  // the record's other fields and its use list; docs/protocol.md gives the
  // stored form) and its content: the row of "meta" under the pack's id.
  // Every read of a stored use list passes Ipc::kUseLimitSeconds, so the
  // entries of a client that crashed end after seven hours.
  // Writes run in write() (grouped commits): a record, its use list and its content
  // change together or not at all, and a refused request leaves nothing.

  // The records of folder (of every folder when it is empty), ordered by
  // folder, then status, then id.
  Ipc::PackInfosPtr infos(const std::string& folder);
  // The record of id; null when there is none. Served from the pool's read
  // cache when nothing wrote the pack since it was kept; the use list's
  // time limit applies all the same.
  Ipc::PackInfoPtr infoFor(const std::string& id);
  // Applies a record that may be partial: a complete one creates a missing
  // pack; otherwise the fields present are changed and every other stored
  // field, keys this version does not know included, stays. A use entry in
  // the request changes the use list (updateUseInfo). Returns the id and
  // the status as written, with the use list when the request opened the
  // pack or took its upload lock; null after a CloseEdit for a missing
  // pack, which is accepted and changes nothing.
  // Refused with DB::DBExc, writing nothing: a partial record for a missing
  // pack ("Pack information update attempted for missing record. Id:" and
  // the id), and the refusals of updateUseInfo.
  Ipc::PackInfoPtr updateInfo(const Ipc::PackInfo& request);
  // What updateInfo does, and the content replaces the pack's stored one,
  // in the same transaction. A CloseEdit for a missing pack stores nothing.
  void savePackMeta(const Ipc::PackInfo& request, const void* content, std::uint64_t length);

  struct PackMeta {
    Ipc::PackInfoPtr info;  // null when the pack has no record
    MemBuffer content;      // empty without a record or content
  };
  // The complete record and the content of a pack, read from one snapshot.
  // With a use entry in the request (open, close, lock, unlock) the use
  // list is changed first, as updateInfo does, in one transaction with the
  // read; the record then carries the new list.
  PackMeta packMetadata(const Ipc::PackInfo& request);
  // Deletes the record and the content of a pack; nothing happens when it
  // has no record. Its data files stay (cleanup removes unused ones).
  void removePack(const std::string& id);

  // ---- Maintenance (src/maintenance) --------------------------------------
  // Run on a maintenance thread of the connection's command, which holds
  // back the connection's other commands meanwhile. Each owns its callback
  // until it returns and ends early, with a failure, when stop is requested.

  // Removes every entry of the data folder that usedIds does not name and
  // that was last written more than six hours ago (maint::cleanUp).
  void cleanUp(const std::set<std::string>& usedIds, std::unique_ptr<DBProgressCallback> callback,
               std::stop_token stop = {});
  // Backs this database up into the archive that target names
  // (maint::backupOne has the rules), or with all every database of the
  // catalog into the folder target (empty: each into its default backup
  // file). The first failure ends it; archives already written stay.
  void backup(const std::string& target, bool all, std::unique_ptr<DBProgressCallback> callback,
              std::stop_token stop = {});
  // Gives up this store's session, then restores this database from the
  // archive target names (empty: its default backup file), or with all
  // every archive of the folder target (empty: the backup folder) into the
  // database each one names (maint::restoreOne and restoreFolder have the
  // rules). After success the session is opened again if there was one;
  // after a failure the store stays closed. The first failure ends a folder
  // restore; databases restored before stay restored.
  void restore(const std::string& target, bool all, std::unique_ptr<DBProgressCallback> callback,
               std::stop_token stop = {});

 private:
  // The record of a row of the pack statements (columns id, folder,
  // status, blob), its use list read with useLimit (0: whole). Throws
  // json::Exc when the stored object is not JSON.
  Ipc::PackInfo readInfo(const engine::Statement& row, std::uint64_t useLimit = Ipc::kUseLimitSeconds) const;
  // The write that every pack writer shares, inside the caller's
  // transaction. useUpdate: the caller is a fetch with a use entry, which
  // wants the complete record back. Returns null only for a CloseEdit on a
  // missing pack.
  Ipc::PackInfoPtr upsertInfo(const Ipc::PackInfo& request, bool useUpdate);
  // Applies the first use entry of the request to the use list inside
  // stored, and writes the list back (no key when it is empty). Returns the
  // new list when useUpdate is set or the request opened the pack or took
  // its lock. Throws DB::DBExc for a lock that another host holds ("Attept
  // to lock for upload a pack which is already locked from another host.")
  // and for a release of a lock this host does not hold ("Failed unlock
  // for upload").
  std::optional<Ipc::UseInfos> updateUseInfo(json::Object& stored, const Ipc::PackInfo& request, bool useUpdate);
  // The debug line of one use-list transition; callers test g_LogVerbose.
  void logUseChange(const std::string& id, std::string_view transition, const Ipc::UseInfo& entry) const;

  // ---- Helpers shared by the table operations, the pack code included --
  // The open session; throws kInvalidDatabaseId when the store is closed.
  // Inside a body that write() runs, the session its group runs on.
  engine::Session& session(const std::source_location& where = std::source_location::current());

  // Runs body (no arguments) as one write of the database's commit queue
  // (engine/commit_queue.h): in a write transaction, grouped with the
  // writes of other connections that queued meanwhile, with retry. Returns
  // the body's result once its group committed. bytes: about how much the
  // body writes. The body may run on another connection's thread and more
  // than once; it reaches the engine only through session().
  template <class Body>
  auto write(std::uint64_t bytes, Body&& body) -> std::invoke_result_t<Body&>;

  // The value stored under key in "meta" (what a seek on the key followed
  // by reading the "blob" column gives): empty when there is no row or the
  // value is empty. Inside a write transaction it reads that transaction's
  // state; outside one, the row as one snapshot.
  MemBuffer readMeta(std::string_view key);
  // Inserts or replaces the row of key; runs inside the caller's
  // transaction, which rolls the row back on failure.
  void putMeta(std::string_view key, const void* data, std::uint64_t length);
  // Deletes the row of key inside the caller's transaction; true when there
  // was one.
  bool deleteMeta(std::string_view key);
  // Column `column` of the statement's current row as an owned buffer
  // (empty for NULL or an empty value); for values of "info", whose length
  // is bounded by the schema.
  static MemBuffer retrieveColumn(const engine::Statement& row, int column);

  // ---- Lifecycle internals ---------------------------------------------
  void openDB();
  // Both run in the pool's onNewInstance, alone on the database. createDB
  // sets creationFailed before it passes a failure on.
  void attachOrCreate(DBInstances& pool, engine::Session& session, bool found, bool& creationFailed);
  void createDB(DBInstances& pool, engine::Session& session, bool& creationFailed);
  // Whether dbFile may be read and written; throws for a file that exists
  // but may not.
  bool fileAccessible() const;

  const std::shared_ptr<DBInstances> pool_;
  sys::Env& env_;  // the pool's
  const std::string name_;
  const std::string folder_;
  const std::string dbFile_;
  std::unique_ptr<engine::Session> session_;
  // The session of the group that runs one of this store's write bodies,
  // while it runs (on the group leader's thread; this store's own thread
  // waits in write() meanwhile).
  engine::Session* groupSession_ = nullptr;
};

template <class Body>
auto DBLocal::write(std::uint64_t bytes, Body&& body) -> std::invoke_result_t<Body&> {
  using Result = std::invoke_result_t<Body&>;
  struct GroupSession {
    GroupSession(DBLocal& owner, engine::Session& group) : store(owner) { store.groupSession_ = &group; }
    ~GroupSession() { store.groupSession_ = nullptr; }
    GroupSession(const GroupSession&) = delete;
    GroupSession& operator=(const GroupSession&) = delete;
    DBLocal& store;
  };
  engine::Session& own = session();
  if constexpr (std::is_void_v<Result>) {
    own.instance()->commitQueue().run(own, bytes, [&](engine::Session& group) {
      const GroupSession scope(*this, group);
      body();
    });
  } else {
    std::optional<Result> result;
    own.instance()->commitQueue().run(own, bytes, [&](engine::Session& group) {
      const GroupSession scope(*this, group);
      result.emplace(body());
    });
    return std::move(*result);
  }
}

}  // namespace DB
