#include "framework/connection.h"

#include <boost/asio/defer.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/write.hpp>
#include <cstring>

#include "framework/frame.h"
#include "framework/request_decoder.h"
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

wire::OutFrame textFrame(std::uint8_t tag, wire::FrameKind kind, const std::string& text) {
  wire::OutFrame frame;
  wire::beginFrame(frame.head, tag, kind);
  wire::Writer(frame.head).str(text);
  wire::endFrame(frame);
  return frame;
}

std::string millis(std::chrono::milliseconds d) { return std::to_string(d.count()) + " ms"; }

// A view of the first count buffers of an array, as an Asio buffer sequence.
struct BufferSpan {
  const asio::const_buffer* first;
  std::size_t count;
  const asio::const_buffer* begin() const { return first; }
  const asio::const_buffer* end() const { return first + count; }
};

}  // namespace

Connection::Connection(std::shared_ptr<ServerCore> core, StrandSocket socket)
    : core_(std::move(core)),
      socket_(std::move(socket)),
      stallTimer_(socket_.get_executor()),
      closeTimer_(socket_.get_executor()),
      peer_(describePeer(socket_)),
      stage_(std::make_shared<unsigned char[]>(kStageSize)) {
  // Writes are tried at once, which must never block the thread.
  boost::system::error_code ec;
  socket_.non_blocking(true, ec);
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
  if (socket_.get_executor().running_in_this_thread()) {
    if (!finished_) f();
    return;
  }
  std::lock_guard lock(postMutex_);
  if (!accepting_) return;
  auto task = [self = shared_from_this(), f = std::forward<F>(f)]() mutable {
    if (!self->finished_) f();
  };
  if (last) {
    asio::defer(socket_.get_executor(), std::move(task));
  } else {
    asio::post(socket_.get_executor(), std::move(task));
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
    socket_.close(ec);
    return;
  }
  onStrand([this] { startRead(); });
}

// ---------------------------------------------------------------- Socket

void Connection::send(wire::OutFrame frame) {
  onStrand([this, f = std::move(frame)]() mutable { enqueue(std::move(f)); });
}

void Connection::close(const std::string& reason) {
  if (!open_.exchange(false)) return;
  onStrand([this, reason] { beginClose(reason); });
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
  inFlight_ = nullptr;
  goOn();
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

// ---------------------------------------------------------------- reading

void Connection::startRead() {
  if (reading_ || peerDone_ || !mayTakeRequest()) return;
  reading_ = true;
  readSince_ = Clock::now();
  if (inBody_) {
    if (bodyGot_ == body_->size()) {
      // The frame's bytes go into a buffer that grows with what has arrived,
      // so that a length field alone never reserves the announced size.
      const std::uint64_t capacity = std::min<std::uint64_t>(bodyLen_, body_->size() * 2);
      auto bigger = std::make_shared<MemBuffer>(capacity);
      std::memcpy(bigger->data(), body_->data(), static_cast<std::size_t>(bodyGot_));
      body_ = std::move(bigger);
    }
    readInto(body_, body_->data() + bodyGot_, static_cast<std::size_t>(body_->size() - bodyGot_));
  } else {
    if (stageBegin_ > 0) {
      std::memmove(stage_.get(), stage_.get() + stageBegin_, stageEnd_ - stageBegin_);
      stageEnd_ -= stageBegin_;
      stageBegin_ = 0;
    }
    readInto(stage_, stage_.get() + stageEnd_, kStageSize - stageEnd_);
  }
  if (partialFrame()) armStallTimer();
}

void Connection::readInto(std::shared_ptr<const void> owner, unsigned char* data, std::size_t size) {
  socket_.async_read_some(asio::buffer(data, size), [self = shared_from_this(), owner = std::move(owner)](
                                                        const boost::system::error_code& ec, std::size_t n) {
    // owner kept the bytes alive until here, whatever has become of the
    // connection's own share meanwhile.
    self->onRead(ec, n);
  });
}

void Connection::onRead(const boost::system::error_code& ec, std::size_t n) {
  reading_ = false;
  if (finished_) return;
  if (closing_) {
    // Draining after a Bye: what the peer still sends is dropped.
    if (ec) {
      peerDone_ = true;
      if (byeFlushed_) finish();
      return;
    }
    startDrain();
    return;
  }
  if (ec) {
    peerDone_ = true;
    if (ec == asio::error::eof) {
      goOn();
      return;
    }
    if (partialFrame()) {
      core_->report(shared_from_this(), "Connection from " + peer_ + " broke in the middle of a frame (" +
                                            ec.message() + ")");
    }
    finish();
    return;
  }
  if (inBody_) {
    bodyGot_ += n;
  } else {
    stageEnd_ += n;
  }
  goOn();
}

void Connection::parse() {
  while (mayTakeRequest()) {
    if (inBody_) {
      if (bodyGot_ < bodyLen_) return;
      inBody_ = false;
      const std::uint32_t size = bodyLen_;
      auto owner = SharedMemBuffer(std::move(*body_)).owner();
      body_.reset();
      handleFrame(std::move(owner), size);
      continue;
    }
    const std::size_t avail = stageEnd_ - stageBegin_;
    if (avail < wire::kLengthSize) return;
    const std::uint32_t length = wire::frameLength(stage_.get() + stageBegin_);
    if (!frameLengthValid(length)) {
      fail("Malformed frame from " + peer_ + ": length " + std::to_string(length) + " is out of range (2 to " +
               std::to_string(wire::kMaxBody) + "); connection ended",
           "Malformed frame: length out of range");
      return;
    }
    const std::size_t got = avail - wire::kLengthSize;
    const unsigned char* start = stage_.get() + stageBegin_ + wire::kLengthSize;
    if (got >= length) {
      std::shared_ptr<unsigned char> owner(ExportedUCharAlloc::alloc(length), ExportedUCharAlloc());
      std::memcpy(owner.get(), start, length);
      stageBegin_ += wire::kLengthSize + length;
      if (stageBegin_ == stageEnd_) stageBegin_ = stageEnd_ = 0;
      handleFrame(std::move(owner), length);
      continue;
    }
    if (wire::kLengthSize + length <= kStageSize) return;  // the rest fits in the stage
    // A large frame: what has arrived moves into a buffer of its own, and the
    // rest is read straight into it.
    body_ = std::make_shared<MemBuffer>(std::min<std::uint64_t>(length, std::max<std::uint64_t>(kFirstBodyChunk, got)));
    std::memcpy(body_->data(), start, got);
    bodyLen_ = length;
    bodyGot_ = got;
    inBody_ = true;
    stageBegin_ = stageEnd_ = 0;
  }
}

void Connection::handleFrame(std::shared_ptr<unsigned char> body, std::uint32_t size) {
  using Outcome = DecodedRequest::Outcome;
  DecodedRequest r = decodeRequest(body, size, core_->factory);
  body.reset();
  const std::string tag = std::to_string(r.tag);
  switch (r.outcome) {
    case Outcome::NotARequest:
      fail("Malformed frame from " + peer_ + ": kind " + std::to_string(r.kind) +
               " is not a request; connection ended",
           "Malformed frame: not a request");
      return;
    case Outcome::FactoryFailed:
      fail("Cannot create a command for tag " + tag + " from " + peer_ + ": " + r.problem + "; connection ended",
           "Terminating client connection due to processing error");
      return;
    case Outcome::UnknownTag:
      // The processor has said what it thinks of the tag; the client learns
      // that nothing ran, and may go on.
      enqueue(textFrame(r.tag, wire::FrameKind::Refused, "Unknown command tag " + tag));
      return;
    case Outcome::Malformed:
      fail("Malformed request " + r.cmd->name() + " from " + peer_ + ": " + r.problem + "; connection ended",
           "Malformed request " + r.cmd->name() + ": " + r.problem);
      return;
    case Outcome::Command:
      break;
  }

  const std::shared_ptr<CmdI>& cmd = r.cmd;
  cmd->attachSocket(shared_from_this());
  const auto processor = cmd->processor();
  if (!processor) {
    // Keep-alive and the like: answered here, without a processor.
    wire::OutFrame answer;
    try {
      answer = cmd->answerFrame();
    } catch (const std::exception& e) {
      fail("Cannot encode the answer of " + cmd->name() + " for " + peer_ + ": " + e.what() + "; connection ended",
           "Terminating client connection due to processing error");
      return;
    }
    enqueue(std::move(answer));
    return;
  }
  runCommand(cmd, processor);
}

void Connection::runCommand(const std::shared_ptr<CmdI>& cmd, const std::shared_ptr<CmdProcessorI>& processor) {
  busy_ = true;
  answered_ = false;
  inFlight_ = cmd.get();
  processor_ = processor;
  // The command runs on this thread once the strand's handler has returned
  // (a deferred task is not handed to another thread), but outside the
  // strand: the connection's writes, timers and closing go on meanwhile.
  asio::defer(core_->io.get_executor(),
              [self = shared_from_this(), cmd, processor] { self->execute(cmd, processor); });
}

void Connection::execute(const std::shared_ptr<CmdI>& cmd, const std::shared_ptr<CmdProcessorI>& processor) {
  // Closed before it started (the server is stopping): nobody waits for it.
  if (!open_.load()) return;
  // Another thread takes over the other connections if this one blocks.
  IoPool::Busy busy(core_->threads);
  try {
    processor->processCmd(cmd);
  } catch (const std::exception& e) {
    fail("Command " + cmd->name() + " from " + peer_ + " failed: " + e.what() + "; connection ended",
         "Terminating client connection due to processing error");
    return;
  } catch (...) {
    fail("Command " + cmd->name() + " from " + peer_ + " failed with an unknown exception; connection ended",
         "Terminating client connection due to processing error");
    return;
  }
  if (unanswered(cmd.get())) {
    // A processor must answer or end the connection; waiting for it would
    // leave the client hanging for ever.
    fail("Command " + cmd->name() + " from " + peer_ + " ended without an answer; connection ended",
         "Terminating client connection due to processing error");
  }
}

// The peer has sent its end: once everything it asked for is answered and
// sent, the connection ends without a Bye.
void Connection::settleAfterEof() {
  if (!peerDone_ || closing_ || finished_ || busy_ || writing_ || !out_.empty()) return;
  if (partialFrame()) {
    const std::uint64_t got = inBody_ ? bodyGot_ + wire::kLengthSize : stageEnd_ - stageBegin_;
    const std::uint64_t want =
        inBody_ ? std::uint64_t{bodyLen_} + wire::kLengthSize
                : (stageEnd_ - stageBegin_ >= wire::kLengthSize
                       ? std::uint64_t{wire::frameLength(stage_.get() + stageBegin_)} + wire::kLengthSize
                       : wire::kLengthSize);
    core_->report(shared_from_this(), "Connection from " + peer_ + " ended in the middle of a frame (" +
                                          std::to_string(got) + " of " + std::to_string(want) + " bytes)");
  }
  finish();
}

// ---------------------------------------------------------------- writing

void Connection::enqueue(wire::OutFrame frame) {
  if (closing_ || finished_) return;
  outBytes_ += frame.size();
  out_.push_back(std::move(frame));
  if (!writing_) startWrite();
}

// Writes what is queued: first at once, without waiting (the usual case:
// the socket takes a small answer whole, and no completion has to be
// scheduled for it), then, for what the socket did not take, with an
// asynchronous write.
void Connection::startWrite() {
  while (!writing_ && !finished_) {
    const std::size_t count = gather();
    if (count == 0) return;
    boost::system::error_code ec = asio::error::would_block;
    const std::size_t n = writeAtOnce_ ? socket_.write_some(BufferSpan{gather_.data(), count}, ec) : 0;
    if (ec == asio::error::would_block || ec == asio::error::try_again || (!ec && n == 0)) {
      writing_ = true;
      writeSince_ = Clock::now();
      socket_.async_write_some(BufferSpan{gather_.data(), count},
                               [self = shared_from_this()](const boost::system::error_code& e, std::size_t m) {
                                 self->onWrite(e, m);
                               });
      armStallTimer();
      return;
    }
    if (ec) {
      peerGone();
      return;
    }
    consumeWritten(n);
    if (out_.empty()) {
      if (closing_) byeWritten();
      return;
    }
  }
}

// A write failed: the peer is gone, and what was queued for it goes with it.
void Connection::peerGone() {
  peerDone_ = true;
  finish();
}

// Fills gather_ with the unwritten part of the queue; returns the count.
std::size_t Connection::gather() {
  std::size_t count = 0;
  std::uint64_t skip = frontSent_;
  for (const auto& frame : out_) {
    if (count + 2 > gather_.size()) break;
    if (skip < frame.head.size()) {
      gather_[count++] = asio::buffer(frame.head.data() + skip, frame.head.size() - skip);
      skip = 0;
    } else {
      skip -= frame.head.size();
    }
    if (skip < frame.tail.size()) {
      gather_[count++] = asio::buffer(frame.tail.data() + skip, static_cast<std::size_t>(frame.tail.size() - skip));
    }
    skip = 0;
  }
  return count;
}

void Connection::consumeWritten(std::uint64_t n) {
  outBytes_ -= n;
  while (n > 0 && !out_.empty()) {
    const std::uint64_t rest = out_.front().size() - frontSent_;
    if (n < rest) {
      frontSent_ += n;
      n = 0;
    } else {
      n -= rest;
      frontSent_ = 0;
      out_.pop_front();
    }
  }
}

// The Bye frame is out: the sending side ends, and the connection waits
// for the peer to close (within the close grace).
void Connection::byeWritten() {
  if (byeFlushed_) return;
  byeFlushed_ = true;
  boost::system::error_code ignored;
  socket_.shutdown(asio::ip::tcp::socket::shutdown_send, ignored);
  if (peerDone_) {
    finish();
  } else {
    startDrain();
  }
}

void Connection::onWrite(const boost::system::error_code& ec, std::size_t n) {
  writing_ = false;
  if (finished_) {
    out_.clear();
    return;
  }
  if (ec) {
    peerGone();
    return;
  }
  consumeWritten(n);
  if (!out_.empty()) {
    startWrite();
    if (writing_ || finished_ || !out_.empty()) return;
  }
  if (closing_) {
    byeWritten();
    return;
  }
  // Reading may have waited for the answers to drain.
  goOn();
}

// ---------------------------------------------------------------- ending

void Connection::beginClose(const std::string& reason) {
  if (closing_ || finished_) return;
  closing_ = true;
  open_ = false;
  inBody_ = false;
  // A read into it may be in flight; that read keeps its own share.
  body_.reset();
  closeTimer_.expires_after(core_->options.closeGrace);
  closeTimer_.async_wait([self = shared_from_this()](const boost::system::error_code& ec) {
    if (!ec) self->finish();
  });
  wire::OutFrame bye = textFrame(0, wire::FrameKind::Bye, reason);
  outBytes_ += bye.size();
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
  socket_.close(ignored);
  // Frames that a write in flight gathers from go when it completes; a
  // read in flight holds its own share of its buffer.
  if (!writing_) out_.clear();
  outBytes_ = 0;
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
