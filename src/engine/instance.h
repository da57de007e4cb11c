#pragma once
// engine::Instance: the engine instance of one database.
//
// An instance knows its folders (the database folder, where the database
// file and its write-ahead log live, and the log folder of the database,
// which this engine only creates), its session limit, and the one database
// file attached to it. It is created uninitialised; init() creates its
// folders and lets sessions begin. A restore works on an uninitialised
// instance, so no session can open the database meanwhile.
//
// The number of live (not terminated) instances that share one
// InstanceSlots is limited (the pool's MaxActiveDBs); creating one more
// fails with kTooManyInstances.
//
// Ownership: shared. The pool holds an instance in its record, and every
// session holds it too, so a session that ends after its instance was
// terminated still finds valid memory.
// Thread safety: every member may be called from any thread.
// Failures: DB::DBExc with an engine code (engine_errors.h).
// The write gate serialises the database's writers inside the process
// (write_gate.h); sessions take it around their write transactions. The
// store's writers go through the commit queue first (commit_queue.h), so
// that the writes that queue up share one commit.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <source_location>
#include <string>

#include "engine/commit_queue.h"
#include "engine/write_gate.h"
#include "framework/env.h"
#include "framework/thread_annotations.h"

namespace engine {

class Session;

// The live instances of one pool, against its limit.
class InstanceSlots {
 public:
  explicit InstanceSlots(std::uint64_t limit) noexcept : limit_(limit) {}
  // Takes a slot; false at the limit.
  bool take() noexcept;
  void give() noexcept { --live_; }
  std::uint64_t live() const noexcept { return live_.load(); }

 private:
  const std::uint64_t limit_;
  std::atomic<std::uint64_t> live_{0};
};

struct InstanceSettings {
  std::string key;                       // the database key, for log texts
  std::filesystem::path instanceFolder;  // the database folder
  std::filesystem::path logFolder;       // the database's log folder
  std::string databaseFileName;          // the database file's name in the backup folder of a restore
  std::uint64_t maxSessions = 100;       // sessions open at once on the instance
  // How long a writer waits for the database's write lock (in-process and
  // SQLite's) before the attempt counts as a write conflict.
  std::chrono::milliseconds busyTimeout{10000};
  // The files and the clock of the instance's database and of its
  // sessions' transactions; outlives the instance.
  sys::Env* env = &sys::Env::posix();
  // The limit on live instances this one counts against; none when null.
  std::shared_ptr<InstanceSlots> slots;
};

class Instance : public std::enable_shared_from_this<Instance> {
  struct Token {};

 public:
  enum class State { Created, Initialised, Terminated };

  // A new, uninitialised instance. Throws kTooManyInstances when its slots
  // are all taken.
  static std::shared_ptr<Instance> create(InstanceSettings settings,
                                          const std::source_location& where = std::source_location::current());

  Instance(Token, InstanceSettings settings);
  ~Instance();
  Instance(const Instance&) = delete;
  Instance& operator=(const Instance&) = delete;

  // Process-wide number, from 1, for the "I:" of log texts.
  std::uint64_t id() const noexcept { return id_; }
  const InstanceSettings& settings() const noexcept { return settings_; }
  State state() const EXCLUDES(mutex_);

  // Creates the instance and log folders with missing parents (each new
  // level synced into its parent) and lets sessions begin. Throws kFileAccessDenied or kDiskIO when a folder cannot
  // be made (the instance stays uninitialised), kTermInProgress when the
  // instance was terminated. Initialising twice does nothing.
  void init(const std::source_location& where = std::source_location::current()) EXCLUDES(mutex_);

  // Ends the instance: no session begins any more, transactions of late
  // sessions fail with kTermInProgress, the attached database is forgotten
  // and the process-wide slot is freed. Idempotent; never throws.
  void term() noexcept EXCLUDES(mutex_);

  // A new session. Throws kNotInitialized on an uninitialised instance,
  // kTermInProgress on a terminated one, kOutOfSessions when maxSessions
  // sessions are open.
  std::unique_ptr<Session> beginSession(const std::source_location& where = std::source_location::current())
      EXCLUDES(mutex_);

  std::uint64_t openSessions() const EXCLUDES(mutex_);
  // The attached database file, if any.
  std::optional<std::filesystem::path> attachedDatabase() const EXCLUDES(mutex_);

  // The queue in which the writers of the database form their groups.
  CommitQueue& commitQueue() noexcept { return commitQueue_; }

 private:
  friend class Session;
  void sessionEnded() noexcept EXCLUDES(mutex_);
  // Records the file as attached: kWrnDatabaseAttached when it already was,
  // 0 when newly attached; throws kTooManyAttachedDatabases for a second
  // file, kNotInitialized / kTermInProgress in the wrong state.
  std::int32_t attach(const std::filesystem::path& file, const std::source_location& where) EXCLUDES(mutex_);
  void detach() noexcept EXCLUDES(mutex_);
  WriteGate& writeGate() noexcept { return writeGate_; }

  const std::uint64_t id_;
  const InstanceSettings settings_;
  mutable sys::Mutex mutex_;
  State state_ GUARDED_BY(mutex_) = State::Created;
  std::uint64_t sessions_ GUARDED_BY(mutex_) = 0;
  std::optional<std::filesystem::path> attached_ GUARDED_BY(mutex_);
  WriteGate writeGate_;
  CommitQueue commitQueue_;
};

}  // namespace engine
