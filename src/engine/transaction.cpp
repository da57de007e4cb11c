#include "engine/transaction.h"

#include <algorithm>
#include <array>
#include <random>

#include "engine/engine_counters.h"
#include "engine/engine_errors.h"
#include "engine/instance.h"
#include "framework/log.h"

namespace DB {
namespace {

// Sorted, for the binary search.
constexpr std::array<std::int32_t, 13> kRetryable = [] {
  std::array<std::int32_t, 13> codes{err::kWriteConflict,
                                     err::kTransTooDeep,
                                     err::kWriteConflictPrimaryIndex,
                                     err::kRollbackRequired,
                                     err::kTableLocked,
                                     err::kTableInUse,
                                     err::kTooManyOpenTablesAndCleanupTimedOut,
                                     err::kRecordNotFound,
                                     err::kNoCurrentRecord,
                                     err::kRecordPrimaryChanged,
                                     err::kKeyDuplicate,
                                     err::kAlreadyPrepared,
                                     err::kDataHasChanged};
  std::sort(codes.begin(), codes.end());
  return codes;
}();

}  // namespace

Transaction::Transaction(engine::Session& session, const std::source_location& where) : session_(session) {
  session_.beginWrite(where);
  active_ = true;
}

Transaction::Transaction(engine::Session& session, RetryBegin) : session_(session) { beginWithRetry(); }

Transaction::~Transaction() {
  if (!active_) return;
  try {
    session_.rollback();
  } catch (const DBExc& e) {
    Log::Lock(Log::Error).logStreamLine()
        << "Failed to rollback trasaction S:" << session_.id() << " error code " << e.code();
  } catch (const std::exception& e) {
    Log::Lock(Log::Error).logStreamLine()
        << "Failed to rollback trasaction S:" << session_.id() << " error code " << e.what();
  }
}

void Transaction::commit(const std::source_location& where) {
  session_.commit(where);
  active_ = false;
}

bool Transaction::isRetryableCode(std::int32_t code) noexcept {
  return std::binary_search(kRetryable.begin(), kRetryable.end(), code);
}

bool Transaction::isConflictCode(std::int32_t code) noexcept {
  switch (code) {
    case err::kWriteConflict:
    case err::kWriteConflictPrimaryIndex:
    case err::kRollbackRequired:
    case err::kTableLocked:
    case err::kTableInUse:
      return true;
    default:
      return false;
  }
}

bool Transaction::isRetryable(const DBExc& error) noexcept {
  if (!isRetryableCode(error.code())) return false;
  retryRequested_ = true;
  if (!isConflictCode(error.code())) {
    try {
      Log::Lock(Log::Warning).logStreamLine() << "Transaction::retry S:" << session_.id() << " retries engine error "
                                              << error.code() << ", which does not normally go away on retry";
    } catch (const std::exception&) {
      // The retry goes on without its log line.
    }
  }
  return true;
}

bool Transaction::retry() {
  if (!retryRequested_) return false;
  countAttempt();
  if (active_) {
    active_ = false;
    session_.rollback();
  }
  retryRequested_ = false;
  pause();
  beginWithRetry();
  return true;
}

void Transaction::beginWithRetry() {
  for (;;) {
    try {
      session_.beginWrite();
      active_ = true;
      return;
    } catch (const DBExc& e) {
      if (!isRetryableCode(e.code())) throw;
    }
    countAttempt();
    pause();
  }
}

void Transaction::countAttempt() {
  ++attempts_;
  if (attempts_ > kMaxRetries || paused_ >= kMaxPauseTotal) {
    throw DBExc("Transaction made too many attmepts to gain access to a locked item");
  }
  engine::counters().transactionRetries.fetch_add(1, std::memory_order_relaxed);
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "Transaction::retry"
                                          << " S:" << session_.id() << " " << attempts_ << " attempt(s) so far.";
  }
}

void Transaction::pause() {
  // Seeded afresh from the platform's random source, so that sessions that
  // collided do not pause in step.
  std::random_device source;
  std::mt19937 generator(source());
  std::uniform_int_distribution<int> draw(0, kMaxPauseMs);
  const std::chrono::milliseconds duration(draw(generator));
  paused_ += duration;
  session_.instance()->settings().env->sleepFor(duration);
}

}  // namespace DB
