#pragma once
// Internal to the transport: the listening socket and its accept loop.
//
// Listens on a dual-stack IPv6 socket (IPv4 clients arrive as mapped
// addresses) unless IPv4 only is asked for or the system has no IPv6.
// Every accepted socket becomes a Connection with TCP_NODELAY set.
//
// When the process runs out of file descriptors, the pending connection is
// accepted on a descriptor held in reserve for the purpose and closed at
// once, so that the client sees its connection end instead of waiting in the
// backlog, and the server keeps serving the connections it has. The problem
// is reported once per burst.
//
// Ownership: shared by the SvcStub and its own operations in flight.
// Thread safety: open() before the I/O threads run; stop() from any thread.
// Failures: open() throws std::runtime_error when the port cannot be bound;
// accept failures are reported and never end the loop (except stop()).

#include <boost/asio/ip/tcp.hpp>
#include <boost/asio/steady_timer.hpp>
#include <cstdint>
#include <memory>

#include "framework/connection.h"
#include "framework/unique_fd.h"

namespace Ipc::detail {

class ServerCore;

class Acceptor : public std::enable_shared_from_this<Acceptor> {
 public:
  explicit Acceptor(std::shared_ptr<ServerCore> core);
  ~Acceptor();
  Acceptor(const Acceptor&) = delete;
  Acceptor& operator=(const Acceptor&) = delete;

  // Binds and listens. Returns true when the socket is IPv4 only (asked for,
  // or no IPv6 on this system).
  bool open(std::uint16_t port, bool forceIp4);
  std::uint16_t port() const noexcept { return port_; }
  void start();
  void stop();

 private:
  using StrandAcceptor = boost::asio::basic_socket_acceptor<boost::asio::ip::tcp, Strand>;

  void accept();
  void onAccept(const boost::system::error_code& ec, StrandSocket socket);
  // Accepts one pending connection on the reserve descriptor and closes it.
  bool refuseOne();
  void retryLater();

  const std::shared_ptr<ServerCore> core_;
  StrandAcceptor acceptor_;
  StrandTimer retry_;
  std::uint16_t port_ = 0;
  UniqueFd reserveFd_;
  bool starved_ = false;  // in a burst of descriptor exhaustion
  bool stopped_ = false;
};

}  // namespace Ipc::detail
