#pragma once
// DBServer::MetricsServer: a small HTTP listener beside the client port for
// monitoring: GET /metrics answers the page that `metrics` builds
// (Prometheus text format), GET /healthz answers "ok" with 200 while
// `healthy` says so, else "stopping" with 503. Anything else is 404 (405
// for another method). One request per connection; a client that takes
// longer than 5 seconds to send it or read the answer is dropped.
//
// Serving starts in the constructor (std::runtime_error when the address
// cannot be bound) on one thread of its own and ends in the destructor.
// Thread safety: the callbacks run on that thread.

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace DBServer {

class MetricsServer {
 public:
  MetricsServer(const std::string& address, std::uint16_t port, std::function<std::string()> metrics,
                std::function<bool()> healthy);
  ~MetricsServer();
  MetricsServer(const MetricsServer&) = delete;
  MetricsServer& operator=(const MetricsServer&) = delete;

  std::uint16_t port() const noexcept;

 private:
  class Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace DBServer
