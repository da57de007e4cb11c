#include "engine/session.h"

#include <atomic>

#include "engine/database_file.h"
#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/instance.h"
#include "engine/sqlite_errors.h"
#include "framework/log.h"

namespace engine {
namespace {

std::atomic<std::uint64_t> g_nextSessionId{1};

}  // namespace

Session::Session(Token, std::shared_ptr<Instance> instance) : id_(g_nextSessionId++), instance_(std::move(instance)) {}

Session::~Session() {
  if (writeLocked_) {
    try {
      rollback();
    } catch (const std::exception& e) {
      Log::Lock(Log::Error).logStreamLine() << "Engine: rollback of S:" << id_ << " at its end failed: " << e.what();
    }
  }
  closeConnection();
  instance_->sessionEnded();
}

void Session::checkInstanceLive(const std::source_location& where) const {
  switch (instance_->state()) {
    case Instance::State::Initialised:
      return;
    case Instance::State::Created:
      DB::throwEngineError(DB::err::kNotInitialized, where);
    case Instance::State::Terminated:
      DB::throwEngineError(DB::err::kTermInProgress, where);
  }
}

void Session::open(const std::filesystem::path& file, const std::source_location& where) {
  db_ = openConnection(*instance_->settings().env, file, OpenMode::Existing, instance_->settings().busyTimeout, where);
}

std::int32_t Session::attachDatabase(const std::filesystem::path& file, const std::source_location& where) {
  checkInstanceLive(where);
  const bool opened = !db_;
  if (opened) open(file, where);
  std::int32_t attached = 0;
  try {
    attached = instance_->attach(file, where);
  } catch (...) {
    if (opened) closeConnection();
    throw;
  }
  // The first attach in this process: no creation of the file can be
  // running, so whatever one left behind belongs to nobody.
  if (attached == 0) removeCreationLeftovers(*instance_->settings().env, file);
  return attached;
}

void Session::createDatabase(const std::filesystem::path& file, const std::source_location& where) {
  checkInstanceLive(where);
  if (db_) DB::throwEngineError(DB::err::kTooManyAttachedDatabases, where);
  createDatabaseFile(*instance_->settings().env, file, instance_->settings().busyTimeout, where);
  open(file, where);
  try {
    instance_->attach(file, where);
  } catch (...) {
    closeConnection();
    throw;
  }
}

void Session::openDatabase(const std::source_location& where) {
  if (db_) return;
  checkInstanceLive(where);
  const auto attached = instance_->attachedDatabase();
  if (!attached) DB::throwEngineError(DB::err::kDatabaseNotFound, where);
  open(*attached, where);
}

void Session::detachAll() noexcept {
  if (writeLocked_) {
    try {
      rollback();
    } catch (const std::exception&) {
      // The connection goes next, which ends the transaction anyway.
    }
  }
  closeConnection();
  instance_->detach();
}

void Session::closeConnection() noexcept {
  for (auto& [sql, cached] : statements_) sqlite3_finalize(cached->stmt);
  statements_.clear();
  db_.reset();
}

sqlite3* Session::connection(const std::source_location& where) const {
  if (!db_) DB::throwEngineError(DB::err::kInvalidDatabaseId, where);
  return db_.get();
}

Statement Session::prepare(std::string_view sql, const std::source_location& where) {
  sqlite3* db = connection(where);
  const auto found = statements_.find(sql);
  if (found != statements_.end() && !found->second->inUse) {
    found->second->inUse = true;
    return Statement(db, found->second->stmt, &found->second->inUse);
  }
  sqlite3_stmt* stmt = nullptr;
  // A statement already in use (a nested use of the same text) gets one of
  // its own, which the handle finalises; so does any text once the cache is
  // full, so that SQL built at run time cannot grow it without bound.
  const bool cache = found == statements_.end() && statements_.size() < kMaxCachedStatements;
  const int rc = sqlite3_prepare_v3(db, sql.data(), static_cast<int>(sql.size()), cache ? SQLITE_PREPARE_PERSISTENT : 0,
                                    &stmt, nullptr);
  if (rc != SQLITE_OK) {
    sqlite3_finalize(stmt);
    throwSqlite(db, rc, where);
  }
  if (stmt == nullptr) DB::throwEngineError(DB::err::kInvalidParameter, where);  // no statement in the text
  if (!cache) return Statement(db, stmt, nullptr);
  auto entry = std::make_unique<CachedStatement>();
  entry->stmt = stmt;
  entry->inUse = true;
  bool* inUse = &entry->inUse;
  statements_.emplace(std::string(sql), std::move(entry));
  return Statement(db, stmt, inUse);
}

void Session::execute(std::string_view sql, const std::source_location& where) {
  engine::execute(connection(where), std::string(sql).c_str(), where);
}

void Session::beginWrite(const std::source_location& where) {
  checkInstanceLive(where);
  connection(where);
  if (writeLocked_) DB::throwEngineError(DB::err::kInvalidParameter, where);
  if (!instance_->writeGate().enter(instance_->settings().busyTimeout)) {
    DB::throwEngineError(DB::err::kWriteConflict, where);
  }
  writeLocked_ = true;
  try {
    prepare("BEGIN IMMEDIATE", where).run(where);
  } catch (...) {
    releaseWriteLock();
    throw;
  }
}

void Session::commit(const std::source_location& where) {
  sqlite3* db = connection(where);
  if (!writeLocked_) DB::throwEngineError(DB::err::kInvalidParameter, where);
  try {
    prepare("COMMIT", where).run(where);
  } catch (...) {
    // A failed COMMIT may leave the transaction open (the caller rolls it
    // back) or may have ended it; only then is the lock free.
    if (sqlite3_get_autocommit(db) != 0) releaseWriteLock();
    throw;
  }
  releaseWriteLock();
}

void Session::rollback(const std::source_location& where) {
  if (!writeLocked_) return;
  if (!db_ || sqlite3_get_autocommit(db_.get()) != 0) {
    releaseWriteLock();
    return;
  }
  try {
    prepare("ROLLBACK", where).run(where);
  } catch (...) {
    releaseWriteLock();
    throw;
  }
  releaseWriteLock();
}

bool Session::transactionOpen() const noexcept { return db_ && sqlite3_get_autocommit(db_.get()) == 0; }

void Session::releaseWriteLock() noexcept {
  if (!writeLocked_) return;
  writeLocked_ = false;
  instance_->writeGate().leave();
}

std::int64_t Session::lastInsertRowid() const noexcept { return db_ ? sqlite3_last_insert_rowid(db_.get()) : 0; }

std::int64_t Session::changes() const noexcept { return db_ ? sqlite3_changes64(db_.get()) : 0; }

}  // namespace engine
