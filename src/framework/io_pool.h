#pragma once
// Internal to the transport: the elastic set of threads that run the I/O
// context, and on which commands run too.
//
// Commands run on the I/O thread that read them, which saves handing each
// one to another thread and back. A command may block, though (a commit's
// sync, a wait for a database's write lock, a transaction's retry pause, a
// maintenance hold), and a blocked thread serves nobody else. So a command
// runs inside a Busy scope, and while every thread is in one, a watcher
// thread looks every `blockedAfter` and starts spare threads:
//   - one when no command has finished since the last look (commands that
//     sleep, wait for a lock or compute for long); and
//   - one for every thread whose command waits for the disk (a commit's
//     sync; state D in /proc/self/task/<tid>/stat), so that writers of
//     different databases sync side by side.
// Other connections thus wait at most about `blockedAfter` for blocked
// commands. Threads that are merely computing, waiting for a core or for a
// mutex held by a thread that waits for a core, start no spare: starting
// one whenever every thread is in a command would grow the pool to a
// thread per busy connection under load on few cores, and latency suffers
// from the crowd. The watcher sleeps while some thread is free.
// When no command has needed a spare for about 100 looks, the spares park
// outside the I/O context after their current handler and what it deferred
// (a crowd of idle
// threads in the I/O context's scheduling slows every request down), and
// the watcher wakes parked spares before it starts new ones. A spare never
// parks or ends while every other thread is in a command: some thread must
// always be free to run the I/O context. Spares that have run nothing, or
// stayed parked, for `spareIdle` end; the `base` threads stay until the I/O
// context stops.
//
// At most `maxThreads` threads exist. At that limit, or when the system
// refuses a thread, the connections wait for a command to end; the problem
// is reported once until a thread is free again.
//
// Ownership: owned by the server core. Each thread keeps the I/O context
// (through the shared pointer given to start()) and the pool's own state
// alive, so a command that releases the last owner of the server is safe.
// Thread safety: every member may be called from any thread.
// Failures: start() throws std::system_error when not even one thread can
// be started; exceptions that escape a handler are reported through the
// error callback and the thread goes on.

#include <boost/asio/io_context.hpp>
#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>

namespace Ipc::detail {

class IoPool {
  struct State;

 public:
  struct Options {
    // Threads that run the I/O context for its whole life; at least 1.
    unsigned base = 2;
    std::size_t maxThreads = 2048;
    std::chrono::milliseconds spareIdle{30000};
    std::chrono::microseconds blockedAfter{1000};
  };
  using ErrorReport = std::function<void(const std::string&)>;

  IoPool(Options options, ErrorReport report);
  // Waits for the threads as join() does.
  ~IoPool();
  IoPool(const IoPool&) = delete;
  IoPool& operator=(const IoPool&) = delete;

  // Starts the base threads on io, which they keep alive.
  void start(std::shared_ptr<boost::asio::io_context> io);

  // Marks the calling thread, one of the pool's, as busy in a command for
  // the scope's life. The scope may outlive the IoPool object (a command
  // that releases the server's last owner).
  class Busy {
   public:
    explicit Busy(IoPool& pool);
    ~Busy();
    Busy(const Busy&) = delete;
    Busy& operator=(const Busy&) = delete;

   private:
    State* state_;  // kept alive by the thread
  };

  // Starts no more threads and waits until every thread has ended, which
  // they do when the I/O context runs out of work or is stopped. On one of
  // the pool's own threads it waits for nothing (the others may be waiting
  // for the very handler that called it): the threads are detached and end
  // by themselves. Idempotent.
  void join();

  // True on one of this pool's threads.
  bool runningInThisThread() const noexcept;

  // Threads, parked spares included; threads that run the I/O context; threads in commands.
  std::size_t threadCount() const;
  std::size_t activeCount() const;
  std::size_t busyCount() const;

 private:
  // Those that need the state's mutex held say so (REQUIRES) where they are
  // defined: the state's members are not known here.
  static void threadMain(const std::shared_ptr<State>& s, const std::shared_ptr<boost::asio::io_context>& io,
                         bool spare);
  static void watcherMain(const std::shared_ptr<State>& s);
  static bool drain(State& s, boost::asio::io_context& io);
  enum class Park { Resume, Stay, End };
  static Park park(const std::shared_ptr<State>& s);
  static bool mayStepAside(State& s);
  static void retire(State& s);
  // Called with the state's mutex held. Returns a problem to report, if
  // any; a base thread that cannot be started throws std::system_error.
  static std::string spawn(const std::shared_ptr<State>& s, const std::shared_ptr<boost::asio::io_context>& io,
                           bool spare);

  std::shared_ptr<State> state_;
};

}  // namespace Ipc::detail
