#pragma once
// Internal to the transport: the state that the command server, its
// connections and its threads share.
//
// Ownership: shared by the SvcStub, by every connection and by every I/O
// thread, so a connection that a command keeps after the server has gone
// (a maintenance thread) still finds a valid I/O context (where nothing
// runs any more; its sends are dropped).
// Thread safety: every member may be called from any thread.

#include <atomic>
#include <boost/asio/io_context.hpp>
#include <boost/asio/ssl/context.hpp>
#include <condition_variable>
#include <cstddef>
#include <limits>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "framework/io_pool.h"
#include "framework/memory_budget.h"
#include "framework/svc_stub.h"
#include "framework/thread_annotations.h"

namespace Ipc::detail {

class Connection;

class ServerCore {
 public:
  // Throws std::runtime_error when the TLS files cannot be used.
  ServerCore(const SvcStub::Options& options, CmdFactory factory, IpcErrorHandler onError);
  ServerCore(const ServerCore&) = delete;
  ServerCore& operator=(const ServerCore&) = delete;

  boost::asio::io_context io;
  const SvcStub::Options options;
  // The OpenSSL context of every connection when options.tls is on; null
  // for plain TCP.
  const std::unique_ptr<boost::asio::ssl::context> tls;
  const CmdFactory factory;
  // The threads that run io, and the commands.
  IoPool threads;
  // What the connections hold in buffers (Options::memoryBudget).
  MemoryBudget budget;
  // Bytes read from and written to clients' sockets, for the metrics.
  std::atomic<std::uint64_t> bytesIn{0};
  std::atomic<std::uint64_t> bytesOut{0};
  // Returns memory to the system after large releases (Options::trimDelay).
  MemoryTrimmer trimmer;

  // Reports that a request waits for the budget: at most once a minute, so
  // that a server that keeps hitting it says so without flooding the log.
  void noteMemoryWait() noexcept;
  // Gives bytes back to the budget; counts them towards the next trim.
  void releaseMemory(std::uint64_t bytes) {
    budget.release(bytes);
    trimmer.released(bytes);
  }

  // Hands a problem to the error handler (or logs it when there is none).
  // Never throws.
  void report(const std::shared_ptr<Socket>& socket, const std::string& text) const noexcept;

  // Adds an accepted connection; false once the server is stopping.
  bool add(const std::shared_ptr<Connection>& connection) EXCLUDES(mutex_);
  // Removes a connection whose socket has been closed.
  void remove(const Connection* connection) EXCLUDES(mutex_);
  // Marks the server as stopping and returns the open connections. Returns
  // nothing when it was stopping already (then *first is false).
  std::vector<std::shared_ptr<Connection>> beginStop(bool* first) EXCLUDES(mutex_);
  bool stopping() const EXCLUDES(mutex_);
  // Blocks until the server is stopping and every connection is removed.
  void waitUntilEmpty() EXCLUDES(mutex_);
  std::size_t connectionCount() const EXCLUDES(mutex_);

 private:
  const IpcErrorHandler onError_;
  std::atomic<std::int64_t> lastMemoryNote_{std::numeric_limits<std::int64_t>::min()};  // steady clock, ms
  mutable sys::Mutex mutex_;
  std::condition_variable changed_;  // with mutex_: a connection was removed, or the stop began
  std::unordered_map<const Connection*, std::weak_ptr<Connection>> connections_ GUARDED_BY(mutex_);
  bool stopping_ GUARDED_BY(mutex_) = false;
};

}  // namespace Ipc::detail
