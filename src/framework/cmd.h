#pragma once
// Command classes and command processors: what the transport (SvcStub)
// and the commands agree on.
//
// The transport reads a request frame, asks its factory for a command of the
// frame's tag, lets the command read its request, attaches the connection's
// Socket and hands the command to its processor's processCmd, on the thread
// that runs it, after the command's finishRequest (commands without a
// processor, such as PingPong, are answered at once). The
// processor runs the command and calls SvcStub::onRespReady, which sends the
// answer, or the command's onTransferError, which ends the connection.
//
// Ownership: commands and sockets are owned by shared pointers. A command
// keeps its socket alive, so a connection's state (its ConnInf) lives as long
// as any of its commands, also after the peer has gone.
// Thread safety: the commands of one connection are processed one after
// another; a command's request and answer fields are touched by one thread
// at a time. Socket::send and Socket::close may be called from any thread.

#include <cstdint>
#include <memory>
#include <string>

#include "framework/frame.h"
#include "framework/wire.h"

namespace Ipc {

// Per-connection state that a processor keeps in the connection's slot.
class ConnInf {
 public:
  virtual ~ConnInf() = default;
};

// The server side of one client connection.
class Socket {
 public:
  virtual ~Socket() = default;

  // The connection's slot, empty when the connection opens. Only the
  // commands of this connection touch it, one at a time.
  std::unique_ptr<ConnInf>& connInf() noexcept { return connInf_; }

  // Queues one complete frame for sending; frames go out in the order in
  // which they were queued. Dropped silently once the connection is closed.
  virtual void send(wire::OutFrame frame) = 0;
  // Sends a Bye frame with the reason, then ends the connection. Later
  // sends are dropped. Idempotent.
  virtual void close(const std::string& reason) = 0;
  // The connection may read and run its next request (the current
  // command's answer is complete).
  virtual void commandDone() = 0;
  // "address:port" of the peer, for log lines.
  virtual std::string peer() const = 0;
  virtual bool isOpen() const = 0;

 private:
  std::unique_ptr<ConnInf> connInf_;
};

class CmdProcessorI;

class CmdI : public std::enable_shared_from_this<CmdI> {
 public:
  virtual ~CmdI() = default;

  virtual std::uint8_t tag() const noexcept = 0;
  // The command's name for log lines, e.g. "GetData".
  virtual const std::string& name() const noexcept = 0;
  // Calls the processor's operation for this command's class.
  virtual void accept(CmdProcessorI& processor) = 0;
  // The processor the command was built with; null for commands that the
  // transport answers itself (PingPong).
  virtual std::shared_ptr<CmdProcessorI> processor() const noexcept { return nullptr; }

  // Server side: read the request payload, write the answer payload.
  // readRequest throws wire::DecodeError (or json::Exc for JSON fields) on
  // malformed input.
  virtual void readRequest(wire::Reader& in) = 0;
  // Server side: completes what readRequest left for later. readRequest
  // runs on an I/O thread while the frame is cut from the connection's
  // bytes, where work in proportion to a large payload (parsing a JSON text
  // of megabytes) would hold up every connection that thread serves; it
  // checks the framing and keeps such a field's bytes, and this parses
  // them. Called once, on the thread that runs the command (where it may
  // take its time), before the processor sees the command. Throws as
  // readRequest does; the request is then malformed. The default does
  // nothing.
  virtual void finishRequest() {}
  virtual void writeAnswer(wire::Writer& out) const = 0;
  // Client side: write the request payload, read the answer payload.
  virtual void writeRequest(wire::Writer& out) const = 0;
  virtual void readAnswer(wire::Reader& in) = 0;

  // True for commands whose answer is a progress stream (first message,
  // more messages, end) instead of one Answer frame.
  virtual bool streamsProgress() const noexcept { return false; }

  // Builds the complete Answer frame of this command (a shared byte string
  // of the answer travels as the frame's tail, without a copy).
  wire::OutFrame answerFrame() const;
  // Builds the complete Request frame of this command.
  wire::OutFrame requestFrame() const;

  // The connection the command came from; null on the client side.
  const std::shared_ptr<Socket>& socket() const noexcept { return socket_; }
  void attachSocket(std::shared_ptr<Socket> socket) noexcept { socket_ = std::move(socket); }

  // Ends the command's connection with the reason (sent in a Bye frame).
  void onTransferError(const std::string& text);

 private:
  std::shared_ptr<Socket> socket_;
};

class CmdProcessorI : public std::enable_shared_from_this<CmdProcessorI> {
 public:
  virtual ~CmdProcessorI() = default;
  // Runs a received command. Called on an I/O thread of the transport; may
  // block (other threads then serve the other connections). Must end with
  // SvcStub::onRespReady or cmd->onTransferError.
  virtual void processCmd(std::shared_ptr<CmdI> cmd) = 0;
  // The transport reports a problem (malformed frame, resource exhaustion).
  virtual void onIpcError(const std::shared_ptr<Socket>& socket, const std::string& text) {
    (void)socket;
    (void)text;
  }
  // A connection has ended; the default does nothing.
  virtual void onDisconnect(const std::shared_ptr<Socket>& socket) { (void)socket; }
};

// The keep-alive command, tag 1: empty request, empty answer.
class PingPong final : public CmdI {
 public:
  static constexpr std::uint8_t kTag = 1;
  std::uint8_t tag() const noexcept override { return kTag; }
  const std::string& name() const noexcept override;
  void accept(CmdProcessorI&) override {}
  void readRequest(wire::Reader& in) override { in.expectEnd(); }
  void writeAnswer(wire::Writer&) const override {}
  void writeRequest(wire::Writer&) const override {}
  void readAnswer(wire::Reader& in) override { in.expectEnd(); }
};

}  // namespace Ipc
