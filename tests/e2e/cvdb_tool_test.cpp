// The cvdb tool against the real server: what it prints and which exit
// status it gives for success, for the server's refusals and for a server
// that cannot be reached.

#include <gtest/gtest.h>

#include "support/server_process.h"
#include "support/temp_dir.h"

namespace {

using testing_support::ServerProcess;

const char* const kServer = CVDB_SERVER_PATH;
const char* const kTool = CVDB_TOOL_PATH;

struct Tool {
  std::uint16_t port;
  ServerProcess::Result operator()(std::vector<std::string> args) const {
    args.insert(args.begin(), {"--port", std::to_string(port)});
    return ServerProcess::run(kTool, args);
  }
};

bool has(const ServerProcess::Result& r, const std::string& text) {
  return r.output.find(text) != std::string::npos;
}

TEST(CvdbTool, PingsTheServer) {
  ServerProcess server(kServer);
  const Tool cvdb{server.port()};
  auto r = cvdb({"ping"});
  EXPECT_EQ(r.status, 0) << r.output;
  EXPECT_TRUE(has(r, "pong from 127.0.0.1:" + std::to_string(server.port()))) << r.output;

  r = cvdb({"--json", "ping"});
  EXPECT_EQ(r.status, 0) << r.output;
  EXPECT_EQ(r.output.rfind("{\"ok\":true,\"ms\":", 0), 0u) << r.output;

  r = cvdb({"--json", "dbs"});
  EXPECT_EQ(r.status, 0) << r.output;
  EXPECT_EQ(r.output, "[]\n");
}

TEST(CvdbTool, SaysPlainlyWhenTheServerEndsTheConnection) {
  ServerProcess server(kServer);
  const Tool cvdb{server.port()};
  // Bound to a database without opening it: the command fails on the
  // server, which ends the connection.
  const auto r = cvdb({"--db", "demo", "--open-mode", "2", "cfg", "get", "layout"});
  EXPECT_EQ(r.status, 1) << r.output;
  EXPECT_TRUE(has(r, "cvdb: the server ended the connection: Terminating client connection due to processing error"))
      << r.output;
  EXPECT_TRUE(server.waitForLogLine("Dispatching command "));
}

TEST(CvdbTool, ConfigurationPartsAndDataFilesFromFilesAndBack) {
  ServerProcess server(kServer);
  const Tool cvdb{server.port()};
  testing_support::TempDir dir;
  std::string bytes(300000, '\0');
  for (std::size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<char>(i * 7 + 3);
  testing_support::writeFile(dir / "in.bin", bytes);
  testing_support::writeFile(dir / "part.json", R"({"columns": ["id", "name"], "width": 3})");

  const auto ok = [](const ServerProcess::Result& r) {
    EXPECT_EQ(r.status, 0) << r.output;
    return r.output;
  };
  ok(cvdb({"--db", "Plant\\Line 2", "cfg", "set", "layout", "--file", (dir / "part.json").string()}));
  ok(cvdb({"--db", "Plant\\Line 2", "cfg", "set", "other", R"({"a": 1})"}));
  EXPECT_EQ(ok(cvdb({"--db", "Plant\\Line 2", "--json", "cfg", "get", "layout"})),
            "{\"columns\":[\"id\",\"name\"],\"width\":3}\n");
  EXPECT_EQ(ok(cvdb({"--db", "Plant\\Line 2", "--json", "cfg", "ls", "lay"})), "[\"layout\"]\n");
  ok(cvdb({"--db", "Plant\\Line 2", "cfg", "rm", "layout"}));
  EXPECT_EQ(ok(cvdb({"--db", "Plant\\Line 2", "--json", "cfg", "get", "layout"})), "null\n");

  ok(cvdb({"--db", "Plant\\Line 2", "data", "put", "doc-1", "scan.bin", (dir / "in.bin").string()}));
  ok(cvdb({"--db", "Plant\\Line 2", "data", "get", "doc-1", "scan.bin", "-o", (dir / "out.bin").string()}));
  EXPECT_EQ(testing_support::readFile(dir / "out.bin"), bytes);

  EXPECT_EQ(ok(cvdb({"--json", "dbs"})), "[\"plant\\\\line 2\"]\n");

  const auto missing = cvdb({"--db", "nowhere", "--open-mode", "1", "cfg", "ls"});
  EXPECT_EQ(missing.status, 1) << missing.output;
  EXPECT_TRUE(has(missing, "cvdb: Database nowhere does not exist")) << missing.output;
}

TEST(CvdbTool, LocalMistakesAndAnUnreachableServerHaveTheirOwnStatus) {
  std::uint16_t port;
  {
    ServerProcess server(kServer);
    port = server.port();
    const Tool cvdb{port};
    auto r = cvdb({"pack", "info", "P1"});
    EXPECT_EQ(r.status, 2) << r.output;
    EXPECT_TRUE(has(r, "needs --db NAME")) << r.output;
    r = cvdb({"--db", "demo", "cfg", "set", "k", "[1,2]"});
    EXPECT_EQ(r.status, 2) << r.output;
    r = cvdb({"no-such-subcommand"});
    EXPECT_EQ(r.status, 2) << r.output;
  }
  const auto r = Tool{port}({"ping"});
  EXPECT_EQ(r.status, 3) << r.output;
  EXPECT_TRUE(has(r, "cannot connect")) << r.output;
}

}  // namespace
