#pragma once
// Internal to the transport: what a connection reads from and writes to,
// its TCP socket or a TLS session over that socket.
//
// A connection calls the same few operations either way; with TLS the
// handshake comes first (asyncHandshake), and the bytes read and written
// are the session's plaintext. One read and one write may be in flight at
// once, as on a socket, as long as every operation is started from the
// connection's strand (the socket's executor, on which Asio also runs the
// TLS layer's intermediate handlers).
//
// Ownership: owns the socket and the session; the OpenSSL context (one for
// all connections) belongs to the server core, which the connection keeps.
// Thread safety: none; the connection's strand only.

#include <boost/asio/ip/tcp.hpp>
#include <boost/asio/ssl/stream.hpp>
#include <boost/asio/steady_timer.hpp>
#include <boost/asio/strand.hpp>
#include <chrono>
#include <memory>
#include <utility>

namespace Ipc::detail {

using Strand = boost::asio::strand<boost::asio::io_context::executor_type>;
using StrandSocket = boost::asio::basic_stream_socket<boost::asio::ip::tcp, Strand>;
using StrandTimer = boost::asio::basic_waitable_timer<std::chrono::steady_clock,
                                                      boost::asio::wait_traits<std::chrono::steady_clock>, Strand>;

class ConnStream {
 public:
  // tls null: plain TCP.
  ConnStream(StrandSocket socket, boost::asio::ssl::context* tls)
      : socket_(std::move(socket)),
        tls_(tls ? std::make_unique<boost::asio::ssl::stream<StrandSocket&>>(socket_, *tls) : nullptr) {}
  ConnStream(const ConnStream&) = delete;
  ConnStream& operator=(const ConnStream&) = delete;

  bool tls() const noexcept { return tls_ != nullptr; }
  StrandSocket& socket() noexcept { return socket_; }
  const StrandSocket& socket() const noexcept { return socket_; }
  // The TLS session (null without TLS).
  SSL* session() noexcept { return tls_ ? tls_->native_handle() : nullptr; }

  template <typename Handler>
  void asyncHandshake(Handler&& handler) {
    tls_->async_handshake(boost::asio::ssl::stream_base::server, std::forward<Handler>(handler));
  }
  template <typename Buffers, typename Handler>
  void asyncReadSome(const Buffers& buffers, Handler&& handler) {
    if (tls_) {
      tls_->async_read_some(buffers, std::forward<Handler>(handler));
    } else {
      socket_.async_read_some(buffers, std::forward<Handler>(handler));
    }
  }
  // With TLS only the first non-empty buffer is written by one call (one
  // or more records of it); the connection hands it one coalesced buffer.
  template <typename Buffers, typename Handler>
  void asyncWriteSome(const Buffers& buffers, Handler&& handler) {
    if (tls_) {
      tls_->async_write_some(buffers, std::forward<Handler>(handler));
    } else {
      socket_.async_write_some(buffers, std::forward<Handler>(handler));
    }
  }

 private:
  StrandSocket socket_;
  // Refers to socket_, declared before it.
  std::unique_ptr<boost::asio::ssl::stream<StrandSocket&>> tls_;
};

}  // namespace Ipc::detail
