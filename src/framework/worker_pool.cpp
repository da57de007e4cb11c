#include "framework/worker_pool.h"

#include <condition_variable>
#include <deque>
#include <exception>
#include <map>
#include <mutex>
#include <system_error>
#include <thread>
#include <vector>

namespace Ipc {

struct WorkerPool::State {
  State(Options o, ErrorReport r) : options(o), report(std::move(r)) {}

  const Options options;
  const ErrorReport report;

  std::mutex mutex;
  std::condition_variable wake;
  std::deque<Task> tasks;                          // guarded by mutex
  std::map<std::thread::id, std::thread> threads;  // guarded by mutex
  std::vector<std::thread> finished;               // guarded by mutex: shrunk threads to join
  std::size_t idle = 0;                            // guarded by mutex
  bool stopping = false;                           // guarded by mutex
  bool spawnFailing = false;                       // guarded by mutex

  void tell(const std::string& text) const noexcept {
    if (!report) return;
    try {
      report(text);
    } catch (...) {
      // A report that fails has nowhere else to go.
    }
  }
};

namespace {

void joinOrDetach(std::thread& t) {
  if (!t.joinable()) return;
  if (t.get_id() == std::this_thread::get_id()) {
    t.detach();  // the pool is being destroyed by one of its own tasks
  } else {
    t.join();
  }
}

}  // namespace

// Runs tasks until the pool stops, or until the thread has been idle too
// long while more than `keep` threads exist.
void WorkerPool::workerMain(const std::shared_ptr<State>& s) {
  std::unique_lock lock(s->mutex);
  for (;;) {
    if (s->stopping) return;  // shutdown() owns the handles now
    if (s->tasks.empty()) {
      ++s->idle;
      const bool woken = s->wake.wait_for(lock, s->options.idleTimeout,
                                          [&] { return s->stopping || !s->tasks.empty(); });
      --s->idle;
      if (!woken && s->threads.size() > s->options.keep) break;
      continue;
    }
    Task task = std::move(s->tasks.front());
    s->tasks.pop_front();
    if (s->tasks.empty()) s->spawnFailing = false;  // the burst is over
    lock.unlock();
    try {
      task();
      task = nullptr;  // the task's captures go before the lock is taken again
    } catch (const std::exception& e) {
      s->tell(std::string("A worker task failed: ") + e.what());
    } catch (...) {
      s->tell("A worker task failed with an unknown exception");
    }
    task = nullptr;
    lock.lock();
  }
  // Shrinking: hand our own handle to the next submit() or shutdown() to join.
  const auto it = s->threads.find(std::this_thread::get_id());
  if (it != s->threads.end()) {
    s->finished.push_back(std::move(it->second));
    s->threads.erase(it);
  }
}

// Starts one thread. Called with the mutex held; the new thread blocks on
// the mutex until the caller releases it, by which time it is registered.
void WorkerPool::spawn(const std::shared_ptr<State>& s) {
  std::thread t([s] { workerMain(s); });
  const auto id = t.get_id();
  s->threads.emplace(id, std::move(t));
}

WorkerPool::WorkerPool(Options options, ErrorReport report)
    : state_(std::make_shared<State>(options, std::move(report))) {
  std::lock_guard lock(state_->mutex);
  const std::size_t keep = options.keep == 0 ? 1 : options.keep;
  for (std::size_t i = 0; i < keep; ++i) {
    try {
      spawn(state_);
    } catch (const std::system_error&) {
      if (i == 0) throw;
      break;
    }
  }
}

WorkerPool::~WorkerPool() { shutdown(); }

bool WorkerPool::submit(Task task) {
  std::vector<std::thread> reap;
  std::string problem;
  {
    std::lock_guard lock(state_->mutex);
    if (state_->stopping) return false;
    state_->tasks.push_back(std::move(task));
    if (state_->idle >= state_->tasks.size()) {
      state_->wake.notify_one();
    } else if (state_->threads.size() < state_->options.maxThreads) {
      try {
        spawn(state_);
        state_->spawnFailing = false;
      } catch (const std::system_error& e) {
        if (!state_->spawnFailing) {
          problem = std::string("Cannot start a worker thread (") + e.what() + "); " +
                    std::to_string(state_->threads.size()) +
                    " workers are busy, the command waits for a free one";
        }
        state_->spawnFailing = true;
      }
    } else if (!state_->spawnFailing) {
      state_->spawnFailing = true;
      problem = "All " + std::to_string(state_->threads.size()) +
                " worker threads are busy; commands wait for a free one";
    }
    reap.swap(state_->finished);
  }
  for (auto& t : reap) joinOrDetach(t);
  if (!problem.empty()) state_->tell(problem);
  return true;
}

void WorkerPool::shutdown() {
  std::deque<Task> dropped;
  std::vector<std::thread> all;
  {
    std::lock_guard lock(state_->mutex);
    state_->stopping = true;
    dropped.swap(state_->tasks);
    for (auto& [id, t] : state_->threads) all.push_back(std::move(t));
    state_->threads.clear();
    for (auto& t : state_->finished) all.push_back(std::move(t));
    state_->finished.clear();
  }
  state_->wake.notify_all();
  dropped.clear();
  for (auto& t : all) joinOrDetach(t);
}

std::size_t WorkerPool::threadCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->threads.size();
}

std::size_t WorkerPool::idleCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->idle;
}

}  // namespace Ipc
