#pragma once
// DB::Transaction and DB::runInTransaction: every write of the store runs
// inside them.
//
//   runInTransaction(session, [&] { ...reads and writes... });
//
// runInTransaction begins a write transaction, runs the body and commits.
// When the body or the commit fails with a retryable engine code (a write
// conflict and its kin, isRetryableCode), the transaction is rolled back,
// the thread pauses for a random 0 to 1000 ms (holding no lock; through the
// instance's Env, so tests run the pauses on a clock of their own), a new
// transaction begins and the body runs again from its start; the body must
// therefore recompute anything it keeps outside the engine. After 120
// retries, or once the pauses add up to kMaxPauseTotal (so that a command
// is never held for minutes), it gives up with "Transaction made too many
// attmepts to gain access to a locked item". Other failures pass on at
// once, after rollback. A retried code that does not normally go away on
// retry (anything but a conflict or a lock) is logged at warning level.
//
// On this engine the write lock is taken when the transaction begins, so a
// conflict can also show at the begin (a wait for the lock beyond the busy
// timeout); runInTransaction and retry() count such a begin as a failed
// attempt and begin again after a pause.
//
// A plain Transaction (database creation) begins in its constructor, once,
// and rolls back in its destructor unless committed.
//
// Ownership: a stack object of the thread that uses the session.
// Failures: DB::DBExc; the destructor never throws and logs a failed
// rollback.

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <source_location>
#include <type_traits>
#include <utility>

#include "engine/db_exc.h"
#include "engine/session.h"

namespace DB {

class Transaction {
 public:
  static constexpr std::uint64_t kMaxRetries = 120;
  static constexpr int kMaxPauseMs = 1000;
  static constexpr std::chrono::milliseconds kMaxPauseTotal{30000};

  struct RetryBegin {};
  static constexpr RetryBegin kRetryBegin{};

  // Begins a write transaction; a failure is thrown, nothing is open then.
  explicit Transaction(engine::Session& session, const std::source_location& where = std::source_location::current());
  // Begins a write transaction, retrying a conflict at the begin like a
  // failed attempt (used by runInTransaction).
  Transaction(engine::Session& session, RetryBegin);
  ~Transaction();
  Transaction(const Transaction&) = delete;
  Transaction& operator=(const Transaction&) = delete;

  // Commits; afterwards nothing is rolled back.
  void commit(const std::source_location& where = std::source_location::current());

  // True, and a retry is requested, when the error's code is retryable.
  bool isRetryable(const DBExc& error) noexcept;
  // When a retry was requested: counts it (throwing after kMaxRetries),
  // rolls back, pauses, begins anew and returns true. Otherwise false.
  bool retry();

  std::uint64_t attempts() const noexcept { return attempts_; }
  bool active() const noexcept { return active_; }

  // The 13 codes that ask for another attempt.
  static bool isRetryableCode(std::int32_t code) noexcept;
  // The retryable codes of conflicts and locks, which go away when the
  // other writer is done; the others are retried but logged.
  static bool isConflictCode(std::int32_t code) noexcept;

 private:
  void beginWithRetry();
  void countAttempt();
  void pause();

  engine::Session& session_;
  bool active_ = false;
  bool retryRequested_ = false;
  std::uint64_t attempts_ = 0;
  std::chrono::milliseconds paused_{0};
};

// Runs body (no arguments) inside a write transaction with retry, commits,
// and returns the body's result of the attempt that committed.
template <class Body>
auto runInTransaction(engine::Session& session, Body&& body) -> std::invoke_result_t<Body&> {
  using Result = std::invoke_result_t<Body&>;
  Transaction txn(session, Transaction::kRetryBegin);
  if constexpr (std::is_void_v<Result>) {
    do {
      try {
        body();
        txn.commit();
      } catch (const DBExc& e) {
        if (!txn.isRetryable(e)) throw;
      }
    } while (txn.retry());
  } else {
    std::optional<Result> result;
    do {
      try {
        result.emplace(body());
        txn.commit();
      } catch (const DBExc& e) {
        if (!txn.isRetryable(e)) throw;
      }
    } while (txn.retry());
    return std::move(*result);
  }
}

}  // namespace DB
