#include "framework/io_pool.h"

#include "framework/thread_annotations.h"
#include "framework/unique_fd.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/types.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <list>
#include <map>
#include <system_error>
#include <thread>
#include <vector>

namespace Ipc::detail {
namespace {

// What the watcher knows of one thread of the pool.
struct Slot {
  // When the thread's current command began (steady clock, ns); 0 while
  // the thread is not in a command.
  std::atomic<std::int64_t> since{0};
  UniqueFd statFd;  // /proc/self/task/<tid>/stat, for the thread's state

  Slot() {
    const std::string stat = "/proc/self/task/" + std::to_string(::gettid()) + "/stat";
    statFd = UniqueFd(::open(stat.c_str(), O_RDONLY | O_CLOEXEC));
  }
  Slot(const Slot&) = delete;
  Slot& operator=(const Slot&) = delete;

  // Waiting for the disk (state D: a sync, a read of the file system);
  // unknown counts as not waiting.
  bool waitingForDisk() const noexcept {
    if (!statFd.valid()) return false;
    char buf[512];
    const ssize_t n = ::pread(statFd.get(), buf, sizeof buf - 1, 0);
    if (n <= 0) return false;
    buf[n] = 0;
    // "tid (name) S ...": the name may hold anything but ends at the last ')'.
    const char* close = std::strrchr(buf, ')');
    if (!close || close[1] != ' ') return false;
    return close[2] == 'D';
  }
};

std::int64_t nowNs() noexcept {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace

struct IoPool::State {
  State(Options o, ErrorReport r) : options(o), report(std::move(r)) {
    if (options.base == 0) options.base = 1;
    if (options.maxThreads < options.base) options.maxThreads = options.base;
    if (options.blockedAfter.count() <= 0) options.blockedAfter = std::chrono::microseconds(1);
  }

  Options options;
  const ErrorReport report;

  // Threads in a Busy scope; Busy scopes ended; threads that run the I/O
  // context (a copy of active() for the Busy scope, which takes no lock).
  std::atomic<std::size_t> busy{0};
  std::atomic<std::uint64_t> done{0};
  std::atomic<std::size_t> total{0};
  // Spares are not needed now: they park after their current handler.
  std::atomic<bool> parkSpares{false};
  // The watcher polls (set under mutex).
  std::atomic<bool> watching{false};
  // A thread was needed and none could be started; reported once.
  std::atomic<bool> starved{false};

  sys::Mutex mutex;
  std::condition_variable wake;                                 // the watcher's
  std::weak_ptr<boost::asio::io_context> io GUARDED_BY(mutex);  // the threads own it
  std::map<std::thread::id, std::thread> threads GUARDED_BY(mutex);
  std::vector<std::thread> finished GUARDED_BY(mutex);  // retired spares to join
  std::list<Slot> slots GUARDED_BY(mutex);              // one per running thread
  std::thread watcher GUARDED_BY(mutex);
  std::condition_variable unpark;             // parked spares wait here
  std::size_t parked GUARDED_BY(mutex) = 0;   // spares parked, not woken
  std::size_t wakeups GUARDED_BY(mutex) = 0;  // wake-ups not yet taken
  bool stopping GUARDED_BY(mutex) = false;

  // Threads that run the I/O context (not parked).
  std::size_t active() const REQUIRES(mutex) { return threads.size() - parked; }
  void countActive() REQUIRES(mutex) { total = active(); }

  void tell(const std::string& text) const noexcept {
    if (!report) return;
    try {
      report(text);
    } catch (...) {
      // A report that fails has nowhere else to go.
    }
  }

  // Reports the exception being handled, one that escaped a handler (the
  // thread goes on).
  void tellEscaped() const noexcept {
    try {
      throw;
    } catch (const std::exception& e) {
      tell(std::string("Unexpected failure in an I/O thread: ") + e.what());
    } catch (...) {
      tell("Unexpected failure in an I/O thread");
    }
  }
};

namespace {

// Polls of the watcher that see a free thread before it goes back to sleep.
constexpr unsigned kQuietPolls = 100;

thread_local const void* tPoolOf = nullptr;
thread_local Slot* tSlot = nullptr;

// Registers the calling thread with the watcher for its life. (A template
// only because the pool's state is a type private to IoPool.)
template <class PoolState>
class SlotGuard {
 public:
  explicit SlotGuard(PoolState& s) : s_(s) {
    sys::MutexLock lock(s_.mutex);
    s_.slots.emplace_back();
    it_ = std::prev(s_.slots.end());
    tSlot = &*it_;
  }
  ~SlotGuard() {
    sys::MutexLock lock(s_.mutex);
    tSlot = nullptr;
    s_.slots.erase(it_);
  }
  SlotGuard(const SlotGuard&) = delete;
  SlotGuard& operator=(const SlotGuard&) = delete;

 private:
  PoolState& s_;
  std::list<Slot>::iterator it_;
};

// Commands younger than this are not looked at (a look costs a read of
// the thread's state).
constexpr std::int64_t kBlockedNs = 50000;

// Threads of commands that wait for the disk. (A command asleep on a lock
// or a pause counts as blocked only through the watcher's other rule, no
// command finishing: under load on few cores a command often sleeps on a
// mutex held by a thread waiting for a core, which more threads would not
// help.) Called with the pool's mutex held.
std::size_t countBlocked(const std::list<Slot>& slots) {
  const std::int64_t now = nowNs();
  std::size_t blocked = 0;
  for (const Slot& slot : slots) {
    const std::int64_t since = slot.since.load();
    if (since != 0 && now - since >= kBlockedNs && slot.waitingForDisk()) ++blocked;
  }
  return blocked;
}

void joinOrDetach(std::thread& t) {
  if (!t.joinable()) return;
  if (t.get_id() == std::this_thread::get_id()) {
    t.detach();  // the pool is being destroyed from one of its own threads
  } else {
    t.join();
  }
}

}  // namespace

IoPool::IoPool(Options options, ErrorReport report) : state_(std::make_shared<State>(options, std::move(report))) {}

IoPool::~IoPool() { join(); }

void IoPool::start(std::shared_ptr<boost::asio::io_context> io) {
  sys::MutexLock lock(state_->mutex);
  state_->io = io;
  state_->watcher = std::thread([s = state_] { watcherMain(s); });
  for (unsigned i = 0; i < state_->options.base; ++i) {
    try {
      spawn(state_, io, false);
    } catch (const std::system_error&) {
      if (i == 0) throw;
      break;
    }
  }
}

std::string IoPool::spawn(const std::shared_ptr<State>& s, const std::shared_ptr<boost::asio::io_context>& io,
                          bool spare) REQUIRES(s->mutex) {
  if (s->threads.size() >= s->options.maxThreads) {
    if (s->starved.exchange(true)) return {};
    return "All " + std::to_string(s->threads.size()) +
           " I/O threads are busy in commands; other connections wait for one to finish";
  }
  try {
    std::thread t([s, io, spare] { threadMain(s, io, spare); });
    const auto id = t.get_id();
    s->threads.emplace(id, std::move(t));
    s->countActive();
    return {};
  } catch (const std::system_error& e) {
    if (!spare) throw;
    if (s->starved.exchange(true)) return {};
    return std::string("Cannot start an I/O thread (") + e.what() + "); " + std::to_string(s->threads.size()) +
           " threads are busy in commands, other connections wait for one to finish";
  }
}

void IoPool::threadMain(const std::shared_ptr<State>& s, const std::shared_ptr<boost::asio::io_context>& io,
                        bool spare) {
  tPoolOf = s.get();
  const SlotGuard slot(*s);
  for (;;) {
    if (spare && s->parkSpares.load()) {
      // What the last handler deferred (a read's command, a command's
      // answer) went back to the shared queue when run_one_for returned,
      // and Asio woke no thread for it: this thread was to run it next.
      // Run it, and whatever it defers, before stepping aside; otherwise it
      // would wait for some unrelated event to wake a thread.
      if (!drain(*s, *io)) return;
      const Park parked = park(s);
      if (parked == Park::End) return;
      if (parked == Park::Resume) continue;
      // Park::Stay: every other thread is in a command; this one serves
      // the connections until it may step aside.
    }
    try {
      if (!spare) {
        io->run();
        return;
      }
      if (io->run_one_for(s->options.spareIdle) > 0) continue;
      if (io->stopped()) return;
    } catch (...) {
      s->tellEscaped();
      continue;
    }
    // A spare that ran nothing for spareIdle ends, unless that would leave
    // no thread free for the connections.
    sys::MutexLock lock(s->mutex);
    if (s->stopping) return;  // join() owns the handles now
    if (!mayStepAside(*s)) continue;
    retire(*s);
    return;
  }
}

// Whether the calling thread, one that runs the I/O context and is in no
// command, may stop running it: only if another thread stays free for the
// connections. Under mutex.
//
// Busy scopes count themselves in without the mutex: they add to busy and
// then read total. So the other order is taken here: total is lowered
// first, as if this thread had gone, and busy is read after. With both
// sides sequentially consistent, either the command starting now sees the
// lowered total (and wakes the watcher) or busy read here includes it (and
// the thread stays). Lowering total after reading busy would let both miss
// each other and leave no thread to run the I/O context.
bool IoPool::mayStepAside(State& s) REQUIRES(s.mutex) {
  s.total = s.active() - 1;
  if (s.busy.load() >= s.total.load()) {
    s.countActive();
    return false;
  }
  return true;
}

// Runs the handlers that are ready, without waiting for more. False when
// the I/O context has stopped.
bool IoPool::drain(State& s, boost::asio::io_context& io) {
  for (;;) {
    try {
      io.poll();
      return !io.stopped();
    } catch (...) {
      s.tellEscaped();
    }
  }
}

// Moves the calling thread's handle to the threads to join. Under mutex.
void IoPool::retire(State& s) REQUIRES(s.mutex) {
  const auto it = s.threads.find(std::this_thread::get_id());
  if (it == s.threads.end()) return;
  s.finished.push_back(std::move(it->second));
  s.threads.erase(it);
  s.countActive();
}

// A spare that is not needed waits outside the I/O context, where it takes
// no part in the scheduling of handlers, until the watcher wakes it or
// spareIdle passes (then it ends). It stays in the I/O context while every
// other thread is in a command: parking then would leave nobody to serve
// the connections.
IoPool::Park IoPool::park(const std::shared_ptr<State>& s) {
  sys::MutexLock lock(s->mutex);
  if (s->stopping) return Park::End;
  if (!s->parkSpares.load()) return Park::Resume;
  if (!mayStepAside(*s)) return Park::Stay;
  ++s->parked;
  s->countActive();
  const bool woken = s->unpark.wait_for(lock.native(), s->options.spareIdle,
                                        [&]() REQUIRES(s->mutex) { return s->stopping || s->wakeups > 0; });
  if (s->stopping) return Park::End;
  if (woken) {
    --s->wakeups;  // the watcher counted this thread active again
    return Park::Resume;
  }
  --s->parked;
  retire(*s);
  return Park::End;
}

// Sleeps while some thread is free; while none is, looks every
// blockedAfter and starts a spare when a thread is blocked in its command or
// no command has ended meanwhile.
void IoPool::watcherMain(const std::shared_ptr<State>& s) {
  sys::MutexLock lock(s->mutex);
  unsigned quiet = 0;
  for (;;) {
    s->wake.wait(lock.native(), [&]() REQUIRES(s->mutex) { return s->stopping || s->watching.load(); });
    if (s->stopping) return;
    const bool allBusyBefore = s->busy.load() >= s->active();
    const std::uint64_t doneBefore = s->done.load();
    s->wake.wait_for(lock.native(), s->options.blockedAfter, [&]() REQUIRES(s->mutex) { return s->stopping; });
    if (s->stopping) return;
    const bool allBusy = s->busy.load() >= s->active();
    const std::size_t blocked = allBusy ? countBlocked(s->slots) : 0;
    const bool stalled = allBusy && allBusyBefore && s->done.load() == doneBefore;
    if (blocked > 0 || stalled) {
      quiet = 0;
      s->parkSpares = false;
      std::shared_ptr<boost::asio::io_context> io = s->io.lock();
      std::string problem;
      // A thread for every blocked one, so that the cores stay fed: parked
      // spares first, new ones for the rest.
      std::size_t wanted = std::max<std::size_t>(blocked, 1);
      for (; wanted > 0 && s->parked > 0; --wanted) {
        --s->parked;
        ++s->wakeups;
        s->unpark.notify_one();
      }
      s->countActive();
      for (; io && problem.empty() && wanted > 0; --wanted) problem = spawn(s, io, true);
      std::vector<std::thread> reap;
      reap.swap(s->finished);
      // The I/O context (and the server with it) may go with the last
      // reference: never under the mutex.
      lock.unlock();
      io.reset();
      for (auto& t : reap) joinOrDetach(t);
      if (!problem.empty()) s->tell(problem);
      lock.lock();
    } else if (allBusy) {
      quiet = 0;
    } else if (++quiet >= kQuietPolls) {
      // No command has needed a spare for a while: they step aside, and
      // the watcher sleeps until a command takes the last free thread.
      // That command adds to busy and then reads watching; so watching is
      // cleared first and busy read after, or a command starting now could
      // see the watcher still awake while the watcher misses the command,
      // and nobody would look again while every thread blocks.
      quiet = 0;
      s->watching = false;
      if (s->busy.load() >= s->active()) {
        s->watching = true;
      } else {
        s->parkSpares = true;
      }
    }
  }
}

IoPool::Busy::Busy(IoPool& pool) : state_(pool.state_.get()) {
  State& s = *state_;
  if (tSlot) tSlot->since = nowNs();
  const std::size_t busy = s.busy.fetch_add(1) + 1;
  if (busy < s.total.load() || s.watching.load()) return;
  sys::MutexLock lock(s.mutex);
  if (!s.watching.load()) {
    s.watching = true;
    s.wake.notify_one();
  }
}

IoPool::Busy::~Busy() {
  State& s = *state_;
  if (tSlot) tSlot->since = 0;
  s.done.fetch_add(1);
  const std::size_t busy = s.busy.fetch_sub(1) - 1;
  // A starvation is over once a thread is free again.
  if (busy < s.total.load() && s.starved.load()) s.starved = false;
}

void IoPool::join() {
  const bool own = runningInThisThread();
  std::vector<std::thread> all;
  {
    sys::MutexLock lock(state_->mutex);
    state_->stopping = true;
    if (state_->watcher.joinable()) all.push_back(std::move(state_->watcher));
    for (auto& [id, t] : state_->threads) all.push_back(std::move(t));
    state_->threads.clear();
    for (auto& t : state_->finished) all.push_back(std::move(t));
    state_->finished.clear();
    state_->total = 0;
  }
  state_->wake.notify_all();
  state_->unpark.notify_all();
  for (auto& t : all) {
    if (own) {
      t.detach();
    } else {
      joinOrDetach(t);
    }
  }
}

bool IoPool::runningInThisThread() const noexcept { return tPoolOf == state_.get(); }

std::size_t IoPool::threadCount() const {
  sys::MutexLock lock(state_->mutex);
  return state_->threads.size();
}

std::size_t IoPool::activeCount() const {
  sys::MutexLock lock(state_->mutex);
  return state_->active();
}

std::size_t IoPool::busyCount() const { return state_->busy.load(); }

}  // namespace Ipc::detail
