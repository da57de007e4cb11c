#include "service/metrics_server.h"

#include <boost/asio/io_context.hpp>
#include <boost/asio/ip/tcp.hpp>
#include <boost/asio/steady_timer.hpp>
#include <boost/beast/core.hpp>
#include <boost/beast/http.hpp>
#include <chrono>
#include <stdexcept>
#include <thread>

#include "framework/log.h"

namespace DBServer {
namespace {

namespace asio = boost::asio;
namespace beast = boost::beast;
namespace http = beast::http;
using tcp = asio::ip::tcp;

constexpr std::chrono::seconds kTimeout{5};

// One request and its answer.
class Exchange : public std::enable_shared_from_this<Exchange> {
 public:
  Exchange(tcp::socket socket, const std::function<std::string()>& metrics, const std::function<bool()>& healthy)
      : stream_(std::move(socket)), metrics_(metrics), healthy_(healthy) {}

  void start() {
    stream_.expires_after(kTimeout);
    http::async_read(stream_, buffer_, request_,
                     [self = shared_from_this()](beast::error_code ec, std::size_t) { self->onRead(ec); });
  }

 private:
  void onRead(beast::error_code ec) {
    if (ec) return;  // gone, too slow, or not HTTP: nothing to answer
    answer_.version(request_.version());
    answer_.keep_alive(false);
    answer_.set(http::field::content_type, "text/plain; charset=utf-8");
    const auto target = request_.target();
    if (request_.method() != http::verb::get) {
      answer_.result(http::status::method_not_allowed);
      answer_.body() = "only GET\n";
    } else if (target == "/metrics") {
      answer_.set(http::field::content_type, "text/plain; version=0.0.4; charset=utf-8");
      try {
        answer_.body() = metrics_();
        answer_.result(http::status::ok);
      } catch (const std::exception& e) {
        answer_.result(http::status::internal_server_error);
        answer_.body() = std::string("metrics unavailable: ") + e.what() + "\n";
      }
    } else if (target == "/healthz") {
      const bool ok = healthy_();
      answer_.result(ok ? http::status::ok : http::status::service_unavailable);
      answer_.body() = ok ? "ok\n" : "stopping\n";
    } else {
      answer_.result(http::status::not_found);
      answer_.body() = "not found; try /metrics or /healthz\n";
    }
    answer_.prepare_payload();
    stream_.expires_after(kTimeout);
    http::async_write(stream_, answer_, [self = shared_from_this()](beast::error_code, std::size_t) {
      beast::error_code ignored;
      self->stream_.socket().shutdown(tcp::socket::shutdown_send, ignored);
    });
  }

  beast::tcp_stream stream_;
  beast::flat_buffer buffer_{8192};
  http::request<http::string_body> request_;
  http::response<http::string_body> answer_;
  const std::function<std::string()>& metrics_;
  const std::function<bool()>& healthy_;
};

}  // namespace

class MetricsServer::Impl {
 public:
  Impl(const std::string& address, std::uint16_t port, std::function<std::string()> metrics,
       std::function<bool()> healthy)
      : metrics_(std::move(metrics)), healthy_(std::move(healthy)), acceptor_(io_) {
    beast::error_code ec;
    const auto ip = asio::ip::make_address(address, ec);
    if (ec) throw std::runtime_error("Metrics address \"" + address + "\" is not an IP address");
    const tcp::endpoint at(ip, port);
    acceptor_.open(at.protocol());
    acceptor_.set_option(asio::socket_base::reuse_address(true));
    acceptor_.bind(at, ec);
    if (ec) {
      throw std::runtime_error("Cannot listen for metrics on " + address + ":" + std::to_string(port) + ": " +
                               ec.message());
    }
    acceptor_.listen();
    port_ = acceptor_.local_endpoint().port();
    accept();
    thread_ = std::thread([this] { io_.run(); });
  }

  ~Impl() {
    io_.stop();
    if (thread_.joinable()) thread_.join();
  }

  std::uint16_t port() const { return port_; }

 private:
  void accept() {
    acceptor_.async_accept([this](beast::error_code ec, tcp::socket socket) {
      if (ec == asio::error::operation_aborted) return;
      if (ec) {
        // Out of descriptors, most likely: try again a moment later rather
        // than at once and for ever.
        retry_.expires_after(std::chrono::milliseconds(100));
        retry_.async_wait([this](beast::error_code e) {
          if (!e) accept();
        });
        return;
      }
      try {
        std::make_shared<Exchange>(std::move(socket), metrics_, healthy_)->start();
      } catch (const std::exception& e) {
        Log::Lock(Log::Warning).logStreamLine() << "Metrics request dropped: " << e.what();
      }
      accept();
    });
  }

  const std::function<std::string()> metrics_;
  const std::function<bool()> healthy_;
  asio::io_context io_;
  tcp::acceptor acceptor_;
  asio::steady_timer retry_{io_};
  std::uint16_t port_ = 0;
  std::thread thread_;
};

MetricsServer::MetricsServer(const std::string& address, std::uint16_t port, std::function<std::string()> metrics,
                             std::function<bool()> healthy)
    : impl_(std::make_unique<Impl>(address, port, std::move(metrics), std::move(healthy))) {}

MetricsServer::~MetricsServer() = default;

std::uint16_t MetricsServer::port() const noexcept { return impl_->port(); }

}  // namespace DBServer
