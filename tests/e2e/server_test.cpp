// The cvdbserver executable end to end: its command line, its lifecycle
// under signals, and what crosses the wire when clients misbehave (the
// transport and Listener tests pin the rules case by case: malformed
// frames, vanishing clients, commands before Connect).

#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>
#include <string>
#include <vector>

#include "e2e_support.h"

namespace {

using namespace std::chrono_literals;
using namespace e2e;
using testing_support::ServerOptions;

std::string lengthPrefix(std::uint32_t length) {
  std::string s(4, '\0');
  for (int i = 0; i < 4; ++i) s[i] = static_cast<char>((length >> (8 * i)) & 0xFF);
  return s;
}

TEST(ServerCommandLine, VersionHelpAndBadOptions) {
  const auto version = ServerProcess::run(kServer, {"--version"});
  EXPECT_EQ(version.status, 0);
  EXPECT_EQ(version.output, "cvdbserver 6.1.7\n");
  const auto help = ServerProcess::run(kServer, {"--help"});
  EXPECT_EQ(help.status, 0);
  for (const char* option : {"--home", "--log-dir", "--console", "--version"}) {
    EXPECT_TRUE(has(help.output, option)) << option;
  }
  EXPECT_EQ(ServerProcess::run(kServer, {"--no-such-option"}).status, 2);
}

TEST(ServerLifecycle, EitherSignalStopsItPromptlyAndCleanlyWithIdleClientsConnected) {
  for (const int sig : {SIGTERM, SIGINT}) {
    SCOPED_TRACE(sig);
    ServerOptions o;
    if (sig == SIGINT) o.configJson = R"({"ServerPort": 0, "ExtraLog": true})";  // shows the service's steps
    ServerProcess server(kServer, o);
    std::vector<std::unique_ptr<cvdb::Client>> idle;
    for (int i = 0; i < 8; ++i) {
      idle.push_back(clientOf(server));
      idle.back()->ping();
    }
    const auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(server.stop(sig), 0);
    // One second for the server to let its clients go, the rest for the
    // process to start and end on a busy machine.
    EXPECT_LT(std::chrono::steady_clock::now() - t0, 3s);
    for (auto& c : idle) EXPECT_EQ(endedBy([&] { c->awaitEnd(); }), "Server is stopping");
    EXPECT_EQ(server.countLogLines(sig == SIGTERM ? "Stop requested by SIGTERM" : "Stop requested by SIGINT"), 1u);
    // The log file is in the service's subfolder of the log folder.
    EXPECT_TRUE(has(testing_support::readFile(server.logDir() / "svc" / "cvdbserver.log"), "Listening on port"));
    for (const char* line : {"Svc stopping...", "Svc stopped", "Svc object destroyed"}) {
      EXPECT_EQ(server.countLogLines(line), sig == SIGINT ? 1u : 0u) << line;
    }
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

TEST(ServerRequests, ARefusalKeepsTheConnectionAndAMalformedRequestEndsOnlyItsOwn) {
  ServerProcess server(kServer);
  auto bystander = clientOf(server);
  bystander->ping();

  // An unknown tag is refused and logged; the connection goes on.
  auto refused = clientOf(server);
  EXPECT_THROW(refused->request(20, ""), cvdb::Refused);
  EXPECT_TRUE(server.waitForLogLine(std::string("Ipc attempt to generate command with unknown tag: ") + '\x14'));
  refused->ping();

  // GetData (tag 7) with a string length that runs past its frame.
  auto malformed = clientOf(server);
  malformed->sendRaw(lengthPrefix(2 + 4 + 3) + std::string("\x07\x00", 2) + lengthPrefix(1000) + "abc");
  EXPECT_TRUE(endedBy([&] { malformed->awaitEnd(); }).starts_with("Malformed request GetData"));
  EXPECT_TRUE(server.waitForLogLine("Ipc Malformed request GetData from 127.0.0.1:"));
  bystander->ping();
}

}  // namespace
