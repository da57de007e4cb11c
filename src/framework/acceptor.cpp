#include "framework/acceptor.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <boost/asio/ip/v6_only.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/strand.hpp>
#include <stdexcept>

#include "framework/log.h"
#include "framework/transport_core.h"

namespace Ipc::detail {
namespace {

namespace asio = boost::asio;
using tcp = asio::ip::tcp;

UniqueFd openReserve() { return UniqueFd(::open("/dev/null", O_RDONLY | O_CLOEXEC)); }

bool outOfDescriptors(const boost::system::error_code& ec) {
  return ec == asio::error::no_descriptors || ec == boost::system::errc::too_many_files_open_in_system ||
         ec == asio::error::no_buffer_space || ec == asio::error::no_memory;
}

}  // namespace

Acceptor::Acceptor(std::shared_ptr<ServerCore> core)
    : core_(std::move(core)),
      acceptor_(asio::make_strand(core_->io)),
      retry_(acceptor_.get_executor()),
      reserveFd_(openReserve()) {}

Acceptor::~Acceptor() = default;

bool Acceptor::open(std::uint16_t port, bool forceIp4) {
  boost::system::error_code ec;
  bool ip4Only = forceIp4;
  if (!forceIp4) {
    acceptor_.open(tcp::v6(), ec);
    if (ec == asio::error::address_family_not_supported) {
      Log::Lock entry(Log::Warning);
      entry.logStreamLine() << "IPv6 is not available; listening on IPv4 only";
      ip4Only = true;
    } else if (!ec) {
      acceptor_.set_option(asio::ip::v6_only(false), ec);
    }
  }
  if (ip4Only) acceptor_.open(tcp::v4(), ec);
  if (!ec) acceptor_.set_option(tcp::acceptor::reuse_address(true), ec);
  if (!ec) acceptor_.bind(tcp::endpoint(ip4Only ? tcp::v4() : tcp::v6(), port), ec);
  if (!ec) acceptor_.listen(asio::socket_base::max_listen_connections, ec);
  if (ec) {
    boost::system::error_code ignored;
    acceptor_.close(ignored);
    throw std::runtime_error("Cannot listen on port " + std::to_string(port) + ": " + ec.message());
  }
  port_ = acceptor_.local_endpoint().port();
  return ip4Only;
}

void Acceptor::start() {
  asio::post(acceptor_.get_executor(), [self = shared_from_this()] { self->accept(); });
}

void Acceptor::stop() {
  asio::post(acceptor_.get_executor(), [self = shared_from_this()] {
    self->stopped_ = true;
    boost::system::error_code ignored;
    self->retry_.cancel();
    self->acceptor_.close(ignored);
  });
}

void Acceptor::accept() {
  if (stopped_) return;
  // Every connection gets a strand of its own: its handlers never run
  // concurrently, different connections' handlers do.
  acceptor_.async_accept(asio::make_strand(core_->io),
                         [self = shared_from_this()](const boost::system::error_code& ec, StrandSocket socket) {
                           self->onAccept(ec, std::move(socket));
                         });
}

void Acceptor::onAccept(const boost::system::error_code& ec, StrandSocket socket) {
  if (stopped_ || ec == asio::error::operation_aborted) return;
  if (!ec) {
    if (starved_) {
      starved_ = false;
      Log::Lock entry(Log::Notice);
      entry.logStreamLine() << "Accepting connections again";
    }
    boost::system::error_code ignored;
    socket.set_option(tcp::no_delay(true), ignored);
    try {
      std::make_shared<Connection>(core_, std::move(socket))->start();
    } catch (const std::exception& e) {
      core_->report(nullptr, std::string("Cannot set up a new connection: ") + e.what());
    }
    accept();
    return;
  }
  if (outOfDescriptors(ec)) {
    if (!starved_) {
      starved_ = true;
      core_->report(nullptr, "Cannot accept a connection (" + ec.message() +
                                 "); new connections are refused until resources are free");
    }
    if (refuseOne()) {
      accept();
    } else {
      retryLater();
    }
    return;
  }
  // Errors of one pending connection (it was reset before we took it, …)
  // concern that connection only.
  accept();
}

bool Acceptor::refuseOne() {
  reserveFd_.close();
  const UniqueFd refused(::accept4(acceptor_.native_handle(), nullptr, nullptr, SOCK_CLOEXEC));
  reserveFd_ = openReserve();
  return refused.valid();
}

void Acceptor::retryLater() {
  // Without a spare descriptor the pending connection cannot even be taken
  // off the backlog; trying again at once would spin.
  retry_.expires_after(std::chrono::milliseconds(100));
  retry_.async_wait([self = shared_from_this()](const boost::system::error_code& ec) {
    if (!ec) self->accept();
  });
}

}  // namespace Ipc::detail
