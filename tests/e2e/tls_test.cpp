// The client port over TLS and mutual TLS, through the client library and
// the cvdb tool, with certificates made for the run: who is served, who is
// refused (by the server or by the client), that a refusal ends only its
// own connection, and that TLS settings that cannot be used stop the start.

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "e2e_support.h"
#include "support/temp_dir.h"
#include "support/test_certs.h"

namespace {

using namespace e2e;
using testing_support::TestPki;

// One set of certificates for the whole suite.
class TlsTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    dir_ = std::make_unique<testing_support::TempDir>();
    pki_ = std::make_unique<TestPki>(dir_->path());
  }
  static void TearDownTestSuite() {
    pki_.reset();
    dir_.reset();
  }

  static const TestPki& pki() { return *pki_; }

  // A server on a free port with the server certificate (and the client CA
  // when mutual).
  static std::unique_ptr<ServerProcess> startServer(bool mutual) {
    testing_support::ServerOptions o;
    o.configJson = R"({"ServerPort": 0, "TlsCertFile": ")" + pki().server.cert + R"(", "TlsKeyFile": ")" +
                   pki().server.key + (mutual ? R"(", "TlsClientCAFile": ")" + pki().caFile : std::string()) + "\"}";
    return std::make_unique<ServerProcess>(kServer, o);
  }

  // Client options that trust the test CA, with the client certificate given.
  static cvdb::ClientOptions tlsOptions(const ServerProcess& server, const TestPki::Pair* cert = nullptr) {
    cvdb::ClientOptions o;
    o.port = server.port();
    o.ioTimeout = std::chrono::seconds(30);
    cvdb::TlsOptions& tls = o.tls.emplace();
    tls.caFile = pki().caFile;
    if (cert) {
      tls.certFile = cert->cert;
      tls.keyFile = cert->key;
    }
    return o;
  }

  // "served" when a client with these options gets its ping answered; else
  // the error that stopped it (at the handshake, or, with TLS 1.3, at the
  // first answer: a client learns that its certificate was refused only then).
  static std::string served(const cvdb::ClientOptions& o) {
    try {
      cvdb::Client c(o);
      c.ping();
      return "served";
    } catch (const cvdb::Error& e) {
      return e.what();
    }
  }

 private:
  static inline std::unique_ptr<testing_support::TempDir> dir_;
  static inline std::unique_ptr<TestPki> pki_;
};

TEST_F(TlsTest, ClientsAndTheToolWorkThroughTls) {
  const auto server = startServer(false);
  EXPECT_TRUE(server->waitForLogLine("Listening on port " + std::to_string(server->port()) + " (TLS)"));
  EXPECT_TRUE(server->waitForLogLine("client connections: TLS, certificate \"" + pki().server.cert));

  cvdb::Client c(tlsOptions(*server));
  ASSERT_TRUE(c.connect("Plant\\Secure"));
  c.setCfg("layout", json::strToObject(R"({"width": 3})"));
  EXPECT_EQ(c.getCfg("layout"), json::strToValue(R"({"width": 3})"));
  // Several records each way, and answers larger than one write.
  const std::string content = randomBytes(3 << 20, 7);
  c.setData("doc", "scan.bin", bytes(content));
  EXPECT_EQ(std::string(c.getData("doc", "scan.bin").view()), content);
  // Small answers queued back to back share records; all arrive in order.
  for (int i = 0; i < 50; ++i) c.ping();

  // By name as well as by address: the certificate carries both.
  cvdb::ClientOptions byName = tlsOptions(*server);
  byName.host = "localhost";
  EXPECT_EQ(served(byName), "served");

  const Tool cvdb = toolOf(*server, {"--tls", "--ca", pki().caFile});
  EXPECT_TRUE(has(ok(cvdb({"ping"})), "pong from 127.0.0.1:" + std::to_string(server->port())));
  EXPECT_EQ(ok(cvdb({"--db", "Plant\\Secure", "--json", "cfg", "get", "layout"})), "{\"width\":3}\n");
  // --ca alone implies --tls.
  EXPECT_EQ(toolOf(*server, {"--ca", pki().caFile})({"ping"}).status, 0);
}

TEST_F(TlsTest, APlainClientIsRefusedAndTheOthersAreServed) {
  const auto server = startServer(false);
  cvdb::Client bystander(tlsOptions(*server));
  bystander.ping();

  cvdb::ClientOptions plain;
  plain.port = server->port();
  plain.ioTimeout = std::chrono::seconds(10);
  cvdb::Client refused(plain);
  EXPECT_THROW(refused.ping(), cvdb::ConnectionEnded);
  ASSERT_TRUE(server->waitForLogLine("Ipc TLS handshake with 127.0.0.1:"));
  EXPECT_EQ(server->countLogLines("TLS handshake with"), 1u);

  // The plain tool fails as a lost connection, not as an unreachable server.
  EXPECT_EQ(toolOf(*server)({"ping"}).status, 1);
  bystander.ping();
  EXPECT_EQ(served(tlsOptions(*server)), "served");
}

TEST_F(TlsTest, TheClientRefusesAServerItCannotVerify) {
  const auto server = startServer(false);
  // A CA that did not sign the server's certificate.
  cvdb::ClientOptions untrusted = tlsOptions(*server);
  untrusted.tls->caFile = pki().otherCaFile;
  EXPECT_THROW(cvdb::Client{untrusted}, cvdb::ConnectFailed);
  // A name that the certificate does not carry.
  cvdb::ClientOptions wrongName = tlsOptions(*server);
  wrongName.tls->serverName = "db.example";
  try {
    cvdb::Client c(wrongName);
    ADD_FAILURE() << "a certificate for another name was accepted";
  } catch (const cvdb::ConnectFailed& e) {
    EXPECT_TRUE(has(e.what(), "certificate verify failed")) << e.what();
    EXPECT_TRUE(has(e.what(), "mismatch")) << e.what();
  }
  // The system's trusted CAs do not know the test CA either; the tool says
  // so with the status of an unreachable server.
  const auto r = toolOf(*server, {"--tls"})({"ping"});
  EXPECT_EQ(r.status, 3) << r.output;
  EXPECT_TRUE(has(r.output, "certificate verify failed")) << r.output;
  // The server goes on.
  EXPECT_EQ(served(tlsOptions(*server)), "served");
}

TEST_F(TlsTest, MutualTlsServesOnlyClientsWithACertificateFromItsCa) {
  const auto server = startServer(true);
  EXPECT_TRUE(server->waitForLogLine("Listening on port " + std::to_string(server->port()) + " (mutual TLS)"));
  cvdb::Client good(tlsOptions(*server, &pki().client));
  good.ping();

  struct Case {
    const char* what;
    const TestPki::Pair* cert;
    const char* serverSays;
  };
  for (const Case& c : {Case{"no certificate", nullptr, "peer did not return a certificate"},
                        Case{"another CA's certificate", &pki().otherClient, "certificate verify failed"},
                        Case{"an expired certificate", &pki().expiredClient, "certificate has expired"}}) {
    SCOPED_TRACE(c.what);
    EXPECT_NE(served(tlsOptions(*server, c.cert)), "served");
    EXPECT_TRUE(server->waitForLogLine(c.serverSays));
  }
  EXPECT_EQ(server->countLogLines("TLS handshake with 127.0.0.1:"), 3u);

  // The refusals ended their own connections only.
  good.ping();
  EXPECT_EQ(served(tlsOptions(*server, &pki().client)), "served");
  const Tool cvdb = toolOf(*server, {"--ca", pki().caFile, "--cert", pki().client.cert, "--key", pki().client.key});
  EXPECT_EQ(cvdb({"ping"}).status, 0);
  EXPECT_EQ(toolOf(*server, {"--ca", pki().caFile})({"ping"}).status, 1);
  EXPECT_EQ(toolOf(*server, {"--ca", pki().caFile, "--cert", pki().client.cert})({"ping"}).status, 2);
}

// Settings that ask for TLS and cannot have it stop the start, saying why;
// --check-config finds the same problems beforehand.
TEST_F(TlsTest, UnusableSettingsStopTheStartAndCheckConfigSaysSo) {
  const std::string missing = (std::filesystem::path(pki().caFile).parent_path() / "missing.pem").string();
  struct Case {
    std::string config;
    std::string says;
  };
  const std::string port = R"({"ServerPort": 0, )";
  for (const Case& c : {
           Case{port + R"("TlsCertFile": ")" + missing + R"(", "TlsKeyFile": ")" + pki().server.key + "\"}",
                "Cannot read the TLS certificate file \"" + missing + "\": No such file or directory"},
           Case{port + R"("TlsCertFile": ")" + pki().server.cert + R"(", "TlsKeyFile": ")" + pki().client.key + "\"}",
                "The TLS key file \"" + pki().client.key + "\" cannot be used: "},
           Case{port + R"("TlsCertFile": ")" + pki().server.cert + "\"}",
                "TlsCertFile and TlsKeyFile must be set together"},
           Case{port + R"("TlsCertFile": ")" + pki().server.cert + R"(", "TlsKeyFile": ")" + pki().server.key +
                    R"(", "TlsClientCAFile": ")" + missing + "\"}",
                "Cannot read the TLS client CA file \"" + missing + "\""},
           // A type error elsewhere does not leave the port in plain TCP.
           Case{R"({"ServerPort": "x", "TlsCertFile": ")" + missing + R"(", "TlsKeyFile": ")" + missing + "\"}",
                "Cannot read the TLS certificate file"},
       }) {
    SCOPED_TRACE(c.config);
    testing_support::ServerOptions o;
    o.configJson = c.config;
    o.waitUntilListening = false;
    ServerProcess server(kServer, o);
    EXPECT_EQ(server.wait(), 1);
    EXPECT_TRUE(server.waitForLogLine("Cannot serve clients over TLS: " + c.says));
    EXPECT_EQ(server.countLogLines("Listening on port"), 0u);

    testing_support::TempDir home;
    testing_support::writeFile(home / "db" / "config.json", c.config);
    const auto r = ServerProcess::run(
        kServer, {"--home", home.path().string(), "--log-dir", (home / "log").string(), "--check-config"});
    EXPECT_EQ(r.status, 1);
    EXPECT_TRUE(has(r.output, "The server would not start: " + c.says)) << r.output;
  }

  testing_support::TempDir home;
  testing_support::writeFile(home / "db" / "config.json", R"({"TlsCertFile": ")" + pki().server.cert +
                                                              R"(", "TlsKeyFile": ")" + pki().server.key +
                                                              R"(", "TlsClientCAFile": ")" + pki().caFile + "\"}");
  const auto r = ServerProcess::run(
      kServer, {"--home", home.path().string(), "--log-dir", (home / "log").string(), "--check-config"});
  EXPECT_EQ(r.status, 0) << r.output;
  EXPECT_TRUE(has(r.output, "\tclient connections: mutual TLS, certificate \"" + pki().server.cert)) << r.output;
}

}  // namespace
