// The cvdbserver executable end to end: its command line, its lifecycle
// under signals, and what crosses the wire when clients misbehave (the
// transport and Listener tests pin the rules case by case: malformed
// frames, vanishing clients, commands before Connect).

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "e2e_support.h"
#include "framework/wire.h"
#include "support/raw_db.h"

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
  for (const char* option : {"--home", "--log-dir", "--console", "--version", "--check-config"}) {
    EXPECT_TRUE(has(help.output, option)) << option;
  }
  EXPECT_EQ(ServerProcess::run(kServer, {"--no-such-option"}).status, 2);
}

// --check-config says what a start would take and fails on a file that
// would leave settings at their defaults.
TEST(ServerCommandLine, CheckConfigPrintsTheSettingsAndFailsOnWhatItCannotTake) {
  testing_support::TempDir home;
  const auto check = [&](const char* text) {
    std::filesystem::create_directories(home.path() / "db");
    if (text) testing_support::writeFile(home.path() / "db" / "config.json", text);
    return ServerProcess::run(
        kServer, {"--home", home.path().string(), "--log-dir", (home.path() / "log").string(), "--check-config"});
  };
  const auto missing = check(nullptr);
  EXPECT_EQ(missing.status, 1);
  EXPECT_TRUE(has(missing.output, "every setting is its default")) << missing.output;

  const auto good = check(R"({"ServerPort": 4000, "MaintenanceFolders": ["/srv/bak"]})");
  EXPECT_EQ(good.status, 0) << good.output;
  EXPECT_TRUE(has(good.output, "\tTCP listening port: 4000\n")) << good.output;
  EXPECT_TRUE(has(good.output, "\tmaintenance folders: \"/srv/bak/\"\n")) << good.output;

  for (const char* bad : {R"({"ServerPort": "4000"})", "not json"}) {
    const auto r = check(bad);
    EXPECT_EQ(r.status, 1) << bad;
    EXPECT_TRUE(has(r.output, "Not taken whole: ")) << r.output;
  }
  const auto unconfined = check(R"({"MaintenanceFolders": "/srv"})");
  EXPECT_EQ(unconfined.status, 1);
  EXPECT_TRUE(has(unconfined.output, "The server would not start: MaintenanceFolders: expected an array of folders"))
      << unconfined.output;
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
  EXPECT_TRUE(server.waitForLogLine("Ipc attempt to generate command with unknown tag: \\x14"));
  refused->ping();

  // GetData (tag 7) with a string length that runs past its frame.
  auto malformed = clientOf(server);
  malformed->sendRaw(lengthPrefix(2 + 4 + 3) + std::string("\x07\x00", 2) + lengthPrefix(1000) + "abc");
  EXPECT_TRUE(endedBy([&] { malformed->awaitEnd(); }).starts_with("Malformed request GetData"));
  EXPECT_TRUE(server.waitForLogLine("Ipc Malformed request GetData from 127.0.0.1:"));
  bystander->ping();
}

// A configuration part's JSON text is parsed where the command runs, not
// where its frame is read: valid parts, small and large, are stored in
// compact form, the delete form removes them, and each kind of bad part
// ends only its own connection with the parser's reason in the Bye and in
// the log, having stored nothing.
TEST(ServerRequests, ConfigurationTextsAreCheckedBeforeTheCommandRunsAndRefusedWithTheirReason) {
  ServerProcess server(kServer);
  auto owner = clientOf(server, "cfgtexts");
  const auto setCfg = [](const std::string& key, bool del, int present, const std::string& text) {
    std::string payload;
    wire::Writer w(payload);
    w.str(key);
    w.boolean(del);
    w.u8(static_cast<std::uint8_t>(present));
    if (present) w.str(text);
    return payload;
  };

  std::string big = "{ \"list\": [";
  std::string compact = "{\"list\":[";
  for (int i = 0; big.size() < (1 << 20); ++i) {
    big += (i ? ", " : "") + std::to_string(i);
    compact += (i ? "," : "") + std::to_string(i);
  }
  big += "] }";
  compact += "]}";
  EXPECT_EQ(owner->request(5, setCfg("big", false, 1, big)), "");
  EXPECT_EQ(owner->getCfg("big").dump(), compact);
  EXPECT_EQ(owner->request(5, setCfg("small", false, 1, R"({"b": [true, null], "a": "x"})")), "");
  EXPECT_EQ(owner->getCfg("small").dump(), R"({"b":[true,null],"a":"x"})");
  EXPECT_EQ(owner->request(5, setCfg("big", true, 0, "")), "");
  EXPECT_TRUE(owner->getCfg("big").empty());

  const std::vector<std::pair<std::string, std::string>> refused{
      {setCfg("bad", false, 1, "{\"a\":"), "JSON error: unexpected token near end of file at line 1, column 5"},
      {setCfg("bad", false, 1, "[1]"), "JSON error: Wrong type: array. Expected type: object"},
      {setCfg("bad", false, 1, "{\"a\":\"caf\xE9\"}"),
       "JSON error: unable to decode byte 0xe9 near '\"caf' at line 1, column 9"},
      {setCfg("bad", false, 0, ""), "SetCfgPart carries no data"},
      {setCfg("small", true, 1, "{}"), "SetCfgPart deletes and carries data"},
      {setCfg("small", true, 1, "{"), "JSON error: string or '}' expected near end of file at line 1, column 1"},
  };
  for (const auto& [payload, why] : refused) {
    SCOPED_TRACE(why);
    auto c = clientOf(server, "cfgtexts");
    const std::string& bytes = payload;  // clang before 16 cannot capture a structured binding
    EXPECT_EQ(endedBy([&] { c->request(5, bytes); }), "Malformed request SetCfgPart: " + why);
    EXPECT_TRUE(server.waitForLogLine(": " + why + "; connection ended"));
  }
  EXPECT_EQ(server.countLogLines("Ipc Malformed request SetCfgPart from 127.0.0.1:"), refused.size());
  EXPECT_TRUE(owner->getCfg("bad").empty());
  EXPECT_EQ(owner->getCfg("small").dump(), R"({"b":[true,null],"a":"x"})");
}

// The session of a connection that the server ends is given back when the
// Bye goes out, not when the client gets round to closing its socket: at
// the limit of one client per database, a second client connects at once.
TEST(ServerRequests, AnEndedConnectionsSessionIsFreeAtOnce) {
  testing_support::ServerOptions options;
  options.configJson = R"({"ServerPort": 0, "MaxActiveClientsPerDB": 1})";
  ServerProcess server(kServer, options);
  for (int round = 0; round < 3; ++round) {
    // A client that binds the database, sends a malformed request and,
    // having read the answers and the Bye, keeps its socket open.
    const int fd = ::socket(AF_INET, SOCK_STREAM, 0);
    ASSERT_GE(fd, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(server.port());
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    // A database of its own per round: the last round's second client may
    // still be leaving.
    const std::string db = "limited" + std::to_string(round);
    const std::string connect =
        lengthPrefix(2 + 4 + 8 + 4) + std::string("\x03\x00", 2) + lengthPrefix(8) + db + lengthPrefix(0);
    const std::string malformed = lengthPrefix(2 + 4 + 3) + std::string("\x07\x00", 2) + lengthPrefix(1000) + "abc";
    const std::string out = connect + malformed;
    ASSERT_EQ(::send(fd, out.data(), out.size(), MSG_NOSIGNAL), static_cast<ssize_t>(out.size()));
    std::string in;
    char buffer[512];
    while (in.find("Malformed request GetData") == std::string::npos) {
      const ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
      ASSERT_GT(n, 0) << "the server closed before its Bye: " << in;
      in.append(buffer, static_cast<std::size_t>(n));
    }
    auto second = clientOf(server);
    EXPECT_TRUE(second->connect(db)) << "round " << round;
    ::close(fd);
  }
}

// Uploads in progress when the server stops: the bytes that still arrive
// after the Bye must land nowhere (the sanitizer build would abort the
// server, and its exit status would not be 0). The rest of each frame is
// sent short of its last byte, so no request ever completes.
TEST(ServerLifecycle, AStopDuringLargeUploadsEndsThemCleanly) {
  ServerProcess server(kServer);
  const std::string body(200000, 'u');
  const std::string frame = lengthPrefix(2 + 4 + 8 + body.size()) + std::string("\x08\x00", 2) + body;
  std::vector<std::unique_ptr<cvdb::Client>> uploading;
  const std::vector<std::size_t> parts{4, 3000, 120000};
  for (const std::size_t part : parts) {
    uploading.push_back(clientOf(server));
    uploading.back()->ping();
    uploading.back()->sendRaw(frame.substr(0, part));
  }
  auto stopped = std::async(std::launch::async, [&] { return server.stop(); });
  ASSERT_TRUE(server.waitForLogLine("Stop requested by SIGTERM"));
  for (std::size_t i = 0; i < parts.size(); ++i) {
    auto& c = uploading[i];
    EXPECT_EQ(endedBy([&] {
                try {
                  c->sendRaw(frame.substr(parts[i], frame.size() - parts[i] - 1));
                } catch (const cvdb::ConnectionEnded&) {
                  // Closed before all of it went out.
                }
                c->awaitEnd();
              }),
              "Server is stopping");
  }
  EXPECT_EQ(stopped.get(), 0);
}

// Writers blocked on a database's write lock, held from outside the
// server, occupy at least every base I/O thread; other connections must
// still be answered within 50 ms, the whole time and round after round.
TEST(ServerRequests, WritersBlockedOnALockedDatabaseStallNoOtherConnection) {
  ServerProcess server(kServer);
  clientOf(server, "locked")->setCfg("k", json::Object());
  const unsigned writers = std::max(4u, std::thread::hardware_concurrency());
  auto pinger = clientOf(server);
  testing_support::RawDb raw(server.home() / "db" / "locked" / "cvdb.edb");
  for (int round = 0; round < 3; ++round) {
    SCOPED_TRACE(round);
    ASSERT_EQ(raw.exec("BEGIN IMMEDIATE"), 0);
    std::vector<std::future<void>> writes;
    for (unsigned i = 0; i < writers; ++i) {
      writes.push_back(std::async(std::launch::async, [&server, i] {
        clientOf(server, "locked")->setCfg("w" + std::to_string(i), json::Object());
      }));
    }
    // Past the watcher's quiet period, after which spares used to park.
    const auto until = std::chrono::steady_clock::now() + 1500ms;
    std::chrono::steady_clock::duration worst{};
    while (std::chrono::steady_clock::now() < until) {
      const auto t0 = std::chrono::steady_clock::now();
      pinger->ping();
      worst = std::max(worst, std::chrono::steady_clock::now() - t0);
      std::this_thread::sleep_for(10ms);
    }
    EXPECT_LT(worst, 50ms) << std::chrono::duration_cast<std::chrono::milliseconds>(worst).count() << " ms";
    ASSERT_EQ(raw.exec("COMMIT"), 0);
    for (auto& w : writes) w.get();
  }
}

}  // namespace
