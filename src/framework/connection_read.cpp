// A connection's reading side: bytes off the socket into the stage or a
// large frame's own buffer, frames cut from them, each decoded and run as a
// command; and the end of the peer's stream.

#include "framework/connection.h"

#include <boost/asio/defer.hpp>
#include <boost/asio/ssl/error.hpp>
#include <cstring>

#include "framework/request_decoder.h"
#include "framework/transport_core.h"
#include "framework/wire.h"

namespace Ipc::detail {
namespace {

namespace asio = boost::asio;
using Clock = std::chrono::steady_clock;

// Ends the connection for a request that did not decode: at once from its
// frame, or later in finishRequest, with the same texts either way.
void failMalformed(Connection& c, const CmdI& cmd, const std::string& problem) {
  c.fail("Malformed request " + cmd.name() + " from " + c.peer() + ": " + problem + "; connection ended",
         "Malformed request " + cmd.name() + ": " + problem);
}

}  // namespace

void Connection::startRead() {
  // A request waiting for the memory budget is not followed by more bytes:
  // the stall timer must not take it for a stalled frame.
  if (reading_ || peerDone_ || waitingMemory_ || !mayTakeRequest()) return;
  reading_ = true;
  readSince_ = Clock::now();
  if (inBody_) {
    if (bodyGot_ == body_->size()) {
      // The frame's bytes go into a buffer that grows with what has arrived,
      // so that a length field alone never reserves the announced size. It
      // grows in place (no read into it is in flight, and the last one's
      // handler shares this very MemBuffer): a large one is remapped, not
      // copied, which on this thread would hold up its other connections
      // for as long as copying the frame so far takes.
      body_->grow(std::min<std::uint64_t>(bodyLen_, body_->size() * 2));
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
  stream_.asyncReadSome(asio::buffer(data, size), [self = shared_from_this(), owner = std::move(owner)](
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
    // A TLS peer that closes its socket without ending the session first
    // (most do) has ended its stream all the same.
    if (ec == asio::error::eof || ec == asio::ssl::error::stream_truncated) {
      goOn();
      return;
    }
    if (partialFrame()) {
      core_->report(shared_from_this(),
                    "Connection from " + peer_ + " broke in the middle of a frame (" + ec.message() + ")");
    }
    finish();
    return;
  }
  core_->bytesIn.fetch_add(n, std::memory_order_relaxed);
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
      // The frame's reservation stays with its command until that ends.
      if (!busy_) releaseReserved();
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
      // A new command starts only while the memory budget has room.
      if (!admitted(0)) return;
      std::shared_ptr<unsigned char> owner(ExportedUCharAlloc::alloc(length), ExportedUCharAlloc());
      std::memcpy(owner.get(), start, length);
      stageBegin_ += wire::kLengthSize + length;
      if (stageBegin_ == stageEnd_) stageBegin_ = stageEnd_ = 0;
      handleFrame(std::move(owner), length);
      continue;
    }
    if (wire::kLengthSize + length <= kStageSize) return;  // the rest fits in the stage
    // A large frame: it counts its whole length against the memory budget
    // from here on (two frames received halfway can never hold the budget
    // between them); what has arrived moves into a buffer of its own, and
    // the rest is read straight into it.
    if (!admitted(length)) return;
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
      fail("Malformed frame from " + peer_ + ": kind " + std::to_string(r.kind) + " is not a request; connection ended",
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
      failMalformed(*this, *r.cmd, r.problem);
      return;
    case Outcome::Command:
      break;
  }

  const std::shared_ptr<CmdI>& cmd = r.cmd;
  cmd->attachSocket(shared_from_this());
  const auto processor = cmd->processor();
  if (!processor) {
    // Keep-alive and the like: answered here, without a processor (and
    // with nothing costly left to decode).
    if (const auto problem = finishRequest(*cmd)) {
      failMalformed(*this, *cmd, *problem);
      return;
    }
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
  streaming_ = cmd->streamsProgress();
  answered_ = false;
  inFlight_ = cmd.get();
  processor_ = processor;
  // The command runs on this thread once the strand's handler has returned
  // (a deferred task is not handed to another thread), but outside the
  // strand: the connection's writes, timers and closing go on meanwhile.
  // The command travels in a slot that execute empties: Asio may copy the
  // handler on its way (its default invocation hook runs a copy), and the
  // share of every copy would outlive the busy scope.
  auto slot = std::make_shared<std::shared_ptr<CmdI>>(cmd);
  asio::defer(core_->io.get_executor(),
              [self = shared_from_this(), slot, processor] { self->execute(std::move(*slot), processor); });
}

void Connection::execute(std::shared_ptr<CmdI> command, const std::shared_ptr<CmdProcessorI>& processor) {
  // Closed before it started (the server is stopping): nobody waits for it.
  if (!open_.load()) return;
  // Another thread takes over the other connections if this one blocks.
  IoPool::Busy busy(core_->threads);
  // Released before the busy scope ends (usually the last share): freeing a
  // large request or answer (the parsed tree of a configuration part takes
  // about as long to free as to build) is part of the command's time, not
  // of the I/O thread's handlers.
  const std::shared_ptr<CmdI> cmd = std::move(command);
  try {
    // The costly rest of the request's decoding (a large JSON text) is done
    // here rather than on the strand, where it would hold up the thread's
    // other connections.
    if (const auto problem = finishRequest(*cmd)) {
      failMalformed(*this, *cmd, *problem);
      return;
    }
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
  if (!peerDone_ || closing_ || finished_ || busy_ || writing_ || !out_.empty() || waitingMemory_) return;
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

}  // namespace Ipc::detail
