// The metrics listener of the real server: off unless configured; when on,
// /healthz answers and /metrics counts what clients do.

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>

#include "e2e_support.h"
#include "framework/unique_fd.h"

namespace {

using namespace e2e;

// A loopback port that was free a moment ago.
std::uint16_t freePort() {
  const UniqueFd fd(::socket(AF_INET, SOCK_STREAM, 0));
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof a;
  if (::bind(fd.get(), reinterpret_cast<sockaddr*>(&a), sizeof a) != 0 ||
      ::getsockname(fd.get(), reinterpret_cast<sockaddr*>(&a), &len) != 0) {
    return 0;
  }
  return ntohs(a.sin_port);
}

// The whole answer (status line, headers and body) to a GET of path.
std::string get(std::uint16_t port, const std::string& path) {
  const UniqueFd fd(::socket(AF_INET, SOCK_STREAM, 0));
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(port);
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&a), sizeof a) != 0) return "(no connection)";
  const std::string request = "GET " + path + " HTTP/1.1\r\nHost: localhost\r\nConnection: close\r\n\r\n";
  if (::send(fd.get(), request.data(), request.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(request.size())) {
    return "(not sent)";
  }
  std::string answer;
  char buffer[4096];
  for (ssize_t n; (n = ::recv(fd.get(), buffer, sizeof buffer, 0)) > 0;) answer.append(buffer, static_cast<size_t>(n));
  return answer;
}

// The value of a metric line ("name{labels} value"), -1 when absent.
double metric(const std::string& page, const std::string& series) {
  const auto at = page.find("\n" + series + " ");
  if (at == std::string::npos) return -1;
  return std::stod(page.substr(at + series.size() + 2));
}

TEST(Metrics, HealthAndCountersMoveWithTheClients) {
  const std::uint16_t port = freePort();
  ASSERT_NE(port, 0);
  testing_support::ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "MaxActiveClientsPerDB": 1, "MetricsPort": )" + std::to_string(port) + "}";
  ServerProcess server(kServer, o);
  ASSERT_TRUE(server.waitForLogLine("Metrics on http://127.0.0.1:" + std::to_string(port)));

  const std::string health = get(port, "/healthz");
  EXPECT_TRUE(health.starts_with("HTTP/1.1 200")) << health;
  EXPECT_TRUE(health.ends_with("\r\n\r\nok\n")) << health;
  EXPECT_TRUE(get(port, "/nothing").starts_with("HTTP/1.1 404"));

  const std::string before = get(port, "/metrics");
  EXPECT_TRUE(before.starts_with("HTTP/1.1 200")) << before;
  EXPECT_EQ(metric(before, "cvdb_requests_total{command=\"SetCfgPart\"}"), -1);
  {
    auto c = clientOf(server, "watched");
    for (int i = 0; i < 3; ++i) c->setCfg("k" + std::to_string(i), json::Object());
    const std::string during = get(port, "/metrics");
    EXPECT_EQ(metric(during, "cvdb_connections_open"), 1) << during;
    EXPECT_EQ(metric(during, "cvdb_databases_open"), 1) << during;
    EXPECT_EQ(metric(during, "cvdb_requests_total{command=\"SetCfgPart\"}"), 3) << during;
    EXPECT_EQ(metric(during, "cvdb_request_duration_seconds_count{command=\"SetCfgPart\"}"), 3) << during;
    EXPECT_EQ(metric(during, "cvdb_request_duration_seconds_bucket{command=\"SetCfgPart\",le=\"+Inf\"}"), 3);
    EXPECT_GT(metric(during, "cvdb_received_bytes_total"), metric(before, "cvdb_received_bytes_total"));
    EXPECT_EQ(metric(during, "cvdb_buffered_limit_bytes"), 256.0 * 1024 * 1024);
    // One writer alone: each write is a group of its own.
    EXPECT_EQ(metric(during, "cvdb_commit_groups_total") - metric(before, "cvdb_commit_groups_total"), 3) << during;
    EXPECT_EQ(metric(during, "cvdb_commit_grouped_requests_total"), metric(during, "cvdb_commit_groups_total"));
    // A second client of the database is refused at the limit.
    auto second = clientOf(server);
    EXPECT_EQ(endedBy([&] { second->connect("watched"); }), kTerminating);
    // A backup counts as a request when it starts and as an operation when
    // it ends.
    c->backup("", false);
    const std::string maintained = get(port, "/metrics");
    EXPECT_EQ(metric(maintained, "cvdb_sessions_refused_total{limit=\"MaxActiveClientsPerDB\"}"), 1) << maintained;
    EXPECT_EQ(metric(maintained, "cvdb_sessions_refused_total{limit=\"MaxActiveDBs\"}"), 0) << maintained;
    EXPECT_EQ(metric(maintained, "cvdb_maintenance_operations_total{command=\"Backup\",outcome=\"ok\"}"), 1);
    EXPECT_EQ(metric(maintained, "cvdb_maintenance_last_success{command=\"Backup\"}"), 1) << maintained;
    EXPECT_GE(metric(maintained, "cvdb_maintenance_last_duration_seconds{command=\"Backup\"}"), 0);
    EXPECT_GE(metric(maintained, "cvdb_transaction_retries_total"), 0);
    // A part read twice: one miss that is kept, one hit.
    for (int i = 0; i < 2; ++i) c->getCfg("k0");
    const std::string read = get(port, "/metrics");
    EXPECT_EQ(metric(read, "cvdb_read_cache_misses_total"), 1) << read;
    EXPECT_EQ(metric(read, "cvdb_read_cache_hits_total"), 1) << read;
    EXPECT_EQ(metric(read, "cvdb_read_cache_insertions_total"), 1) << read;
    EXPECT_EQ(metric(read, "cvdb_read_cache_entries"), 1) << read;
    EXPECT_GT(metric(read, "cvdb_read_cache_bytes"), 0) << read;
    EXPECT_EQ(metric(read, "cvdb_read_cache_limit_bytes"), 64.0 * 1024 * 1024) << read;
    // A request that fails ends its connection and counts as a failure.
    EXPECT_EQ(endedBy([&] { c->getData("..", "x"); }), kTerminating);
  }
  const std::string after = get(port, "/metrics");
  EXPECT_EQ(metric(after, "cvdb_request_failures_total{command=\"GetData\"}"), 1) << after;
  EXPECT_EQ(metric(after, "cvdb_request_failures_total{command=\"SetCfgPart\"}"), 0) << after;
}

TEST(Metrics, OffUnlessConfigured) {
  ServerProcess server(kServer);
  EXPECT_EQ(server.stop(), 0);  // every line it will write is written
  EXPECT_EQ(server.countLogLines("Metrics"), 0u);
}

}  // namespace
