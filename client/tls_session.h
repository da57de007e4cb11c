#pragma once
// The client's side of a TLS session over a connected socket, for
// FrameSocket.
//
// The server's certificate must chain to the given CAs (or to the system's
// default trust store) and name the host the client connected to: a DNS
// name in its subject alternative names, or an IP address among its IP
// addresses when the client connected by address. A client certificate is
// presented when the options name one (servers with mutual TLS ask for it).
//
// OpenSSL works on memory buffers here; the socket I/O is this class's own
// (send with MSG_NOSIGNAL, so that a broken connection never raises
// SIGPIPE in the client's process), with the same timeouts as plain frames.
//
// Ownership: owns the session, not the socket.
// Thread safety: none; one thread at a time.
// Failures: the constructor throws ConnectFailed (a local file that cannot
// be used, a handshake that fails, the server's certificate refused, with
// OpenSSL's reason); read and write throw ConnectionEnded.

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>

namespace cvdb {

struct TlsOptions {
  // CA certificates (PEM) that the server's certificate must chain to;
  // empty: the system's default trust store.
  std::string caFile;
  // The client's certificate chain and private key (PEM, the key not
  // encrypted), for servers that require one; both or neither.
  std::string certFile;
  std::string keyFile;
  // The name the server's certificate must carry; empty: the host given
  // to connect to.
  std::string serverName;
};

class TlsSession {
 public:
  // Completes the handshake over fd, a connected non-blocking socket,
  // within timeout.
  TlsSession(int fd, const std::string& host, const TlsOptions& options, std::chrono::milliseconds timeout);
  ~TlsSession();
  TlsSession(const TlsSession&) = delete;
  TlsSession& operator=(const TlsSession&) = delete;

  // Sends all size bytes; timeout bounds each wait for the socket (0: none).
  void write(const void* data, std::size_t size, std::chrono::milliseconds timeout);
  // Reads at least one byte and at most size; 0 when the server has ended
  // the connection. timeout bounds each wait for bytes (0: none).
  std::size_t read(void* out, std::size_t size, std::chrono::milliseconds timeout);
  // Tells the server that the session ends, if the socket takes it at once.
  void close() noexcept;

 private:
  struct State;
  std::unique_ptr<State> s_;
};

}  // namespace cvdb
