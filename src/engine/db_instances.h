#pragma once
// DB::DBInstances: the pool of engine instances, one per open database,
// with their sessions and maintenance holds. The service builds one from
// its settings, paths and Env and hands it to the layers above; it is also
// how they reach those paths and that Env.
//
// The first session asked for a database creates and initialises its
// instance and runs the caller's onNewInstance with that session (the store
// attaches or creates the database there); later sessions only begin on the
// instance. Instances stay open after their last session, so that a client
// that comes back pays nothing; dormant instances (no session, no hold) are
// closed all at once when the pool reaches two thirds of MaxActiveDBs, or on
// request (closeIfDormant). The limits are the engine's: MaxActiveDBs live
// instances (kTooManyInstances beyond), MaxActiveClientsPerDB sessions per
// instance (kOutOfSessions beyond).
//
// Maintenance holds (InstanceForMaintenance, instance_for_maintenance.h)
// take a database out of ordinary use: a shared hold works on the open
// instance beside its clients (backup, cleanup); an exclusive hold needs
// every session gone and replaces the instance by an uninitialised one, on
// which no session can begin (restore). Only one hold of either kind is set
// on a database at a time.
//
// Record states: absent; open (initialised instance, no hold); shared hold
// (initialised, held); exclusive hold (uninitialised, held).
//
// Ownership: the pool is held by shared pointers: the service's and those of
// the stores and running maintenance holds, so a store or a hold that ends
// after the stop finds valid memory. Sessions are owned by their callers
// and handed back through endSession.
// Thread safety: one mutex, the pool mutex, guards every record; it is held
// while instances are created, initialised and
// terminated and while sessions begin and end. No member may be called with
// it held (they take it). onNewInstance runs without
// it (attaching a database may replay a large write-ahead log): the record
// is marked as opening meanwhile, and other callers for the same database
// wait until it is open (or gone), while other databases are served.
// onNewInstance must not call the pool, discardInstance excepted.
// Failures: DB::DBExc (engine codes, or the texts documented per member).

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <stop_token>
#include <string>
#include <string_view>
#include <unordered_map>

#include "engine/instance.h"
#include "engine/read_cache.h"
#include "engine/session.h"
#include "framework/env.h"
#include "framework/thread_annotations.h"
#include "settings/paths.h"

class DBConfig;

namespace DB {

class InstanceForMaintenance;

// The pool's limits and waits.
struct PoolSettings {
  std::uint64_t maxActiveDBs = 100;          // live instances; more fail with kTooManyInstances
  std::uint64_t maxClientsPerDB = 100;       // sessions per instance; more fail with kOutOfSessions
  std::int32_t maxWaitMaintenanceSecs = 10;  // ticks a maintenance hold waits
  std::chrono::milliseconds maintenanceTick{1000};
  // How long a writer waits for a database's write lock.
  std::chrono::milliseconds busyTimeout{10000};
  // Printed at the start; the engine has no use for it.
  std::string filesPrefix = "cvd";
  // The byte budget of the read cache of every database (0: none).
  std::uint64_t readCacheBytes = std::uint64_t{64} << 20;

  static PoolSettings from(const DBConfig& config);
};

class DBInstances : public std::enable_shared_from_this<DBInstances> {
  struct Token {};

 public:
  // Runs with the first session of a newly created instance, without the
  // pool mutex; nobody else gets a session on that database meanwhile.
  using OnNewInstance = std::function<void(engine::Session&)>;

  // A view of one record, for diagnostics and tests.
  struct RecordView {
    std::uint64_t instanceId = 0;  // 0: no instance
    bool initialised = false;
    std::uint64_t sessions = 0;
    bool maintenance = false;
  };

  // A pool for databases below paths, their files and clock through env
  // (which must outlive the pool). Raises the open-file limit and logs the
  // engine's start.
  static std::shared_ptr<DBInstances> create(PoolSettings settings, Paths paths, sys::Env& env);

  DBInstances(Token, PoolSettings settings, Paths paths, sys::Env& env);
  ~DBInstances();

  // The service's stop: every instance terminated, waiting holds
  // interrupted; later sessions and holds fail with kTermInProgress, and
  // sessions ended later are simply closed. Never throws.
  void stop() noexcept EXCLUDES(mutex_);
  bool stopped() const EXCLUDES(mutex_);

  const PoolSettings& settings() const noexcept { return settings_; }
  const Paths& paths() const noexcept { return paths_; }
  sys::Env& env() const noexcept { return env_; }
  DBInstances(const DBInstances&) = delete;
  DBInstances& operator=(const DBInstances&) = delete;

  // A new session on the database's instance, creating and initialising the
  // instance first when the database has none. Throws "Database not
  // accessible! Possible restore operation in progress." while an exclusive
  // hold is set, kOutOfSessions / kTooManyInstances at the limits (their
  // texts name the database and the setting that refused it), and
  // whatever onNewInstance throws; then no session stays counted and an
  // instance made for the call is dropped.
  std::unique_ptr<engine::Session> newSession(const std::string& dbKey, const OnNewInstance& onNewInstance)
      EXCLUDES(mutex_);

  // Ends a session that newSession handed out. A session whose database or
  // instance the pool no longer knows is logged as released for an unknown
  // instance, and ended all the same; after stop() sessions simply end.
  // Never throws.
  void endSession(const std::string& dbKey, std::unique_ptr<engine::Session> session) noexcept EXCLUDES(mutex_);

  // True when the database has no instance afterwards: it had none, or it
  // had one without sessions and holds, which is closed now.
  bool closeIfDormant(const std::string& dbKey) noexcept EXCLUDES(mutex_);

  // For a database creation that failed inside onNewInstance: detaches and
  // closes the session's database, uncounts the session and terminates and
  // forgets the instance. The session object itself is destroyed by
  // newSession's caller path as the failure passes on.
  void discardInstance(const std::string& dbKey, engine::Session& session) noexcept EXCLUDES(mutex_);

  std::optional<RecordView> record(const std::string& dbKey) const EXCLUDES(mutex_);
  std::size_t recordCount() const EXCLUDES(mutex_);
  // Instances of this pool not yet terminated.
  std::uint64_t liveInstances() const noexcept { return slots_->live(); }

  // The cache of point reads of every database (read_cache.h). A database's
  // entries go whenever its instance closes (dormant, restored, discarded,
  // stopped), so that a replaced file is never answered from memory.
  ReadCache& readCache() noexcept { return readCache_; }
  const ReadCache& readCache() const noexcept { return readCache_; }

  // The lock between the data-file writes of one database and the removal
  // of its unused data ids: a write into an id holds dataLock(key, id)
  // shared from its first file operation to its last, and the removal of
  // an id holds it exclusive from its age check to its last removal, so no
  // acknowledged write is ever removed by a cleanup running at that moment.
  // Ids share one of kDataLockStripes locks per database by hash; a lock
  // lives as long as somebody holds it or the database's entry is kept.
  static constexpr std::size_t kDataLockStripes = 64;
  std::shared_ptr<std::shared_mutex> dataLock(const std::string& dbKey, std::string_view id);

 private:
  friend class InstanceForMaintenance;

  std::unique_ptr<engine::Session> openSession(const std::string& dbKey, const OnNewInstance& onNewInstance)
      EXCLUDES(mutex_);

  struct InstanceRec {
    std::shared_ptr<engine::Instance> instance;  // null once terminated
    std::uint64_t sessions = 0;
    bool maintenance = false;
    bool opening = false;  // onNewInstance runs for it
  };

  std::shared_ptr<engine::Instance> createInstance(const std::string& dbKey);
  // The record is one of records_.
  void closeInstance(InstanceRec& record) noexcept REQUIRES(mutex_);
  void closeDormantInstances() noexcept EXCLUDES(mutex_);
  std::unique_ptr<engine::Session> beginSession(InstanceRec& record) REQUIRES(mutex_);
  // lock holds mutex_; the wait for an opening lets go of it meanwhile.
  std::unique_ptr<engine::Session> sessionOnOpen(sys::MutexLock& lock, const std::string& dbKey) REQUIRES(mutex_);
  // Both return null when the hold cannot be taken now (busy).
  std::shared_ptr<engine::Instance> acquireShared(const std::string& dbKey, bool set) EXCLUDES(mutex_);
  std::shared_ptr<engine::Instance> acquireExclusive(const std::string& dbKey, bool set) EXCLUDES(mutex_);
  // Sleeps one tick of a maintenance wait; false when the pool stopped
  // meanwhile, or stop (the operation's, when it has one) was requested.
  bool waitTick(const std::stop_token& stop) EXCLUDES(mutex_);
  void stopEngine(bool log) noexcept REQUIRES(mutex_);

  const PoolSettings settings_;
  const Paths paths_;
  sys::Env& env_;
  const std::shared_ptr<engine::InstanceSlots> slots_;
  std::stop_source stopping_;
  ReadCache readCache_;

  struct DataLocks {
    std::shared_mutex stripes[kDataLockStripes];
  };
  mutable sys::Mutex mutex_;  // the pool mutex
  std::unordered_map<std::string, std::weak_ptr<DataLocks>> dataLocks_ GUARDED_BY(mutex_);
  std::unordered_map<std::string, InstanceRec> records_ GUARDED_BY(mutex_);
  bool stopped_ GUARDED_BY(mutex_) = false;
  std::condition_variable opened_;  // with mutex_: an opening ended
};

}  // namespace DB
