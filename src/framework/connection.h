#pragma once
// Internal to the transport: one client connection.
//
// With TLS, first completes the handshake (within the stall timeout; a
// peer that does not finish it is closed, and a failed handshake is
// reported once with OpenSSL's reason). Then
// reads request frames, turns each into a command through the factory and
// runs it on an I/O thread outside the connection's strand (or answers it
// at once when it has no processor), reading no further request until the
// command is done; queues outgoing
// frames and writes them with gather writes; ends itself on malformed or
// stalled frames, on a processor's request, on the peer's end and when the
// server stops.
//
// Ownership: always owned by shared pointers: the I/O operations in flight,
// the commands that came from the connection (which may outlive the server,
// a maintenance thread for example) and, weakly, the server's registry.
// Thread safety: the Socket members may be called from any thread; they
// hand their work to the connection's strand, where all of its state lives.
// After the connection has finished, they do nothing.
// Failures: problems are reported through the server's error handler and
// end this connection only; nothing here throws to its caller.
//
// Buffer lifetimes (the rule every asynchronous operation here follows): a
// buffer handed to an asynchronous read or write lives until that operation
// has completed or been cancelled and its handler has run, whichever path
// ends the connection (a Bye, a stall, the peer's end, the server's stop).
//   - Reads go into a buffer that the read's handler owns a share of (the
//     stage, or the growing buffer of a large frame): the connection may
//     drop its own share at any time, and the bytes that still arrive land
//     in memory that the handler releases.
//   - Writes gather from the frames queued in out_; a frame stays in out_
//     (and gather_ is not rewritten) until the write that covers it has
//     completed: frames leave the queue only in consumeWritten, after a
//     completed write, and finish() keeps the queue while a write is in
//     flight, whose handler clears it.

#include <array>
#include <atomic>
#include <boost/asio/buffer.hpp>
#include <boost/asio/io_context.hpp>
#include <chrono>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "framework/buffers.h"
#include "framework/cmd.h"
#include "framework/conn_stream.h"

namespace Ipc::detail {

class ServerCore;

class Connection final : public Socket, public std::enable_shared_from_this<Connection> {
 public:
  // Bytes of answers waiting to be sent above which the connection reads no
  // further request (a client that does not read its answers is not served
  // more of them).
  static constexpr std::uint64_t kOutHighWater = 256 * 1024;
  // Reading buffer of a connection; frames that fit are read with one call.
  static constexpr std::size_t kStageSize = 4096;
  // First allocation for a frame that does not fit; grows as bytes arrive.
  static constexpr std::size_t kFirstBodyChunk = 64 * 1024;

  Connection(std::shared_ptr<ServerCore> core, StrandSocket socket);
  ~Connection() override;
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Registers with the server and starts reading; closes the socket when the
  // server is stopping already.
  void start();

  void send(wire::OutFrame frame) override;
  void close(const std::string& reason) override;
  // The server is stopping: reads no further request and closes with
  // reason once the running command (if any) has sent its answer, or at
  // once when there is none or it streams progress. A command that has not
  // answered within the stop grace gets the Bye anyway.
  void stop(const std::string& reason);
  void commandDone() override;
  std::string peer() const override { return peer_; }
  bool isOpen() const override { return open_.load(); }

  // The answer of cmd is under way (SvcStub::onRespReady).
  void markAnswered(const CmdI* cmd) noexcept;
  // True while cmd is this open connection's running command and nothing
  // has answered it.
  bool unanswered(const CmdI* cmd) const noexcept;
  // Sends the answer of the running command and lets the connection go on
  // with the next request (send and commandDone in one step).
  void respond(wire::OutFrame answer);
  // Reports the text through the server's error handler and ends the
  // connection with a Bye frame carrying byeReason.
  void fail(const std::string& text, const std::string& byeReason);
  // The memory budget has room for the request this connection waits with;
  // from any thread, never runs it inline.
  void resumeAfterWait();

 private:
  // Runs f on the strand: at once when already there, else queued. Does
  // nothing once the connection has finished. With last, the caller is
  // about to return to the I/O context, which then runs f on the same
  // thread instead of waking another (only when called from an I/O thread;
  // from others it is queued as usual).
  template <typename F>
  void onStrand(F&& f, bool last = false);

  // Strand only, from here on. The reading side (connection_read.cpp) and
  // the write queue (connection_write.cpp) have files of their own; the
  // rest, with ending and stalls, is in connection.cpp.
  bool partialFrame() const noexcept { return inBody_ || stageEnd_ > stageBegin_; }
  bool mayTakeRequest() const noexcept {
    return !busy_ && !closing_ && !finished_ && !stopPending_ && outBytes_ <= kOutHighWater;
  }
  void endCommand();
  void goOn();
  // TLS only: the handshake, before the first read.
  void startHandshake();
  void onHandshake(const boost::system::error_code& ec);
  void startRead();
  void onRead(const boost::system::error_code& ec, std::size_t n);
  void peerGone();
  void parse();
  void handleFrame(std::shared_ptr<unsigned char> body, std::uint32_t size);
  void runCommand(const std::shared_ptr<CmdI>& cmd, const std::shared_ptr<CmdProcessorI>& processor);
  // Not on the strand: runs the command in a busy scope of the I/O pool,
  // and lets go of it there.
  void execute(std::shared_ptr<CmdI> command, const std::shared_ptr<CmdProcessorI>& processor);
  void settleAfterEof();

  void enqueue(wire::OutFrame frame);
  void startWrite();
  std::size_t gather();
  // TLS: the gathered buffers as one (copied into tlsOut_ unless the first
  // is large enough to go alone), so that small frames share a record.
  boost::asio::const_buffer coalesce(std::size_t count);
  void consumeWritten(std::uint64_t n);
  void byeWritten();
  // Once the connection is ending and no command runs (before its Bye is
  // queued, or when the last command ends after it), gives up what its slot
  // holds (a database session) rather than when the last reference to the
  // connection goes: a client that reconnects right after a Bye finds its
  // place free.
  void releaseSlot();
  void onWrite(const boost::system::error_code& ec, std::size_t n);

  void beginClose(const std::string& reason);
  void startDrain();
  void finish();
  // Reads into [data, data + size), which owner keeps alive until the
  // read's handler has run.
  void readInto(std::shared_ptr<const void> owner, unsigned char* data, std::size_t size);

  void armStallTimer();
  void onStallTimer(const boost::system::error_code& ec);

  // The memory budget (connection_budget.cpp): whether a request may go on
  // (bytes 0: a received frame becomes a command; else a large frame of
  // that length starts); when not, the connection waits, reading nothing,
  // until resumeAfterWait.
  bool admitted(std::uint64_t bytes);
  void onMemoryFreed();
  void addQueued(std::uint64_t bytes);
  // Gives back the reservation of the request frame (received, dropped, or
  // its command ended).
  void releaseReserved();
  // At the end: gives back everything the connection counts.
  void leaveBudget();

  // A frame of the given kind whose payload is one string.
  static wire::OutFrame textFrame(std::uint8_t tag, wire::FrameKind kind, const std::string& text);

  const std::shared_ptr<ServerCore> core_;
  ConnStream stream_;
  StrandTimer stallTimer_;
  StrandTimer closeTimer_;
  const std::string peer_;

  std::mutex postMutex_;
  bool accepting_ = true;  // guarded by postMutex_: false once finished
  std::atomic<bool> open_{true};
  std::atomic<const CmdI*> inFlight_{nullptr};
  std::atomic<bool> answered_{false};

  // Reading.
  // Both shared with the read in flight (see the buffer rule above).
  std::shared_ptr<unsigned char[]> stage_;
  std::size_t stageBegin_ = 0;
  std::size_t stageEnd_ = 0;
  std::shared_ptr<MemBuffer> body_;  // a frame larger than the stage, as far as received
  std::uint32_t bodyLen_ = 0;
  std::uint64_t bodyGot_ = 0;
  bool inBody_ = false;
  std::uint64_t reserved_ = 0;  // budget held for the large frame being received or run
  bool waitingMemory_ = false;  // a request waits for the memory budget

  // Writing.
  std::deque<wire::OutFrame> out_;
  std::uint64_t frontSent_ = 0;  // bytes of out_.front() already written
  std::uint64_t outBytes_ = 0;   // bytes queued and not yet written
  std::array<boost::asio::const_buffer, 32> gather_;
  std::vector<unsigned char> tlsOut_;  // coalesce's copy, unchanged while a write is in flight

  bool handshaking_ = false;  // the TLS handshake is in flight
  bool reading_ = false;
  bool writing_ = false;
  bool busy_ = false;         // a command is running; no further request is read
  bool streaming_ = false;    // ... and its answer is a progress stream
  bool stopPending_ = false;  // the server stops: close once the running command has answered
  std::string stopReason_;
  bool peerDone_ = false;    // the peer sent its end (or the socket broke)
  bool closing_ = false;     // a Bye is queued; nothing else goes out
  bool byeFlushed_ = false;  // the Bye is written; draining until the peer closes
  bool finished_ = false;    // the socket is closed
  bool stallArmed_ = false;
  bool writeAtOnce_ = false;  // the socket is in non-blocking mode
  std::chrono::steady_clock::time_point handshakeSince_;
  std::chrono::steady_clock::time_point readSince_;
  std::chrono::steady_clock::time_point writeSince_;

  std::weak_ptr<CmdProcessorI> processor_;  // the last processor seen, for onDisconnect
};

}  // namespace Ipc::detail
