#pragma once
// Helpers of the end-to-end tests: clients of a ServerProcess, the cvdb
// tool run against it, pack records, and the server's reason for ending a
// connection.

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "client/client.h"
#include "support/server_process.h"

namespace e2e {

using testing_support::ServerProcess;

inline const char* const kServer = CVDB_SERVER_PATH;
inline constexpr const char* kTerminating = "Terminating client connection due to processing error";

// A client of the server; connected to the database when db is not empty.
inline std::unique_ptr<cvdb::Client> clientOf(const ServerProcess& server, const std::string& db = "") {
  cvdb::ClientOptions o;
  o.port = server.port();
  o.ioTimeout = std::chrono::seconds(30);
  auto c = std::make_unique<cvdb::Client>(o);
  if (!db.empty()) {
    EXPECT_TRUE(c->connect(db)) << db;
  }
  return c;
}

// Runs op, which must end the connection; the reason it ended with.
inline std::string endedBy(const std::function<void()>& op) {
  try {
    op();
  } catch (const cvdb::ConnectionEnded& e) {
    return e.byServer() ? e.reason() : "(dropped) " + e.reason();
  }
  return "(not ended)";
}

inline SharedMemBuffer bytes(const std::string& text) { return SharedMemBuffer(MemBuffer::copyOf(text)); }

// A complete pack record.
inline Ipc::PackInfo complete(const std::string& id, const std::string& folder, std::int32_t status,
                              const std::string& name) {
  Ipc::PackInfoPartial p;
  p.name = name;
  p.owner = "anna";
  p.created = 1700000000;
  p.modified = 1700000100;
  p.docCount = 2;
  return Ipc::PackInfo(id, folder, status, p);
}

#ifdef CVDB_TOOL_PATH
// The cvdb tool against the server, with the given leading options.
struct Tool {
  std::vector<std::string> options;
  ServerProcess::Result operator()(std::vector<std::string> args) const {
    args.insert(args.begin(), options.begin(), options.end());
    return ServerProcess::run(CVDB_TOOL_PATH, args);
  }
};
inline Tool toolOf(const ServerProcess& server, const std::vector<std::string>& more = {}) {
  Tool t{{"--port", std::to_string(server.port())}};
  t.options.insert(t.options.end(), more.begin(), more.end());
  return t;
}
// The output of a run that must succeed.
inline std::string ok(const ServerProcess::Result& r) {
  EXPECT_EQ(r.status, 0) << r.output;
  return r.output;
}
#endif

inline bool has(const std::string& output, const std::string& text) { return output.find(text) != std::string::npos; }

// n bytes that follow from the seed and do not compress.
inline std::string randomBytes(std::size_t n, std::uint64_t seed) {
  std::mt19937_64 gen(seed);
  std::string out(n, '\0');
  for (std::size_t i = 0; i < n; i += 8) {
    const std::uint64_t word = gen();
    std::memcpy(out.data() + i, &word, std::min<std::size_t>(8, n - i));
  }
  return out;
}

// A number from the environment (rounds and seeds of the crash tests).
inline std::optional<std::uint64_t> envNumber(const char* name) {
  const char* text = std::getenv(name);
  if (text == nullptr || *text == '\0') return std::nullopt;
  return std::stoull(text);
}

}  // namespace e2e
