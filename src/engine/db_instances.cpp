#include "engine/db_instances.h"

#include "engine/db_exc.h"
#include "engine/engine_counters.h"
#include "engine/engine_errors.h"
#include "framework/log.h"
#include "framework/open_files.h"
#include "settings/config.h"

namespace DB {
namespace {

constexpr const char* kNotAccessible = "Database not accessible! Possible restore operation in progress.";

void logEngineStart(const PoolSettings& settings, const Paths& paths, const sys::OpenFileLimit& files) {
  if (g_LogVerbose) {
    Log::Lock entry(Log::Debug);
    entry.logStreamLine() << "DBInstances: Engine initialized\n"
                          << "\t\"" << paths.root() << "\" is the databases root\n"
                          << "\t" << settings.maxActiveDBs << " maximum active databases\n"
                          << "\t" << settings.maxClientsPerDB << " maximum active clients per database\n"
                          << "\t\"" << settings.filesPrefix << "\" database file names prefix\n"
                          << "\t\"" << paths.dbFileName() << "\" database file name\n";
  }
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << "DBInstances: the database file names prefix, circular logging, the version store size and the place "
           "of transaction logs have no effect on this engine: each database's write-ahead log lives beside its "
           "database file";
  }
  const std::uint64_t needed = 2 * settings.maxActiveDBs * settings.maxClientsPerDB;
  if (files.after < needed) {
    Log::Lock(Log::Warning).logStreamLine()
        << "DBInstances: the open-file limit is " << files.after << " (hard limit " << files.hard << "), but "
        << settings.maxActiveDBs << " databases with " << settings.maxClientsPerDB << " clients each may need "
        << needed << " file descriptors";
  }
}

}  // namespace

PoolSettings PoolSettings::from(const DBConfig& config) {
  PoolSettings s;
  s.maxActiveDBs = config.MaxActiveDBs;
  s.maxClientsPerDB = config.MaxActiveClientsPerDB;
  s.maxWaitMaintenanceSecs = config.MaxWaitMaintenanceOpSecs;
  s.filesPrefix = config.DBFilesPrefix;
  s.readCacheBytes = config.ReadCacheMiB << 20;
  return s;
}

std::shared_ptr<DBInstances> DBInstances::create(PoolSettings settings, Paths paths, sys::Env& env) {
  auto pool = std::make_shared<DBInstances>(Token{}, settings, std::move(paths), env);
  logEngineStart(pool->settings_, pool->paths_, sys::raiseOpenFileLimit());
  return pool;
}

DBInstances::DBInstances(Token, PoolSettings settings, Paths paths, sys::Env& env)
    : settings_(settings),
      paths_(std::move(paths)),
      env_(env),
      slots_(std::make_shared<engine::InstanceSlots>(settings.maxActiveDBs)),
      readCache_(settings.readCacheBytes) {}

DBInstances::~DBInstances() {
  // Reached when the service did not stop the pool (a test, an early exit);
  // the logging may already be gone then, so this stops quietly.
  sys::MutexLock lock(mutex_);
  if (!stopped_) stopEngine(false);
}

void DBInstances::stop() noexcept {
  sys::MutexLock lock(mutex_);
  if (!stopped_) stopEngine(true);
}

bool DBInstances::stopped() const {
  sys::MutexLock lock(mutex_);
  return stopped_;
}

std::shared_ptr<engine::Instance> DBInstances::createInstance(const std::string& dbKey) {
  engine::InstanceSettings settings;
  settings.key = dbKey;
  settings.instanceFolder = paths_.databaseFolder(dbKey);
  settings.logFolder = paths_.logFolder(dbKey);
  settings.databaseFileName = paths_.dbFileName();
  settings.maxSessions = settings_.maxClientsPerDB;
  settings.busyTimeout = settings_.busyTimeout;
  settings.env = &env_;
  settings.slots = slots_;
  auto instance = engine::Instance::create(std::move(settings));
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << "DBInstances: Instance I:" << instance->id() << " created for " << paths_.databaseFolder(dbKey);
  }
  return instance;
}

void DBInstances::closeInstance(InstanceRec& record) noexcept {
  if (!record.instance) return;
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DBInstances: closing instance for I:" << record.instance->id();
  }
  record.instance->term();
  // Whatever opens the database next (a restored file, or the same file
  // after another program had it) is read anew.
  readCache_.dropDatabase(record.instance->settings().key);
  record.instance.reset();
}

std::unique_ptr<engine::Session> DBInstances::beginSession(InstanceRec& record) {
  if (!record.instance) throw DBExc(kNotAccessible);
  std::unique_ptr<engine::Session> session;
  try {
    session = record.instance->beginSession();
  } catch (const DBExc& e) {
    if (e.code() == err::kNotInitialized) throw DBExc(kNotAccessible);
    throw;
  }
  ++record.sessions;
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << "DBInstances: New session S:" << session->id() << " created for I:" << record.instance->id() << ". "
        << record.sessions << " instance session(s)";
  }
  return session;
}

// Returns a session on the database's open instance, waiting while another
// caller opens it; null when the database has no record. Under the lock.
std::unique_ptr<engine::Session> DBInstances::sessionOnOpen(sys::MutexLock& lock, const std::string& dbKey) {
  for (;;) {
    if (stopped_) throwEngineError(err::kTermInProgress);
    const auto found = records_.find(dbKey);
    if (found == records_.end()) return nullptr;
    if (!found->second.opening) return beginSession(found->second);
    opened_.wait(lock.native());
  }
}

std::unique_ptr<engine::Session> DBInstances::newSession(const std::string& dbKey, const OnNewInstance& onNewInstance) {
  try {
    return openSession(dbKey, onNewInstance);
  } catch (const DBExc& e) {
    // The engine's codes say only that a limit was reached; the log line of
    // the refusal says which, and for which database.
    const std::string code = " (engine error " + std::to_string(e.code()) + ")";
    if (e.code() == err::kTooManyInstances) {
      engine::counters().refusedByDatabaseLimit.fetch_add(1, std::memory_order_relaxed);
      throw DBExc(e.code(), "Database \"" + dbKey + "\" refused: " + std::to_string(settings_.maxActiveDBs) +
                                " databases are open, the most that MaxActiveDBs allows" + code);
    }
    if (e.code() == err::kOutOfSessions) {
      engine::counters().refusedByClientLimit.fetch_add(1, std::memory_order_relaxed);
      throw DBExc(e.code(), "Database \"" + dbKey + "\" refused: " + std::to_string(settings_.maxClientsPerDB) +
                                " clients have it open, the most that MaxActiveClientsPerDB allows" + code);
    }
    throw;
  }
}

std::unique_ptr<engine::Session> DBInstances::openSession(const std::string& dbKey,
                                                          const OnNewInstance& onNewInstance) {
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DBInstances: New database connection request for " << dbKey;
  }
  std::size_t records = 0;
  {
    sys::MutexLock lock(mutex_);
    if (auto session = sessionOnOpen(lock, dbKey)) return session;
    records = records_.size();
  }
  if ((settings_.maxActiveDBs * 2) / 3 <= records) closeDormantInstances();

  sys::MutexLock lock(mutex_);
  if (auto session = sessionOnOpen(lock, dbKey)) return session;

  auto instance = createInstance(dbKey);
  try {
    instance->init();
  } catch (...) {
    instance->term();
    throw;
  }
  auto& record = records_[dbKey];
  record.instance = instance;
  record.opening = true;
  std::unique_ptr<engine::Session> session;
  try {
    session = beginSession(record);
  } catch (...) {
    closeInstance(record);
    records_.erase(dbKey);
    opened_.notify_all();
    throw;
  }
  // The file work (attaching, which may replay a large write-ahead log, or
  // creating with its syncs) runs without the lock, so that sessions of
  // other databases, their ends and the maintenance holds are not held up
  // by it. Callers for the same database wait for it on opened_.
  lock.unlock();
  std::exception_ptr failure;
  try {
    onNewInstance(*session);
  } catch (...) {
    failure = std::current_exception();
  }
  lock.lock();
  const auto found = records_.find(dbKey);
  const bool ours = found != records_.end() && found->second.instance == instance;
  if (ours && !failure) {
    found->second.opening = false;
    opened_.notify_all();
    return session;
  }
  // No session stays counted and no half-opened instance stays behind: the
  // record goes before the waiters look again. A creation failure has
  // dropped it already (discardInstance), and so has a stop of the pool.
  if (ours) {
    closeInstance(found->second);
    records_.erase(found);
  }
  opened_.notify_all();
  const bool stopped = stopped_;
  lock.unlock();
  session.reset();
  instance->term();
  if (failure) std::rethrow_exception(failure);
  // onNewInstance discarded the instance without reporting a failure.
  throwEngineError(stopped ? err::kTermInProgress : err::kDatabaseNotFound);
}

void DBInstances::endSession(const std::string& dbKey, std::unique_ptr<engine::Session> session) noexcept {
  if (!session) return;
  const auto sessionId = session->id();
  const auto instance = session->instance();
  // The connection closes before the session is uncounted: until then no
  // exclusive hold can take the database, so a restore never replaces the
  // file under a connection that is still closing.
  session.reset();

  sys::MutexLock lock(mutex_);
  // After the stop, a store that closes late simply ends its session.
  if (stopped_) return;
  const auto found = records_.find(dbKey);
  if (found == records_.end() || found->second.instance != instance || found->second.sessions == 0) {
    Log::Lock(Log::Error).logStreamLine()
        << "DBInstances: DB: " << dbKey << ", Session S:" << sessionId << " released for unknown instance!!!";
    return;
  }
  auto& record = found->second;
  --record.sessions;
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << "DBInstances: DB: " << dbKey << ", Session S:" << sessionId << " released for I:" << record.instance->id()
        << ". " << record.sessions << " instance session(s) remaining";
  }
}

bool DBInstances::closeIfDormant(const std::string& dbKey) noexcept {
  sys::MutexLock lock(mutex_);
  const auto found = records_.find(dbKey);
  if (found == records_.end()) return true;
  if (found->second.sessions > 0 || found->second.maintenance) return false;
  closeInstance(found->second);
  records_.erase(found);
  return true;
}

void DBInstances::closeDormantInstances() noexcept {
  sys::MutexLock lock(mutex_);
  for (auto it = records_.begin(); it != records_.end();) {
    if (it->second.sessions == 0 && !it->second.maintenance) {
      if (g_LogVerbose && it->second.instance) {
        Log::Lock(Log::Debug).logStreamLine()
            << "DBInstances: Closing dormant instance I:" << it->second.instance->id();
      }
      closeInstance(it->second);
      it = records_.erase(it);
    } else {
      ++it;
    }
  }
}

void DBInstances::discardInstance(const std::string& dbKey, engine::Session& session) noexcept {
  session.detachAll();
  sys::MutexLock lock(mutex_);
  const auto found = records_.find(dbKey);
  if (found == records_.end() || found->second.instance != session.instance()) return;
  closeInstance(found->second);
  records_.erase(found);
}

std::shared_ptr<engine::Instance> DBInstances::acquireShared(const std::string& dbKey, bool set) {
  sys::MutexLock lock(mutex_);
  if (stopped_) {
    if (set) throwEngineError(err::kTermInProgress);
    return nullptr;
  }
  const auto found = records_.find(dbKey);
  if (found == records_.end()) throw DBExc("No instance exist for " + dbKey);
  // A database being opened is held up like one under another hold.
  if (set && (found->second.maintenance || found->second.opening)) return nullptr;
  found->second.maintenance = set;
  return found->second.instance;
}

std::shared_ptr<engine::Instance> DBInstances::acquireExclusive(const std::string& dbKey, bool set) {
  sys::MutexLock lock(mutex_);
  if (stopped_) {
    if (set) throwEngineError(err::kTermInProgress);
    return nullptr;
  }
  auto found = records_.find(dbKey);
  if (found == records_.end()) {
    if (!set) return nullptr;
    found = records_.emplace(dbKey, InstanceRec{}).first;
  } else {
    if (found->second.sessions > 0) return nullptr;
    // Another hold on the database (a backup, a cleanup or a second
    // restore) must end first: two restores of one database, or a restore
    // under a running backup, would work on the same files.
    if (set && found->second.maintenance) return nullptr;
    closeInstance(found->second);
  }
  if (!set) {
    records_.erase(found);
    return nullptr;
  }
  try {
    found->second.maintenance = true;
    found->second.instance = createInstance(dbKey);
  } catch (...) {
    records_.erase(found);
    throw;
  }
  return found->second.instance;
}

bool DBInstances::waitTick(const std::stop_token& stop) {
  // An operation's own stop wakes the sleep; the pool's is seen at the
  // tick's end then (the service stops the operations before the pool).
  const std::stop_token token = stop.stop_possible() ? stop : stopping_.get_token();
  return env_.sleepFor(settings_.maintenanceTick, token) && !stop.stop_requested() && !stopped();
}

void DBInstances::stopEngine(bool log) noexcept {
  if (log && g_LogVerbose) Log::Lock(Log::Debug).logStreamLine() << "DBInstances: Stopping engine gracefully";
  for (auto& [key, record] : records_) {
    if (log) {
      closeInstance(record);
    } else if (record.instance) {
      record.instance->term();
    }
  }
  records_.clear();
  stopped_ = true;
  stopping_.request_stop();
  opened_.notify_all();
}

std::shared_ptr<std::shared_mutex> DBInstances::dataLock(const std::string& dbKey, std::string_view id) {
  std::shared_ptr<DataLocks> locks;
  {
    sys::MutexLock lock(mutex_);
    auto& weak = dataLocks_[dbKey];
    locks = weak.lock();
    if (!locks) {
      // Entries of databases nobody writes to any more go now and then.
      if (dataLocks_.size() > 4 * settings_.maxActiveDBs) {
        std::erase_if(dataLocks_, [](const auto& e) { return e.second.expired(); });
      }
      locks = std::make_shared<DataLocks>();
      dataLocks_[dbKey] = locks;
    }
  }
  std::shared_mutex& stripe = locks->stripes[std::hash<std::string_view>{}(id) % kDataLockStripes];
  // Shares the stripes' lifetime.
  return std::shared_ptr<std::shared_mutex>(std::move(locks), &stripe);
}

std::optional<DBInstances::RecordView> DBInstances::record(const std::string& dbKey) const {
  sys::MutexLock lock(mutex_);
  const auto found = records_.find(dbKey);
  if (found == records_.end()) return std::nullopt;
  RecordView view;
  if (found->second.instance) {
    view.instanceId = found->second.instance->id();
    view.initialised = found->second.instance->state() == engine::Instance::State::Initialised;
  }
  view.sessions = found->second.sessions;
  view.maintenance = found->second.maintenance;
  return view;
}

std::size_t DBInstances::recordCount() const {
  sys::MutexLock lock(mutex_);
  return records_.size();
}

}  // namespace DB
