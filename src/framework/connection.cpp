// The connection's life: construction, the Socket face, the running
// command's bookkeeping, the TLS handshake, ending (Bye, drain, finish) and
// the stall timer.
// Reading and framing are in connection_read.cpp, the write queue in
// connection_write.cpp.

#include "framework/connection.h"

#include <boost/asio/defer.hpp>
#include <boost/asio/post.hpp>

#include "framework/frame.h"
#include "framework/tls_context.h"
#include "framework/transport_core.h"
#include "framework/wire.h"

namespace Ipc::detail {
namespace {

namespace asio = boost::asio;
using Clock = std::chrono::steady_clock;

std::string describePeer(const StrandSocket& socket) {
  boost::system::error_code ec;
  const auto ep = socket.remote_endpoint(ec);
  if (ec) return "unknown peer";
  auto address = ep.address();
  if (address.is_v6() && address.to_v6().is_v4_mapped()) {
    address = asio::ip::make_address_v4(asio::ip::v4_mapped, address.to_v6());
  }
  const std::string port = std::to_string(ep.port());
  if (address.is_v6()) return "[" + address.to_string() + "]:" + port;
  return address.to_string() + ":" + port;
}

std::string millis(std::chrono::milliseconds d) { return std::to_string(d.count()) + " ms"; }

}  // namespace

wire::OutFrame Connection::textFrame(std::uint8_t tag, wire::FrameKind kind, const std::string& text) {
  wire::OutFrame frame;
  wire::beginFrame(frame.head, tag, kind);
  wire::Writer(frame.head).str(text);
  wire::endFrame(frame);
  return frame;
}

Connection::Connection(std::shared_ptr<ServerCore> core, StrandSocket socket)
    : core_(std::move(core)),
      stream_(std::move(socket), core_->tls.get()),
      stallTimer_(stream_.socket().get_executor()),
      closeTimer_(stream_.socket().get_executor()),
      peer_(describePeer(stream_.socket())),
      stage_(std::make_shared<unsigned char[]>(kStageSize)) {
  // Writes are tried at once, which must never block the thread. A TLS
  // session writes through its own asynchronous operations only: a write
  // that the socket takes in part would leave a record half sent.
  if (stream_.tls()) return;
  boost::system::error_code ec;
  stream_.socket().non_blocking(true, ec);
  writeAtOnce_ = !ec;
}

Connection::~Connection() {
  // The slot may hold a database session, whose release can wait for a lock
  // of the engine (its pool's, held while another database opens, which
  // may replay a large log). On an I/O thread that wait counts as busy, as
  // a command's would, so that the other connections get a thread of their
  // own meanwhile.
  if (connInf() && core_->threads.runningInThisThread()) {
    const IoPool::Busy busy(core_->threads);
    connInf().reset();
  }
  // Normally finish() has done this; a connection that never got that far
  // must not keep the server waiting for it.
  core_->remove(this);
}

template <typename F>
void Connection::onStrand(F&& f, bool last) {
  if (stream_.socket().get_executor().running_in_this_thread()) {
    if (!finished_) f();
    return;
  }
  std::lock_guard lock(postMutex_);
  if (!accepting_) return;
  auto task = [self = shared_from_this(), f = std::forward<F>(f)]() mutable {
    if (!self->finished_) f();
  };
  if (last) {
    asio::defer(stream_.socket().get_executor(), std::move(task));
  } else {
    asio::post(stream_.socket().get_executor(), std::move(task));
  }
}

void Connection::start() {
  if (!core_->add(shared_from_this())) {
    boost::system::error_code ec;
    {
      std::lock_guard lock(postMutex_);
      accepting_ = false;
    }
    open_ = false;
    finished_ = true;
    stream_.socket().close(ec);
    return;
  }
  onStrand([this] {
    if (stream_.tls()) {
      startHandshake();
    } else {
      startRead();
    }
  });
}

void Connection::startHandshake() {
  handshaking_ = true;
  handshakeSince_ = Clock::now();
  stream_.asyncHandshake([self = shared_from_this()](const boost::system::error_code& ec) { self->onHandshake(ec); });
  armStallTimer();
}

void Connection::onHandshake(const boost::system::error_code& ec) {
  handshaking_ = false;
  // Closed meanwhile: by the stall timer (which has reported it) or a stop.
  if (finished_) return;
  if (ec) {
    core_->report(shared_from_this(), "TLS handshake with " + peer_ +
                                          " failed: " + tlsFailureText(ec, stream_.session()) + "; connection ended");
    finish();
    return;
  }
  startRead();
}

// ---------------------------------------------------------------- Socket

void Connection::send(wire::OutFrame frame) {
  onStrand([this, f = std::move(frame)]() mutable { enqueue(std::move(f)); });
}

void Connection::close(const std::string& reason) {
  if (!open_.exchange(false)) return;
  onStrand([this, reason] { beginClose(reason); });
}

void Connection::stop(const std::string& reason) {
  onStrand([this, reason] {
    if (closing_ || finished_ || stopPending_) return;
    // A progress stream belongs to a maintenance operation, which the
    // service stops at its next safe point: its client learns of the stop
    // from the Bye.
    if (!busy_ || streaming_) {
      beginClose(reason);
      return;
    }
    stopPending_ = true;
    stopReason_ = reason;
    closeTimer_.expires_after(core_->options.stopGrace);
    closeTimer_.async_wait([self = shared_from_this()](const boost::system::error_code& ec) {
      if (ec || self->closing_ || self->finished_) return;
      self->beginClose(self->stopReason_);
    });
  });
}

void Connection::commandDone() {
  onStrand([this] { endCommand(); });
}

void Connection::respond(wire::OutFrame answer) {
  // Called as the command's last step: deferred, the answer is written by
  // this same thread as soon as the command returns.
  onStrand(
      [this, f = std::move(answer)]() mutable {
        enqueue(std::move(f));
        endCommand();
      },
      true);
}

void Connection::endCommand() {
  if (!busy_) return;
  busy_ = false;
  streaming_ = false;
  inFlight_ = nullptr;
  releaseReserved();
  if (closing_ || finished_) releaseSlot();
  if (stopPending_ && !closing_ && !finished_) {
    // The answer is queued ahead of the Bye.
    beginClose(stopReason_);
    return;
  }
  goOn();
}

void Connection::releaseSlot() {
  if (busy_ || !connInf()) return;
  // As in the destructor: the release may wait for the engine's lock.
  if (core_->threads.runningInThisThread()) {
    const IoPool::Busy busy(core_->threads);
    connInf().reset();
  } else {
    connInf().reset();
  }
}

// Takes the next request if the connection may, reading more when needed.
void Connection::goOn() {
  try {
    parse();
    startRead();
    settleAfterEof();
  } catch (const std::exception& e) {
    // Memory for a frame's bytes is the one thing that can run out here.
    fail("Connection from " + peer_ + " cannot go on: " + e.what() + "; connection ended", "Server out of resources");
  }
}

void Connection::markAnswered(const CmdI* cmd) noexcept {
  if (inFlight_.load() == cmd) answered_ = true;
}

bool Connection::unanswered(const CmdI* cmd) const noexcept {
  return inFlight_.load() == cmd && !answered_.load() && open_.load();
}

void Connection::fail(const std::string& text, const std::string& byeReason) {
  core_->report(shared_from_this(), text);
  close(byeReason);
}

// ---------------------------------------------------------------- ending

void Connection::beginClose(const std::string& reason) {
  if (closing_ || finished_) return;
  // Before the handshake no frame can reach the peer.
  if (handshaking_) {
    finish();
    return;
  }
  closing_ = true;
  open_ = false;
  inBody_ = false;
  // A read into it may be in flight; that read keeps its own share.
  body_.reset();
  if (!busy_) releaseReserved();
  closeTimer_.expires_after(core_->options.closeGrace);
  closeTimer_.async_wait([self = shared_from_this()](const boost::system::error_code& ec) {
    if (!ec) self->finish();
  });
  // Before the Bye: a client that has read it finds the session gone.
  releaseSlot();
  wire::OutFrame bye = textFrame(0, wire::FrameKind::Bye, reason);
  addQueued(bye.size());
  out_.push_back(std::move(bye));
  if (!writing_) startWrite();
}

void Connection::startDrain() {
  if (reading_ || finished_) return;
  if (!stage_) return;
  reading_ = true;
  stageBegin_ = stageEnd_ = 0;
  readInto(stage_, stage_.get(), kStageSize);
}

void Connection::finish() {
  if (finished_) return;
  finished_ = true;
  {
    std::lock_guard lock(postMutex_);
    accepting_ = false;
  }
  open_ = false;
  stallTimer_.cancel();
  closeTimer_.cancel();
  boost::system::error_code ignored;
  stream_.socket().close(ignored);
  // Frames that a write in flight gathers from go when it completes; a
  // read in flight holds its own share of its buffer.
  if (!writing_) out_.clear();
  leaveBudget();
  body_.reset();
  stage_.reset();
  auto self = shared_from_this();
  core_->remove(this);
  if (auto processor = processor_.lock()) {
    try {
      processor->onDisconnect(self);
    } catch (...) {
      // A notification has no one to fail to.
    }
  }
}

// ---------------------------------------------------------------- stalls

void Connection::armStallTimer() {
  if (stallArmed_ || finished_ || closing_) return;
  std::optional<Clock::time_point> deadline;
  if (handshaking_) deadline = handshakeSince_ + core_->options.stallTimeout;
  if (reading_ && partialFrame()) deadline = readSince_ + core_->options.stallTimeout;
  if (writing_) {
    const auto w = writeSince_ + core_->options.stallTimeout;
    if (!deadline || w < *deadline) deadline = w;
  }
  if (!deadline) return;
  stallArmed_ = true;
  stallTimer_.expires_at(*deadline);
  stallTimer_.async_wait([self = shared_from_this()](const boost::system::error_code& ec) { self->onStallTimer(ec); });
}

void Connection::onStallTimer(const boost::system::error_code& ec) {
  stallArmed_ = false;
  if (ec || finished_ || closing_) return;
  const auto now = Clock::now();
  const auto limit = core_->options.stallTimeout;
  if (handshaking_ && now - handshakeSince_ >= limit) {
    core_->report(shared_from_this(),
                  "TLS handshake with " + peer_ + " did not complete within " + millis(limit) + "; connection ended");
    finish();
    return;
  }
  if (reading_ && partialFrame() && now - readSince_ >= limit) {
    fail("Connection from " + peer_ + " sent part of a frame and nothing more for " + millis(limit) +
             "; connection ended",
         "Frame incomplete for too long");
    return;
  }
  if (writing_ && now - writeSince_ >= limit) {
    fail("Connection from " + peer_ + " has not read its answers for " + millis(limit) + "; connection ended",
         "Answers not read for too long");
    return;
  }
  armStallTimer();
}

}  // namespace Ipc::detail
