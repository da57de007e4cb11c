#include "framework/svc_stub.h"

#include <boost/asio/executor_work_guard.hpp>
#include <algorithm>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

#include "framework/acceptor.h"
#include "framework/connection.h"
#include "framework/log.h"
#include "framework/transport_core.h"

namespace Ipc {
namespace {

using WorkGuard = boost::asio::executor_work_guard<boost::asio::io_context::executor_type>;

// The server whose I/O thread this is, if any: such a thread must not wait
// for the I/O threads to end.
thread_local const detail::ServerCore* tIoThreadOf = nullptr;

void ioThreadMain(const std::shared_ptr<detail::ServerCore>& core) {
  tIoThreadOf = core.get();
  for (;;) {
    try {
      core->io.run();
      return;
    } catch (const std::exception& e) {
      core->report(nullptr, std::string("Unexpected failure in an I/O thread: ") + e.what());
    } catch (...) {
      core->report(nullptr, "Unexpected failure in an I/O thread");
    }
  }
}

unsigned ioThreadCount(unsigned asked) {
  if (asked > 0) return asked;
  return std::max(2u, std::thread::hardware_concurrency());
}

}  // namespace

class SvcStub::Impl {
 public:
  Impl(std::uint16_t port, bool forceIp4, CmdFactory factory, IpcErrorHandler onError, const Options& options)
      : core_(std::make_shared<detail::ServerCore>(options, std::move(factory), std::move(onError))),
        acceptor_(std::make_shared<detail::Acceptor>(core_)),
        work_(std::in_place, core_->io.get_executor()) {
    const bool ip4Only = acceptor_->open(port, forceIp4);
    const unsigned count = ioThreadCount(options.ioThreads);
    try {
      for (unsigned i = 0; i < count; ++i) {
        threads_.emplace_back([core = core_] { ioThreadMain(core); });
      }
    } catch (...) {
      acceptor_->stop();
      bool first = false;
      core_->beginStop(&first);
      work_.reset();
      for (auto& t : threads_) t.join();
      throw;
    }
    acceptor_->start();
    Log::Lock entry(Log::Notice);
    entry.logStreamLine() << "Listening on port " << acceptor_->port() << (ip4Only ? " (IPv4 only)" : "");
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
    for (const auto& c : open) c->close("Server is stopping");
    return true;
  }

  void waitToFinish() {
    std::lock_guard lock(waitMutex_);
    if (finished_) return;
    const bool onOwnThread = tIoThreadOf == core_.get();
    // Connections end within their close grace; an I/O thread of ours would
    // be waiting for itself, so it only stops what it can.
    if (!onOwnThread) core_->waitUntilEmpty();
    // Commands still running are short (a handler's store call); they are
    // waited for. Commands queued behind them belong to ended connections.
    core_->workers.shutdown();
    work_.reset();
    for (auto& t : threads_) {
      if (t.get_id() == std::this_thread::get_id()) {
        t.detach();  // the thread keeps the shared state alive
      } else {
        t.join();
      }
    }
    threads_.clear();
    finished_ = true;
  }

  std::size_t connectionCount() const { return core_->connectionCount(); }

 private:
  std::shared_ptr<detail::ServerCore> core_;
  std::shared_ptr<detail::Acceptor> acceptor_;
  std::optional<WorkGuard> work_;
  std::vector<std::thread> threads_;
  std::mutex waitMutex_;
  bool finished_ = false;  // guarded by waitMutex_
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
