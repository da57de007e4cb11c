#pragma once
// engine::CommitQueue: group commit for the writers of one database.
//
// Every commit syncs the write-ahead log, so a database that commits each
// request on its own commits at most as often as the disk syncs, however
// many clients write. The queue lets the writes that arrive while a commit
// is in progress share the next one:
//
//   - A writer queues its request. The request at the front of the queue
//     leads: it takes the requests queued behind it (at most
//     kMaxGroupRequests and kMaxGroupBytes; the leader's own always goes)
//     and runs their bodies, in arrival order, on its own session in one
//     write transaction, then commits once.
//   - Nothing waits for company. A lone writer leads a group of one at
//     once; a group is whatever queued while the previous group ran.
//   - A group of one runs exactly as runInTransaction runs a body. In a
//     larger group every body runs inside its own savepoint: a body that
//     fails is rolled back to it and gets its own failure, the others
//     commit. A body that fails with a retryable code (transaction.h) is
//     rolled back to its savepoint and then runs again alone, with
//     runInTransaction's retry rules, after its group.
//   - A failure at the begin or the commit (after the usual retries of the
//     whole group) fails every request of the group, with nothing of any of
//     them stored.
//   - Each writer returns only when its group's commit returned, that is,
//     when its write is as durable as the database's sync setting makes a
//     commit; then the next request in the queue leads.
//
// A body sees the effects of the bodies before it in its group, exactly as
// if they had run one after another, and must use the session it is handed
// (the leader's), never one of its own. Bodies must be restartable as
// runInTransaction's are, since a retried group runs them all again.
//
// Thread safety: every member may be called from any thread; a writer's
// body runs on the leader's thread while the writer waits.
// Failures: a writer gets its own body's exception or the group's.

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <exception>
#include <functional>
#include <vector>

#include "framework/thread_annotations.h"

namespace engine {

class Session;

class CommitQueue {
 public:
  static constexpr std::size_t kMaxGroupRequests = 64;
  static constexpr std::uint64_t kMaxGroupBytes = 8 << 20;

  using Body = std::function<void(Session&)>;

  // Runs body in a grouped write transaction and returns once its group
  // committed; own is the writer's session, used when the writer leads.
  // bytes: about how much the body writes, for the group's bound.
  void run(Session& own, std::uint64_t bytes, const Body& body) EXCLUDES(mutex_);

  // Requests in the queue, the running group's included.
  std::size_t queued() const EXCLUDES(mutex_);

  // Process-wide counts since the start, for the metrics page.
  struct Stats {
    std::uint64_t commits = 0;   // groups that ran (committed or failed)
    std::uint64_t requests = 0;  // requests they carried
    std::uint64_t largest = 0;   // the most requests in one group
  };
  static Stats stats() noexcept;

 private:
  enum class State { Queued, Done, RetryAlone };
  struct Request {
    Request(const Body& b, std::uint64_t n, bool a) : body(b), bytes(n), alone(a) {}
    const Body& body;
    std::uint64_t bytes;
    bool alone;                     // runs in a group of its own
    State state = State::Queued;    // guarded by the queue's mutex
    State outcome = State::Done;    // written by the leader before state
    std::exception_ptr error;       // written by the leader before state
    std::condition_variable ready;  // with the queue's mutex
  };

  // Queues request and returns once it was run (by this thread as leader
  // or by another); its outcome is then in request.
  void submit(Session& own, Request& request) EXCLUDES(mutex_);
  // Runs the group on session and sets every request's outcome and error.
  static void runGroup(Session& session, const std::vector<Request*>& group) noexcept;
  static void runBodies(Session& session, const std::vector<Request*>& group);

  mutable sys::Mutex mutex_;
  std::deque<Request*> queue_ GUARDED_BY(mutex_);
};

}  // namespace engine
