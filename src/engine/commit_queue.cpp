#include "engine/commit_queue.h"

#include <algorithm>
#include <atomic>
#include <vector>

#include "engine/db_exc.h"
#include "engine/session.h"
#include "engine/transaction.h"

namespace engine {
namespace {

std::atomic<std::uint64_t> g_commits{0};
std::atomic<std::uint64_t> g_requests{0};
std::atomic<std::uint64_t> g_largest{0};

void count(std::uint64_t groupSize) noexcept {
  g_commits.fetch_add(1, std::memory_order_relaxed);
  g_requests.fetch_add(groupSize, std::memory_order_relaxed);
  auto largest = g_largest.load(std::memory_order_relaxed);
  while (groupSize > largest && !g_largest.compare_exchange_weak(largest, groupSize, std::memory_order_relaxed)) {
  }
}

}  // namespace

CommitQueue::Stats CommitQueue::stats() noexcept {
  return {g_commits.load(std::memory_order_relaxed), g_requests.load(std::memory_order_relaxed),
          g_largest.load(std::memory_order_relaxed)};
}

std::size_t CommitQueue::queued() const {
  sys::MutexLock lock(mutex_);
  return queue_.size();
}

void CommitQueue::run(Session& own, std::uint64_t bytes, const Body& body) {
  Request request{body, bytes, false};
  submit(own, request);
  if (request.state == State::RetryAlone) {
    Request alone{body, bytes, true};
    submit(own, alone);
    if (alone.error) std::rethrow_exception(alone.error);
    return;
  }
  if (request.error) std::rethrow_exception(request.error);
}

void CommitQueue::submit(Session& own, Request& request) {
  // Filled under the lock, so it must not allocate: a failure there would
  // leave the queue without a leader.
  std::vector<Request*> group;
  group.reserve(kMaxGroupRequests);
  {
    sys::MutexLock lock(mutex_);
    queue_.push_back(&request);
    request.ready.wait(lock.native(),
                       [&]() REQUIRES(mutex_) { return request.state != State::Queued || queue_.front() == &request; });
    if (request.state != State::Queued) return;
    // This request leads: it takes what queued behind it.
    std::uint64_t bytes = 0;
    for (Request* next : queue_) {
      if (!group.empty() &&
          (request.alone || next->alone || group.size() >= kMaxGroupRequests || bytes + next->bytes > kMaxGroupBytes)) {
        break;
      }
      group.push_back(next);
      bytes += next->bytes;
    }
  }

  runGroup(own, group);

  sys::MutexLock lock(mutex_);
  for (Request* done : group) {
    queue_.pop_front();
    done->state = done->outcome;
    if (done != &request) done->ready.notify_one();
  }
  if (!queue_.empty()) queue_.front()->ready.notify_one();
  count(group.size());
}

void CommitQueue::runGroup(Session& session, const std::vector<Request*>& group) noexcept {
  try {
    DB::Transaction txn(session, DB::Transaction::kRetryBegin);
    do {
      for (Request* r : group) {
        r->outcome = State::Done;
        r->error = nullptr;
      }
      try {
        runBodies(session, group);
        txn.commit();
      } catch (const DB::DBExc& e) {
        if (!txn.isRetryable(e)) throw;
      }
    } while (txn.retry());
  } catch (...) {
    // Nothing of the group is stored. A request that failed on its own
    // keeps its own failure; one that was to run alone still does.
    const auto error = std::current_exception();
    for (Request* r : group) {
      if (r->outcome == State::Done && !r->error) r->error = error;
    }
  }
}

void CommitQueue::runBodies(Session& session, const std::vector<Request*>& group) {
  if (group.size() == 1) {
    group.front()->body(session);
    return;
  }
  for (Request* r : group) {
    session.prepare("SAVEPOINT request").run();
    try {
      r->body(session);
    } catch (const DB::DBExc& e) {
      // A failure that ended SQLite's transaction took the group with it.
      if (!session.transactionOpen()) throw;
      if (DB::Transaction::isRetryableCode(e.code())) {
        r->outcome = State::RetryAlone;
      } else {
        r->error = std::current_exception();
      }
      session.prepare("ROLLBACK TO request").run();
    } catch (...) {
      if (!session.transactionOpen()) throw;
      r->error = std::current_exception();
      session.prepare("ROLLBACK TO request").run();
    }
    session.prepare("RELEASE request").run();
  }
}

}  // namespace engine
