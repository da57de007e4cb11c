#include "framework/svc_stub.h"

#include <boost/asio/executor_work_guard.hpp>
#include <optional>

#include "framework/acceptor.h"
#include "framework/connection.h"
#include "framework/log.h"
#include "framework/thread_annotations.h"
#include "framework/transport_core.h"

namespace Ipc {
namespace {

using WorkGuard = boost::asio::executor_work_guard<boost::asio::io_context::executor_type>;

}  // namespace

class SvcStub::Impl {
 public:
  Impl(std::uint16_t port, bool forceIp4, CmdFactory factory, IpcErrorHandler onError, const Options& options)
      : core_(std::make_shared<detail::ServerCore>(options, std::move(factory), std::move(onError))),
        acceptor_(std::make_shared<detail::Acceptor>(core_)),
        work_(std::in_place, core_->io.get_executor()) {
    const bool ip4Only = acceptor_->open(port, forceIp4);
    try {
      // The threads keep the core, and with it the I/O context, alive.
      core_->threads.start(std::shared_ptr<boost::asio::io_context>(core_, &core_->io));
    } catch (...) {
      acceptor_->stop();
      bool first = false;
      core_->beginStop(&first);
      work_.reset();
      core_->threads.join();
      throw;
    }
    acceptor_->start();
    Log::Lock entry(Log::Notice);
    entry.logStreamLine() << "Listening on port " << acceptor_->port() << " (" << options.tls.modeName()
                          << (ip4Only ? ", IPv4 only)" : ")");
  }

  ~Impl() {
    signalStop();
    waitToFinish();
  }

  std::uint16_t port() const noexcept { return acceptor_->port(); }

  bool signalStop() {
    bool first = false;
    auto open = core_->beginStop(&first);
    if (!first) return false;
    acceptor_->stop();
    for (const auto& c : open) c->stop("Server is stopping");
    return true;
  }

  void waitToFinish() EXCLUDES(waitMutex_) {
    sys::MutexLock lock(waitMutex_);
    if (finished_) return;
    // Connections end within their close grace; an I/O thread of ours would
    // be waiting for itself, so it only stops what it can.
    if (!core_->threads.runningInThisThread()) core_->waitUntilEmpty();
    // The threads end when the I/O context runs out of work: after the
    // commands that are running (they are short: a handler's store call).
    // Commands not yet started belong to closed connections and are dropped.
    work_.reset();
    core_->threads.join();
    finished_ = true;
  }

  std::size_t connectionCount() const { return core_->connectionCount(); }
  const detail::ServerCore& core() const { return *core_; }

 private:
  std::shared_ptr<detail::ServerCore> core_;
  std::shared_ptr<detail::Acceptor> acceptor_;
  std::optional<WorkGuard> work_ GUARDED_BY(waitMutex_);
  sys::Mutex waitMutex_;
  bool finished_ GUARDED_BY(waitMutex_) = false;
};

SvcStub::SvcStub(std::uint16_t port, bool forceIp4, CmdFactory factory, IpcErrorHandler onError)
    : SvcStub(port, forceIp4, std::move(factory), std::move(onError), Options{}) {}

SvcStub::SvcStub(std::uint16_t port, bool forceIp4, CmdFactory factory, IpcErrorHandler onError, Options options)
    : impl_(std::make_unique<Impl>(port, forceIp4, std::move(factory), std::move(onError), options)) {}

SvcStub::~SvcStub() = default;

std::uint16_t SvcStub::port() const noexcept { return impl_->port(); }

bool SvcStub::signalStop() { return impl_->signalStop(); }

void SvcStub::waitToFinish() { impl_->waitToFinish(); }

std::size_t SvcStub::connectionCount() const { return impl_->connectionCount(); }

std::uint64_t SvcStub::bufferedBytes() const { return impl_->core().budget.used(); }

std::size_t SvcStub::connectionsWaitingForMemory() const { return impl_->core().budget.waiting(); }

std::uint64_t SvcStub::memoryLimit() const { return impl_->core().budget.limit(); }

std::uint64_t SvcStub::bytesReceived() const { return impl_->core().bytesIn.load(std::memory_order_relaxed); }

std::uint64_t SvcStub::bytesSent() const { return impl_->core().bytesOut.load(std::memory_order_relaxed); }

void SvcStub::onRespReady(const std::shared_ptr<CmdI>& cmd) {
  if (!cmd) return;
  const auto connection = std::dynamic_pointer_cast<detail::Connection>(cmd->socket());
  if (!connection) return;  // not one of ours, or no connection at all
  connection->markAnswered(cmd.get());
  // A progress command's answer is the stream it sends itself; its end lets
  // the connection go on.
  if (cmd->streamsProgress()) return;
  wire::OutFrame answer;
  try {
    answer = cmd->answerFrame();
  } catch (const std::exception& e) {
    connection->fail("Cannot encode the answer of " + cmd->name() + " for " + connection->peer() + ": " + e.what() +
                         "; connection ended",
                     "Terminating client connection due to processing error");
    return;
  }
  connection->respond(std::move(answer));
}

}  // namespace Ipc
