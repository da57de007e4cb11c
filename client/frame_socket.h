#pragma once
// One TCP connection to the server that sends and receives whole frames,
// with blocking I/O bounded by timeouts; in plain TCP, or over TLS when
// given TLS options (client/tls_session.h).
//
// Ownership: owns its socket; closed by close() or the destructor.
// Thread safety: none; one thread at a time.
// Failures: ConnectFailed when the server cannot be reached (or, with TLS,
// the handshake fails or the server's certificate is refused);
// ConnectionEnded when the socket drops, a timeout passes or the server
// sends a frame whose length is out of range. After a failed receive the
// socket is closed; after a failed send it stays open for reading, since the
// server may have explained itself in a frame that is still to be read.

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>

#include "client/tls_session.h"
#include "framework/frame.h"
#include "framework/unique_fd.h"
#include "framework/wire.h"

namespace cvdb {

class FrameSocket {
 public:
  struct Frame {
    std::uint8_t tag = 0;
    wire::FrameKind kind = wire::FrameKind::Answer;
    std::shared_ptr<unsigned char> payload;  // shares the received buffer
    std::size_t size = 0;
    wire::Reader reader() const { return wire::Reader(payload, size); }
  };

  // Connects to host:port (a name or an IPv4/IPv6 address), trying every
  // address the name resolves to within the timeout; with tls, then
  // completes a TLS handshake (within the timeout as well).
  FrameSocket(const std::string& host, std::uint16_t port, std::chrono::milliseconds connectTimeout,
              const TlsOptions* tls = nullptr);
  ~FrameSocket();
  FrameSocket(const FrameSocket&) = delete;
  FrameSocket& operator=(const FrameSocket&) = delete;

  // Sends a complete frame. timeout bounds each wait for the socket to take
  // more bytes (0: no bound).
  void send(const wire::OutFrame& frame, std::chrono::milliseconds timeout);
  // Sends raw bytes (for tests of malformed input).
  void sendRaw(const void* data, std::size_t size, std::chrono::milliseconds timeout);
  // Receives one frame; timeout bounds each wait for more bytes (0: none).
  Frame receive(std::chrono::milliseconds timeout);

  bool isOpen() const noexcept { return fd_.valid(); }
  void close() noexcept;

 private:
  void waitFor(short events, std::chrono::milliseconds timeout);
  void readExactly(unsigned char* out, std::size_t size, std::chrono::milliseconds timeout);
  [[noreturn]] void fail(const std::string& reason);

  UniqueFd fd_;
  std::unique_ptr<TlsSession> tls_;  // over fd_, when TLS
};

}  // namespace cvdb
