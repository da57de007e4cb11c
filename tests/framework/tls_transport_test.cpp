// The command server with TLS on, over real loopback sockets: frames in
// both directions (many small ones at once, and a large answer), a peer
// that never starts its handshake, and a stop while a handshake is open.

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <memory>
#include <string>

#include "client/frame_socket.h"
#include "fake_processor.h"
#include "framework/svc_stub.h"
#include "raw_client.h"
#include "support/temp_dir.h"
#include "support/test_certs.h"

namespace transport_test {
namespace {

using namespace std::chrono_literals;

#if defined(__SANITIZE_THREAD__)
constexpr int kSlow = 4;
#else
constexpr int kSlow = 1;
#endif

class TlsTransportTest : public ::testing::Test {
 protected:
  void start(std::chrono::milliseconds stallTimeout) {
    Ipc::SvcStub::Options o;
    o.stallTimeout = stallTimeout * kSlow;
    o.closeGrace = 300ms;
    o.ioThreads = 2;
    o.tls = {pki.server.cert, pki.server.key, ""};
    proc = std::make_shared<FakeProcessor>();
    server = std::make_unique<Ipc::SvcStub>(
        0, false, proc->factory(),
        [this](const std::shared_ptr<Ipc::Socket>&, const std::string& text) {
          std::lock_guard lock(mutex);
          reports.push_back(text);
        },
        o);
    proc->server = server.get();
  }
  void TearDown() override {
    if (!server) return;
    proc->openGate();
    server->signalStop();
    server->waitToFinish();
    proc->joinThreads();
  }
  std::unique_ptr<cvdb::FrameSocket> tlsClient() {
    cvdb::TlsOptions tls;
    tls.caFile = pki.caFile;
    return std::make_unique<cvdb::FrameSocket>("127.0.0.1", server->port(), 10s, &tls);
  }
  bool reported(const std::string& fragment) {
    std::lock_guard lock(mutex);
    for (const auto& r : reports) {
      if (r.find(fragment) != std::string::npos) return true;
    }
    return false;
  }
  template <typename Pred>
  static bool eventually(Pred pred) {
    const auto deadline = std::chrono::steady_clock::now() + 10s * kSlow;
    while (!pred()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(5ms);
    }
    return true;
  }

  testing_support::TempDir dir;
  testing_support::TestPki pki{dir.path()};
  std::shared_ptr<FakeProcessor> proc;
  std::unique_ptr<Ipc::SvcStub> server;
  std::mutex mutex;
  std::vector<std::string> reports;
};

TEST_F(TlsTransportTest, FramesGoBothWaysWholeAndInOrder) {
  start(30s);
  const auto c = tlsClient();
  // A hundred requests in one go: their answers are queued together and
  // leave in shared records.
  std::string burst;
  for (int i = 0; i < 100; ++i) burst += requestBytes(kEcho, strField("echo " + std::to_string(i)));
  c->sendRaw(burst.data(), burst.size(), 10s);
  for (int i = 0; i < 100; ++i) {
    const auto f = c->receive(10s);
    ASSERT_EQ(f.kind, wire::FrameKind::Answer);
    EXPECT_EQ(f.reader().str(), "echo " + std::to_string(i));
  }
  // An answer far larger than a record, written in many steps.
  const std::uint64_t before = server->bytesSent();
  const std::string big = requestBytes(kBig, strField("5000000"));
  c->sendRaw(big.data(), big.size(), 10s);
  const auto f = c->receive(30s);
  ASSERT_EQ(f.kind, wire::FrameKind::Answer);
  wire::Reader in = f.reader();
  const SharedMemBuffer bytes = in.sharedBytes();
  ASSERT_EQ(bytes.size(), 5000000u);
  for (std::size_t i = 0; i < bytes.size(); i += 4999) EXPECT_EQ(bytes.data()[i], static_cast<unsigned char>(i * 7));
  // The counters count the frames' bytes, not the records'.
  EXPECT_GE(server->bytesSent() - before, 5000000u);
  EXPECT_LT(server->bytesSent() - before, 5001000u);
}

TEST_F(TlsTransportTest, APeerThatNeverStartsItsHandshakeIsClosedAfterTheStallTimeout) {
  start(300ms);
  RawClient silent(server->port());
  ASSERT_TRUE(eventually([&] { return server->connectionCount() == 1; }));
  // Served meanwhile: the silent peer holds no thread.
  const auto c = tlsClient();
  const std::string ping = requestBytes(kEcho, strField("still here"));
  c->sendRaw(ping.data(), ping.size(), 10s);
  EXPECT_EQ(c->receive(10s).reader().str(), "still here");
  // Closed without a frame: no TLS session to carry one.
  EXPECT_FALSE(silent.read(10s * kSlow).has_value());
  EXPECT_TRUE(eventually([&] { return reported("did not complete within"); }));
  c->close();
  EXPECT_TRUE(eventually([&] { return server->connectionCount() == 0; }));
}

TEST_F(TlsTransportTest, AStopClosesAConnectionInItsHandshakeAtOnce) {
  start(60s);
  RawClient silent(server->port());
  ASSERT_TRUE(eventually([&] { return server->connectionCount() == 1; }));
  const auto t0 = std::chrono::steady_clock::now();
  server->signalStop();
  auto done = std::async(std::launch::async, [&] { server->waitToFinish(); });
  ASSERT_EQ(done.wait_for(10s * kSlow), std::future_status::ready);
  EXPECT_LT(std::chrono::steady_clock::now() - t0, 5s * kSlow);
  EXPECT_FALSE(silent.read(1s).has_value());
}

}  // namespace
}  // namespace transport_test
