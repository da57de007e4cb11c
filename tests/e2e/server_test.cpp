// The cvdbserver executable end to end: its command line, its lifecycle
// under signals, and how it treats clients that misbehave.

#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>
#include <string>
#include <vector>

#include "client/client.h"
#include "support/server_process.h"
#include "support/temp_dir.h"

namespace {

using namespace std::chrono_literals;
using testing_support::ServerOptions;
using testing_support::ServerProcess;

const char* const kServer = CVDB_SERVER_PATH;

cvdb::Client clientOf(const ServerProcess& server) {
  cvdb::ClientOptions o;
  o.port = server.port();
  o.ioTimeout = 10s;
  return cvdb::Client(o);
}

std::string lengthPrefix(std::uint32_t length) {
  std::string s(4, '\0');
  for (int i = 0; i < 4; ++i) s[i] = static_cast<char>((length >> (8 * i)) & 0xFF);
  return s;
}

// The server's reason for ending the connection, or "" when it did not.
std::string endReason(cvdb::Client& c) {
  try {
    c.awaitEnd();
  } catch (const cvdb::ConnectionEnded& e) {
    return e.byServer() ? e.reason() : "(dropped) " + e.reason();
  }
  return "";
}

TEST(ServerCommandLine, VersionHelpAndBadOptions) {
  const auto version = ServerProcess::run(kServer, {"--version"});
  EXPECT_EQ(version.status, 0);
  EXPECT_EQ(version.output, "cvdbserver 6.1.7\n");

  const auto help = ServerProcess::run(kServer, {"--help"});
  EXPECT_EQ(help.status, 0);
  for (const char* option : {"--home", "--log-dir", "--console", "--version"}) {
    EXPECT_NE(help.output.find(option), std::string::npos) << option;
  }

  const auto bad = ServerProcess::run(kServer, {"--no-such-option"});
  EXPECT_EQ(bad.status, 2);
}

TEST(ServerLifecycle, ServesAndStopsCleanlyOnEitherSignal) {
  for (const int sig : {SIGTERM, SIGINT}) {
    ServerProcess server(kServer);
    auto c = clientOf(server);
    c.ping();
    EXPECT_EQ(server.stop(sig), 0);
    EXPECT_EQ(server.countLogLines(sig == SIGTERM ? "Stop requested by SIGTERM" : "Stop requested by SIGINT"), 1u);
    // The log file is in the service's subfolder of the log folder.
    const auto file = server.logDir() / "svc" / "cvdbserver.log";
    ASSERT_TRUE(std::filesystem::exists(file));
    EXPECT_NE(testing_support::readFile(file).find("Listening on port"), std::string::npos);
  }
}

TEST(ServerLifecycle, VerboseLoggingShowsTheServiceSteps) {
  ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "ExtraLog": true})";
  ServerProcess server(kServer, o);
  ASSERT_EQ(server.stop(), 0);
  for (const char* line : {"Svc stopping...", "Svc stopped", "Svc object destroyed"}) {
    EXPECT_EQ(server.countLogLines(line), 1u) << line;
  }
}

TEST(ServerLifecycle, APortInUseEndsTheServerWithAFailure) {
  ServerProcess first(kServer);
  ServerOptions o;
  o.configJson = R"({"ServerPort": )" + std::to_string(first.port()) + "}";
  o.waitUntilListening = false;
  ServerProcess second(kServer, o);
  EXPECT_EQ(second.wait(), 1);
  EXPECT_TRUE(second.waitForLogLine("Service main failed. Cannot listen on port " + std::to_string(first.port())));
}

TEST(ServerLifecycle, StopsPromptlyWithIdleClientsConnected) {
  ServerProcess server(kServer);
  std::vector<std::unique_ptr<cvdb::Client>> idle;
  for (int i = 0; i < 20; ++i) {
    cvdb::ClientOptions o;
    o.port = server.port();
    idle.push_back(std::make_unique<cvdb::Client>(o));
    idle.back()->ping();
  }
  const auto t0 = std::chrono::steady_clock::now();
  EXPECT_EQ(server.stop(), 0);
  // One second for the server to let its clients go, the rest for the
  // process to start and end on a busy machine.
  EXPECT_LT(std::chrono::steady_clock::now() - t0, 3s);
  for (auto& c : idle) EXPECT_EQ(endReason(*c), "Server is stopping");
}

TEST(ServerRequests, UnknownTagsAreLoggedAndCreateNoCommand) {
  ServerProcess server(kServer);
  auto c = clientOf(server);
  for (const std::uint8_t tag : {2, 20}) {
    try {
      c.request(tag, "");
      ADD_FAILURE() << "tag " << int{tag} << " was answered";
    } catch (const cvdb::Refused& e) {
      EXPECT_EQ(e.tag(), tag);
    }
    const std::string line = std::string("Ipc attempt to generate command with unknown tag: ") + static_cast<char>(tag);
    EXPECT_TRUE(server.waitForLogLine(line));
  }
  c.ping();  // the connection goes on
}

TEST(ServerRequests, ADatabaseCommandBeforeConnectEndsOnlyThatConnection) {
  ServerProcess server(kServer);
  auto bystander = clientOf(server);
  bystander.ping();
  auto c = clientOf(server);
  try {
    c.getData("42", "scan.tif");
    ADD_FAILURE() << "GetData without a database was answered";
  } catch (const cvdb::ConnectionEnded& e) {
    EXPECT_TRUE(e.byServer());
    EXPECT_EQ(e.reason(), "Terminating client connection due to processing error");
  }
  EXPECT_TRUE(server.waitForLogLine(
      "Dispatching command GetData failed with No database associated with current connection. "
      "Connect command failed?"));
  bystander.ping();
}

TEST(ServerRequests, MalformedInputEndsOnlyThatConnection) {
  ServerProcess server(kServer);
  auto bystander = clientOf(server);
  bystander.ping();
  struct Case {
    std::string bytes;
    const char* reason;
  };
  // GetData (tag 7) with a string length that runs past its frame.
  std::string truncated = lengthPrefix(2 + 4 + 3) + std::string("\x07\x00", 2) + lengthPrefix(1000) + "abc";
  for (const Case& k : {Case{lengthPrefix(1) + "x", "Malformed frame: length out of range"},
                        Case{lengthPrefix(0xFFFFFFFF), "Malformed frame: length out of range"},
                        Case{lengthPrefix(2) + std::string("\x01\x01", 2), "Malformed frame: not a request"},
                        Case{truncated, "Malformed request GetData"}}) {
    auto c = clientOf(server);
    c.sendRaw(k.bytes);
    EXPECT_EQ(endReason(c).rfind(k.reason, 0), 0u) << k.reason;
    bystander.ping();
  }
  EXPECT_TRUE(server.waitForLogLine("Ipc Malformed request GetData from 127.0.0.1:"));
  EXPECT_EQ(server.countLogLines("Ipc Malformed frame from"), 3u);
}

TEST(ServerRequests, AClientThatVanishesMidRequestIsForgotten) {
  ServerProcess server(kServer);
  {
    auto c = clientOf(server);
    c.sendRaw(lengthPrefix(100) + std::string("\x07\x00", 2) + "partial");
  }
  EXPECT_TRUE(server.waitForLogLine("ended in the middle of a frame (13 of 104 bytes)"));
  auto after = clientOf(server);
  after.ping();
}

}  // namespace
