#pragma once
// engine::Session: one engine session, that is one SQLite connection on the
// database of its instance, with its prepared statements and transactions.
//
// A session begins on an initialised instance (Instance::beginSession) with
// no connection. The first session of a new instance attaches the existing
// database file (attachDatabase) or creates it (createDatabase); every
// session then opens it (openDatabase, which does nothing when attaching or
// creating already opened it).
//
// Writes run inside write transactions (beginWrite / commit / rollback;
// DB::Transaction does this for the store). A write transaction first takes
// the instance's in-process write lock and then SQLite's (BEGIN IMMEDIATE),
// so the writers of a database queue instead of colliding; a wait longer
// than the instance's busy timeout fails as a write conflict (kWriteConflict).
// Reads outside a transaction run in autocommit mode, each statement on a
// consistent snapshot.
//
// Ownership: move-only through std::unique_ptr; the session holds its
// instance. Destruction ends the session: statements are finalised, an open
// transaction is rolled back, the connection is closed (SQLite checkpoints
// and removes the write-ahead log when the last connection goes) and the
// instance counts one session less.
// Thread safety: one thread at a time.
// Failures: DB::DBExc with an engine code and the caller's file and line.

#include <sqlite3.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <source_location>
#include <string>
#include <string_view>
#include <unordered_map>

#include "engine/connection.h"
#include "engine/statement.h"

namespace engine {

class Instance;

class Session {
  struct Token {};
  friend class Instance;

 public:
  Session(Token, std::shared_ptr<Instance> instance);
  ~Session();
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;

  // Process-wide number, from 1, for the "S:" of log texts.
  std::uint64_t id() const noexcept { return id_; }
  const std::shared_ptr<Instance>& instance() const noexcept { return instance_; }

  // Attaches an existing database file to the instance and opens it on this
  // session. Returns kWrnDatabaseAttached when the instance already had it.
  // Throws kFileNotFound, kInvalidDatabase (not a database of this server),
  // kInvalidDatabaseVersion (newer format), kTooManyAttachedDatabases
  // (another file is attached), or the translated SQLite failure.
  std::int32_t attachDatabase(const std::filesystem::path& file,
                              const std::source_location& where = std::source_location::current());
  // Creates a new database file (see createDatabaseFile), attaches it and
  // opens it on this session. Throws kDatabaseDuplicate when it exists.
  void createDatabase(const std::filesystem::path& file,
                      const std::source_location& where = std::source_location::current());
  // Opens the instance's attached database on this session; nothing when it
  // is open already. Throws kDatabaseNotFound when nothing is attached.
  void openDatabase(const std::source_location& where = std::source_location::current());
  bool isOpen() const noexcept { return db_ != nullptr; }

  // Closes the connection and forgets the instance's attached database, for
  // a creation that failed. The session stays counted until it is destroyed.
  void detachAll() noexcept;

  // Statements cached per session; texts beyond these are prepared for each
  // use. SQL texts are meant to be constants with parameters.
  static constexpr std::size_t kMaxCachedStatements = 128;

  // The cached statement for the SQL text (see statement.h).
  Statement prepare(std::string_view sql, const std::source_location& where = std::source_location::current());
  // Runs SQL without results, e.g. a table definition.
  void execute(std::string_view sql, const std::source_location& where = std::source_location::current());

  void beginWrite(const std::source_location& where = std::source_location::current());
  void commit(const std::source_location& where = std::source_location::current());
  // Rolls back and releases the write lock, also when SQLite's rollback
  // fails (which is then thrown). Nothing to do outside a transaction.
  void rollback(const std::source_location& where = std::source_location::current());
  bool inTransaction() const noexcept { return writeLocked_; }
  // Whether SQLite's transaction is still open: some failures (a full disk,
  // an I/O error) make SQLite roll the whole transaction back by itself,
  // savepoints included, while the write lock is still held.
  bool transactionOpen() const noexcept;

  std::int64_t lastInsertRowid() const noexcept;
  std::int64_t changes() const noexcept;

  // The connection, for the engine layer's own helpers (blob I/O, backup).
  sqlite3* connection(const std::source_location& where = std::source_location::current()) const;

 private:
  struct CachedStatement {
    sqlite3_stmt* stmt = nullptr;
    bool inUse = false;
  };
  struct TextHash {
    using is_transparent = void;
    std::size_t operator()(std::string_view text) const noexcept { return std::hash<std::string_view>{}(text); }
  };

  void open(const std::filesystem::path& file, const std::source_location& where);
  void closeConnection() noexcept;
  void releaseWriteLock() noexcept;
  void checkInstanceLive(const std::source_location& where) const;

  const std::uint64_t id_;
  const std::shared_ptr<Instance> instance_;
  ConnectionPtr db_;
  std::unordered_map<std::string, std::unique_ptr<CachedStatement>, TextHash, std::equal_to<>> statements_;
  bool writeLocked_ = false;
};

}  // namespace engine
