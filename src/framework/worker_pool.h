#pragma once
// An elastic pool of threads that run tasks which may block.
//
// The pool starts `keep` threads. A submitted task runs on an idle thread,
// or on a new one when every thread is busy, so a task that blocks (a
// transaction's retry pause, a wait for a maintenance hold) never delays
// another task. Threads beyond `keep` end after `idleTimeout` without work.
// At most `maxThreads` threads exist; beyond that, and when the system
// refuses a new thread, tasks wait in order for a free thread (reported
// once through the error callback until a thread can be started again).
//
// Ownership: the pool owns its threads; each thread also shares the pool's
// internal state, so a task that ends up destroying the pool (by releasing
// its last owner) is safe: that thread is detached instead of joined.
// Thread safety: every member may be called from any thread.
// Failures: exceptions that escape a task are reported through the error
// callback and dropped; the thread goes on.

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>

namespace Ipc {

class WorkerPool {
 public:
  struct Options {
    std::size_t keep = 2;
    std::size_t maxThreads = 2048;
    std::chrono::milliseconds idleTimeout{30000};
  };
  using Task = std::function<void()>;
  using ErrorReport = std::function<void(const std::string&)>;

  // Throws std::system_error when not even the first thread can be started.
  WorkerPool(Options options, ErrorReport report);
  ~WorkerPool();
  WorkerPool(const WorkerPool&) = delete;
  WorkerPool& operator=(const WorkerPool&) = delete;

  // Queues a task. Returns false (and drops the task) once shutdown began.
  bool submit(Task task);

  // Refuses new tasks, drops the tasks that have not started, waits for the
  // running ones and joins every thread. Idempotent.
  void shutdown();

  std::size_t threadCount() const;
  std::size_t idleCount() const;

 private:
  struct State;
  static void workerMain(const std::shared_ptr<State>& s);
  static void spawn(const std::shared_ptr<State>& s);

  std::shared_ptr<State> state_;
};

}  // namespace Ipc
