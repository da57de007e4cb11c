#include "framework/transport_core.h"

#include <algorithm>
#include <chrono>
#include <string>
#include <thread>

#include "framework/log.h"
#include "framework/tls_context.h"

namespace Ipc::detail {
namespace {

// Bytes released after which freed memory is handed back to the system: a
// few large answers or one large request, not the steady trickle of small
// ones.
constexpr std::uint64_t kTrimAfterReleased = std::uint64_t{16} << 20;

unsigned ioThreadCount(unsigned asked) {
  if (asked > 0) return asked;
  return std::max(2u, std::thread::hardware_concurrency());
}

}  // namespace

ServerCore::ServerCore(const SvcStub::Options& opts, CmdFactory f, IpcErrorHandler onError)
    : options(opts),
      tls(makeServerTlsContext(opts.tls)),
      factory(std::move(f)),
      threads(IoPool::Options{ioThreadCount(opts.ioThreads), opts.maxThreads, opts.spareIdle, opts.blockedAfter},
              [this](const std::string& text) { report(nullptr, text); }),
      budget(opts.memoryBudget),
      trimmer(kTrimAfterReleased, opts.trimDelay),
      onError_(std::move(onError)) {}

void ServerCore::report(const std::shared_ptr<Socket>& socket, const std::string& text) const noexcept {
  try {
    if (onError_) {
      onError_(socket, text);
    } else {
      Log::Lock entry(Log::Warning);
      entry.logStreamLine() << "Ipc " << text;
    }
  } catch (...) {
    // Reporting is best effort: the connection concerned ends anyway.
  }
}

void ServerCore::noteMemoryWait() noexcept {
  using namespace std::chrono;
  const std::int64_t now = duration_cast<milliseconds>(steady_clock::now().time_since_epoch()).count();
  std::int64_t last = lastMemoryNote_.load();
  if (last > now - 60000 || !lastMemoryNote_.compare_exchange_strong(last, now)) return;
  report(nullptr, "Memory budget of " + std::to_string(budget.limit() >> 20) + " MiB reached (" +
                      std::to_string(budget.used() >> 20) +
                      " MiB buffered): new requests wait until answers are read or requests end");
}

bool ServerCore::add(const std::shared_ptr<Connection>& connection) {
  sys::MutexLock lock(mutex_);
  if (stopping_) return false;
  connections_.emplace(connection.get(), connection);
  return true;
}

void ServerCore::remove(const Connection* connection) {
  {
    sys::MutexLock lock(mutex_);
    if (connections_.erase(connection) == 0) return;
  }
  changed_.notify_all();
}

std::vector<std::shared_ptr<Connection>> ServerCore::beginStop(bool* first) {
  std::vector<std::shared_ptr<Connection>> open;
  {
    sys::MutexLock lock(mutex_);
    *first = !stopping_;
    if (stopping_) return open;
    stopping_ = true;
    open.reserve(connections_.size());
    for (const auto& [key, weak] : connections_) {
      if (auto c = weak.lock()) open.push_back(std::move(c));
    }
  }
  changed_.notify_all();
  return open;
}

bool ServerCore::stopping() const {
  sys::MutexLock lock(mutex_);
  return stopping_;
}

void ServerCore::waitUntilEmpty() {
  sys::MutexLock lock(mutex_);
  changed_.wait(lock.native(), [this]() REQUIRES(mutex_) { return stopping_ && connections_.empty(); });
}

std::size_t ServerCore::connectionCount() const {
  sys::MutexLock lock(mutex_);
  return connections_.size();
}

}  // namespace Ipc::detail
