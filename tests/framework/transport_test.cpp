// The command server over real loopback sockets: framing, refusal of bad
// input, one command at a time per connection, progress streams, stalls,
// vanishing clients, stop, and many connections.

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <future>
#include <thread>

#include "fake_processor.h"
#include "framework/svc_stub.h"
#include "framework/wire.h"
#include "raw_client.h"

namespace transport_test {
namespace {

using namespace std::chrono_literals;
using wire::FrameKind;

// Deadlines stretch under ThreadSanitizer, which runs the transport (and a
// test's megabytes of frames) five to fifteen times slower.
#if defined(__SANITIZE_THREAD__)
constexpr int kSlow = 4;
#else
constexpr int kSlow = 1;
#endif

// The reports that the transport hands to its error handler.
class Reports {
 public:
  void add(const std::string& text) {
    std::lock_guard lock(mutex_);
    texts_.push_back(text);
    changed_.notify_all();
  }
  bool has(const std::string& fragment) {
    std::lock_guard lock(mutex_);
    return std::any_of(texts_.begin(), texts_.end(), [&](const auto& t) { return t.find(fragment) != t.npos; });
  }
  bool waitFor(const std::string& fragment) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, 10s * kSlow, [&] {
      return std::any_of(texts_.begin(), texts_.end(), [&](const auto& t) { return t.find(fragment) != t.npos; });
    });
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> texts_;
};

template <typename Pred>
bool eventually(Pred pred) {
  const auto deadline = std::chrono::steady_clock::now() + 10s * kSlow;
  while (!pred()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(5ms);
  }
  return true;
}

class TransportTest : public ::testing::Test {
 protected:
  void SetUp() override { start(); }
  void TearDown() override { stop(); }

  void start(bool forceIp4 = false) {
    Ipc::SvcStub::Options o;
    o.stallTimeout = stallTimeout * kSlow;
    o.closeGrace = 300ms;
    o.ioThreads = 2;
    o.memoryBudget = memoryBudget;
    proc = std::make_shared<FakeProcessor>();
    server = std::make_unique<Ipc::SvcStub>(
        0, forceIp4, proc->factory(),
        [this](const std::shared_ptr<Ipc::Socket>&, const std::string& text) { reports.add(text); }, o);
    proc->server = server.get();
  }
  void stop() {
    if (!server) return;
    proc->openGate();
    server->signalStop();
    server->waitToFinish();
    proc->joinThreads();
    server.reset();
  }
  std::uint16_t port() const { return server->port(); }
  void restartWithBudget(std::uint64_t bytes, std::chrono::milliseconds stall = 300ms) {
    stop();
    memoryBudget = bytes;
    stallTimeout = stall;
    start();
  }

  Reports reports;
  std::uint64_t memoryBudget = Ipc::SvcStub::kDefaultMemoryBudget;
  std::chrono::milliseconds stallTimeout = 300ms;
  std::shared_ptr<FakeProcessor> proc;
  std::unique_ptr<Ipc::SvcStub> server;
};

// The text of the next frame, which must be an answer.
std::string answerOf(RawClient& c) {
  const auto f = c.read(30s);
  return f && f->kind == FrameKind::Answer ? f->text() : "(no answer)";
}

std::string echo(RawClient& c, const std::string& text) {
  c.send(requestBytes(kEcho, strField(text)));
  return answerOf(c);
}

void expectBye(RawClient& c, const std::string& reasonStart) {
  const auto last = c.readUntilClosed();
  ASSERT_TRUE(last) << "the server closed without a Bye";
  EXPECT_EQ(last->kind, FrameKind::Bye);
  EXPECT_EQ(last->tag, 0);
  EXPECT_TRUE(last->text().starts_with(reasonStart)) << last->text();
}

std::string lengthOnly(std::uint32_t length) {
  std::string s;
  wire::Writer(s).u32(length);
  return s;
}

TEST_F(TransportTest, AnswersOverIpv4AndIpv6UnlessForcedToIpv4) {
  EXPECT_TRUE(RawClient(port()).ping());
  RawClient v6(port(), true);
  EXPECT_EQ(echo(v6, "hello"), "hello");
  stop();
  start(true);
  EXPECT_TRUE(RawClient(port()).ping());
  EXPECT_FALSE(RawClient::tryConnect(port(), true));
}

TEST_F(TransportTest, UnknownTagsAreRefusedWithoutCommandAndTheConnectionGoesOn) {
  RawClient c(port());
  for (const std::uint8_t tag : {0, 2, 20, 255}) {
    c.send(requestBytes(tag, "ignored payload"));
    const auto f = c.read();
    ASSERT_TRUE(f);
    EXPECT_EQ(f->kind, FrameKind::Refused);
    EXPECT_EQ(f->tag, tag);
    EXPECT_EQ(f->text(), "Unknown command tag " + std::to_string(tag));
  }
  EXPECT_EQ(proc->created, 0);
  EXPECT_TRUE(c.ping());
  EXPECT_EQ(proc->processed, 0);
}

// Input the transport refuses, and processors that fail: each ends its own
// connection with a Bye and a report, and no other.
TEST_F(TransportTest, MalformedInputAndProcessorFaultsEndOnlyTheirConnection) {
  const std::vector<std::tuple<std::string, std::string, std::string>> cases{
      {lengthOnly(0), "Malformed frame: length", "length 0 is out of range"},
      {lengthOnly(1) + "x", "Malformed frame: length", "length 1 is out of range"},
      // Refused on the header alone: no body follows and none is awaited.
      {lengthOnly(wire::kMaxBody + 1), "Malformed frame: length", "is out of range"},
      {frameBytes(1, FrameKind::Answer), "Malformed frame: not a request", "is not a request"},
      // A string that runs past its frame, and bytes after the last field.
      {requestBytes(kEcho, lengthOnly(100) + "abc"), "Malformed request Test10", "Malformed request Test10"},
      {requestBytes(kEcho, strField("x") + "zz"), "Malformed request Test10", "trailing"},
      {requestBytes(1, "p"), "Malformed request PingPong", "Malformed request PingPong"},
      {requestBytes(kFactoryThrows), "Terminating client connection", "Cannot create a command for tag 18"},
      // Found malformed where the command runs, before its processor sees
      // it: the same texts as a request that is malformed in its frame.
      {requestBytes(kFinishFails, strField("x")), "Malformed request Test21: deferred x",
       "deferred x; connection ended"},
      // From here on the request reaches the processor.
      {requestBytes(kThrowOther, strField("x")), "Terminating client connection", "failed with an unknown exception"},
      {requestBytes(kSilent, strField("x")), "Terminating client connection", "ended without an answer"},
      {requestBytes(kHangup, strField("x")), "Hung up by the processor", ""},
  };
  RawClient bystander(port());
  for (const auto& [bytes, bye, report] : cases) {
    SCOPED_TRACE(report);
    RawClient bad(port());
    bad.send(bytes);
    expectBye(bad, bye);
    EXPECT_TRUE(reports.waitFor(report));
    EXPECT_TRUE(bystander.ping());
  }
  EXPECT_TRUE(reports.waitFor("Malformed request Test21 from 127.0.0.1:"));
  EXPECT_EQ(proc->processed, 3);
}

TEST_F(TransportTest, AStalledFrameIsDroppedWhileAnIdleConnectionIsKept) {
  RawClient idle(port());
  RawClient header(port());
  RawClient body(port());
  header.send(std::string("\x10\x00", 2));
  body.send(requestBytes(kEcho, strField("0123456789")).substr(0, 9));
  expectBye(header, "Frame incomplete for too long");
  expectBye(body, "Frame incomplete for too long");
  EXPECT_TRUE(reports.waitFor("sent part of a frame and nothing more"));
  // The idle connection has outlived the stall timeout several times over.
  EXPECT_TRUE(idle.ping());
}

// A connection ended while a frame is still arriving, at every stage of a
// large frame: what the client sends after the Bye must land nowhere (the
// sanitizer build sees any write into a released buffer) and the server
// must go on serving others. Ended by the stall rule, by a malformed frame
// read together with the start of a large one, and by the server's stop.
TEST_F(TransportTest, BytesArrivingAfterAConnectionEndedWithinAFrameLandNowhere) {
  const std::string large = requestBytes(kEcho, strField(std::string(300000, 'l')));
  const std::string more(64 * 1024, 'm');
  // Keeps sending for a while after the Bye; the server may close first.
  const auto keepSending = [&](RawClient& c) {
    try {
      for (int i = 0; i < 8; ++i) c.send(more);
    } catch (const std::runtime_error&) {
      // The close grace ended meanwhile.
    }
  };
  const auto byeThenMore = [&](RawClient& c, const std::string& reason) {
    const auto bye = c.read();
    ASSERT_TRUE(bye && bye->kind == FrameKind::Bye);
    EXPECT_TRUE(bye->text().starts_with(reason)) << bye->text();
    keepSending(c);
  };
  RawClient bystander(port());
  const std::vector<std::pair<std::string, std::string>> stalls{
      {large.substr(0, 2), "header"},     // inside the length field
      {large.substr(0, 3000), "stage"},   // a frame larger than the stage, started
      {large.substr(0, 150000), "body"},  // deep into its own buffer
  };
  for (const auto& [bytes, where] : stalls) {
    SCOPED_TRACE(where);
    RawClient c(port());
    c.send(bytes);
    byeThenMore(c, "Frame incomplete for too long");
    EXPECT_TRUE(bystander.ping());
  }
  {
    RawClient c(port());
    c.send(frameBytes(1, FrameKind::Answer) + large.substr(0, 100000));
    byeThenMore(c, "Malformed frame: not a request");
    EXPECT_TRUE(bystander.ping());
  }
  // The stop ends uploads in progress at every stage.
  std::vector<RawClient> uploading;
  for (const std::size_t part : {std::size_t{2}, std::size_t{3000}, std::size_t{150000}}) {
    uploading.emplace_back(port());
    uploading.back().send(large.substr(0, part));
  }
  ASSERT_TRUE(eventually([&] { return server->connectionCount() == 4; }));
  auto stopped = std::async(std::launch::async, [&] { stop(); });
  for (auto& c : uploading) byeThenMore(c, "Server is stopping");
  stopped.get();
}

TEST_F(TransportTest, AClientVanishingMidRequestMidAnswerOrMidCommandLeavesNothingBehind) {
  // Mid-frame, within the first bytes and deep into a long body.
  RawClient(port()).send(lengthOnly(100) + std::string("\x0a\x00", 2) + "partial");
  RawClient(port()).send(requestBytes(kEcho, strField(std::string(100000, 'x'))).substr(0, 50000));
  EXPECT_TRUE(reports.waitFor("ended in the middle of a frame (13 of 104 bytes)"));
  EXPECT_TRUE(reports.waitFor("ended in the middle of a frame (50000 of 100010 bytes)"));
  EXPECT_TRUE(eventually([&] { return server->connectionCount() == 0; }));
  EXPECT_EQ(proc->processed, 0);

  {
    RawClient c(port());
    c.send(requestBytes(kSlot, strField("slot")));
    ASSERT_TRUE(c.read());
    EXPECT_EQ(proc->liveSlots, 1);
    // An answer far larger than the socket buffers, never read.
    c.send(requestBytes(kBig, strField("67108864")));
    ASSERT_TRUE(proc->waitStarted("67108864"));
    c.close(true);
  }
  EXPECT_TRUE(eventually([&] { return server->connectionCount() == 0 && proc->liveSlots == 0; }));

  // While a command runs its connection reads nothing, so the end of the
  // peer (reset or close) shows once the command is done.
  {
    RawClient reset(port());
    RawClient closed(port());
    reset.send(requestBytes(kBlock, strField("reset")));
    closed.send(requestBytes(kBlock, strField("closed")));
    ASSERT_TRUE(proc->waitStarted("reset") && proc->waitStarted("closed"));
    reset.close(true);
  }
  proc->openGate();
  EXPECT_TRUE(eventually([&] { return server->connectionCount() == 0; }));
  // The answers of the orphaned commands go nowhere; the server goes on.
  EXPECT_TRUE(RawClient(port()).ping());
  EXPECT_TRUE(eventually([&] { return proc->disconnects == 3; }));
}

TEST_F(TransportTest, ProgressFromAnotherThreadPrecedesTheNextRequest) {
  RawClient c(port());
  // The ping is sent at once but must be read only after the stream's end.
  c.send(requestBytes(kProgress, strField("p")) + requestBytes(1));
  for (const std::uint32_t percent : {0u, 25u, 50u, 75u}) {
    const auto f = c.read();
    ASSERT_TRUE(f && f->tag == kProgress && f->kind == FrameKind::Progress);
    EXPECT_EQ(wire::Reader(f->payload).u32(), percent);
  }
  const auto end = c.read();
  ASSERT_TRUE(end && end->tag == kProgress && end->kind == FrameKind::ProgressEnd);
  const auto pong = c.read();
  ASSERT_TRUE(pong);
  EXPECT_EQ(pong->tag, 1);
  EXPECT_EQ(pong->kind, FrameKind::Answer);
}

TEST_F(TransportTest, CommandsOfOneConnectionRunInOrderAndBlockedOnesStallNoOtherConnection) {
  // Twice as many blocked connections as the server has I/O threads; the
  // first has a second request waiting behind its blocked one.
  std::vector<RawClient> blocked;
  for (int i = 0; i < 4; ++i) {
    blocked.emplace_back(port());
    const std::string text = "b" + std::to_string(i);
    blocked.back().send(requestBytes(kBlock, strField(text)) + (i == 0 ? requestBytes(kEcho, strField("after")) : ""));
    ASSERT_TRUE(proc->waitStarted(text));
  }
  RawClient other(port());
  EXPECT_EQ(echo(other, "still served"), "still served");

  proc->openGate();
  for (int i = 0; i < 4; ++i) EXPECT_EQ(answerOf(blocked[i]), "b" + std::to_string(i));
  EXPECT_EQ(answerOf(blocked[0]), "after");
  const auto ev = proc->events();
  const auto pos = [&](const std::string& e) { return std::find(ev.begin(), ev.end(), e) - ev.begin(); };
  EXPECT_LT(pos("start:still served"), pos("end:b0"));
  EXPECT_LT(pos("end:b0"), pos("start:after"));
}

// The rest of a request's decoding (a large JSON text's parse) runs where
// the command runs: while it takes its time on more connections than the
// server has I/O threads, others are served, and each command then runs
// with its request complete.
TEST_F(TransportTest, RequestsFinishingTheirDecodingStallNoOtherConnection) {
  std::vector<RawClient> finishing;
  for (int i = 0; i < 4; ++i) {
    finishing.emplace_back(port());
    const std::string text = "f" + std::to_string(i);
    finishing.back().send(requestBytes(kFinishBlocks, strField(text)));
    ASSERT_TRUE(proc->waitFor("finish:" + text));
  }
  RawClient other(port());
  EXPECT_TRUE(other.ping());
  EXPECT_EQ(echo(other, "still served"), "still served");
  EXPECT_EQ(proc->processed, 1);

  proc->openGate();
  for (int i = 0; i < 4; ++i) EXPECT_EQ(answerOf(finishing[i]), "f" + std::to_string(i));
  const auto ev = proc->events();
  const auto pos = [&](const std::string& e) { return std::find(ev.begin(), ev.end(), e) - ev.begin(); };
  for (int i = 0; i < 4; ++i) {
    const std::string text = "f" + std::to_string(i);
    EXPECT_LT(pos("finish:" + text), pos("start:" + text));
  }
}

TEST_F(TransportTest, LargeAndPipelinedFramesRoundTripIntactAndInOrder) {
  // Megabytes in each direction: a loaded machine may pause either side
  // for longer than the short stall timeout of the other tests.
  restartWithBudget(Ipc::SvcStub::kDefaultMemoryBudget, 10s);
  RawClient c(port());
  std::string text(8 << 20, '\0');
  for (std::size_t i = 0; i < text.size(); ++i) text[i] = static_cast<char>(i * 31 + 7);
  EXPECT_TRUE(echo(c, text) == text);

  // An answer whose bytes travel as a shared tail.
  c.send(requestBytes(kBig, strField("3000000")));
  const auto big = c.read(30s);
  ASSERT_TRUE(big);
  const auto bytes = wire::Reader(big->payload).bytes();
  ASSERT_EQ(bytes.size(), 3000000u);
  std::size_t wrong = 0;
  for (std::size_t i = 0; i < bytes.size(); ++i) wrong += bytes[i] != static_cast<char>(i * 7);
  EXPECT_EQ(wrong, 0u);

  std::string burst;
  for (int i = 0; i < 2000; ++i) burst += i % 2 ? requestBytes(1) : requestBytes(kEcho, strField(std::to_string(i)));
  c.send(burst);
  for (int i = 0; i < 2000; ++i) {
    const auto f = c.read();
    ASSERT_TRUE(f && f->tag == (i % 2 ? 1 : kEcho));
    if (i % 2 == 0) {
      ASSERT_EQ(f->text(), std::to_string(i));
    }
  }
}

TEST_F(TransportTest, AClientThatStopsReadingIsDisconnected) {
  RawClient c(port());
  c.send(requestBytes(kBig, strField("67108864")));
  EXPECT_TRUE(reports.waitFor("has not read its answers"));
  EXPECT_TRUE(eventually([&] { return server->connectionCount() == 0; }));
}

// A stop lets a running command deliver its answer before the Bye (its
// work is done: a Bye would report it as failed), runs nothing pipelined
// behind it, and ends idle connections at once.
TEST_F(TransportTest, StopDeliversTheAnswerOfARunningCommandThenSaysGoodbye) {
  RawClient idle(port());
  RawClient c(port());
  c.send(requestBytes(kSlot, strField("s")));
  ASSERT_TRUE(c.read());
  c.send(requestBytes(kBlock, strField("running")) + requestBytes(kEcho, strField("pipelined")));
  ASSERT_TRUE(proc->waitStarted("running"));

  server->signalStop();
  expectBye(idle, "Server is stopping");
  auto done = std::async(std::launch::async, [&] { server->waitToFinish(); });
  EXPECT_EQ(done.wait_for(200ms), std::future_status::timeout);
  proc->openGate();
  EXPECT_EQ(answerOf(c), "running");
  expectBye(c, "Server is stopping");
  done.get();
  EXPECT_EQ(proc->liveSlots, 0);
  EXPECT_EQ(proc->events().back(), "end:running");
}

TEST_F(TransportTest, AStopGivesUpOnACommandThatOutlastsItsGrace) {
  stop();
  Ipc::SvcStub::Options o;
  o.closeGrace = 300ms;
  o.stopGrace = 100ms;
  proc = std::make_shared<FakeProcessor>();
  server = std::make_unique<Ipc::SvcStub>(0, false, proc->factory(), nullptr, o);
  proc->server = server.get();

  RawClient c(port());
  c.send(requestBytes(kBlock, strField("stuck")));
  ASSERT_TRUE(proc->waitStarted("stuck"));
  server->signalStop();
  expectBye(c, "Server is stopping");
  proc->openGate();
  server->waitToFinish();
}

TEST_F(TransportTest, DestroyingTheServerStopsItAndASocketHeldBeyondItStaysSafeToUse) {
  {
    RawClient c(port());
    c.send(requestBytes(kSlot, strField("keep")));
    ASSERT_TRUE(c.read());
    server.reset();
    expectBye(c, "Server is stopping");
  }
  // What a maintenance thread may still do with its command's socket.
  auto socket = std::move(proc->keptSocket);
  ASSERT_TRUE(socket);
  EXPECT_FALSE(socket->isOpen());
  socket->send(wire::OutFrame{std::string(8, 'x'), {}});
  socket->commandDone();
  socket->close("late");
  // No command was running when the connection ended: its slot went then,
  // not with the last reference to the socket.
  EXPECT_EQ(proc->liveSlots, 0);
  socket.reset();
}

long residentBytes() {
  std::ifstream statm("/proc/self/statm");
  long pages = 0;
  long resident = 0;
  statm >> pages >> resident;
  return resident * ::sysconf(_SC_PAGESIZE);
}

TEST_F(TransportTest, AThousandIdleConnectionsAreCheapAndAStopLetsThemAllGoPromptly) {
  rlimit l{};
  ::getrlimit(RLIMIT_NOFILE, &l);
  l.rlim_cur = l.rlim_max;
  ::setrlimit(RLIMIT_NOFILE, &l);
  // Each connection costs this process two descriptors; with a low limit
  // only the stop is checked.
  const std::size_t n = std::min<std::size_t>(1000, (l.rlim_cur - 100) / 2);
  std::vector<RawClient> clients;
  clients.reserve(n);
  for (std::size_t i = 0; i < 20; ++i) clients.emplace_back(port(), i % 2 == 1);  // warm the allocator and threads
  for (auto& c : clients) ASSERT_TRUE(c.ping());
  const long before = residentBytes();
  while (clients.size() < n) clients.emplace_back(port());
  for (auto& c : clients) ASSERT_TRUE(c.ping());
  ASSERT_TRUE(eventually([&] { return server->connectionCount() == n; }));
  const long grown = residentBytes() - before;
  std::printf("[ measure  ] %zu more idle connections: %.1f MiB resident\n", n - 20, grown / 1048576.0);
  EXPECT_TRUE(n < 1000 || grown < (64L << 20));

  const auto t0 = std::chrono::steady_clock::now();
  EXPECT_TRUE(server->signalStop());
  EXPECT_FALSE(server->signalStop());
  server->waitToFinish();
  EXPECT_LT(std::chrono::steady_clock::now() - t0, 1s);
  EXPECT_EQ(server->connectionCount(), 0u);
  for (auto& c : clients) expectBye(c, "Server is stopping");
  EXPECT_FALSE(RawClient::tryConnect(port(), false));
}

TEST_F(TransportTest, RunningOutOfDescriptorsRefusesNewConnectionsAndKeepsServing) {
  RawClient served(port());
  ASSERT_TRUE(served.ping());
  // The answer may leave before the server has dropped the first request;
  // the second is read only after that. Under UBSan this matters: its
  // first dynamic type check of a request's destruction probes memory
  // through a pipe, which fails once descriptors run out and is then
  // reported as an invalid object.
  ASSERT_TRUE(served.ping());

  // Sockets made before the limit drops, connected after it.
  std::vector<int> pending;
  for (int i = 0; i < 8; ++i) pending.push_back(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  rlimit saved{};
  ::getrlimit(RLIMIT_NOFILE, &saved);
  int highest = 0;
  for (int fd = 0; fd < 65536 && fd < static_cast<int>(saved.rlim_cur); ++fd) {
    if (::fcntl(fd, F_GETFD) != -1) highest = fd;
  }
  rlimit tight = saved;
  tight.rlim_cur = highest + 1;
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &tight), 0);
  // Fill the holes below the limit: not one more descriptor for anyone.
  std::vector<int> fillers;
  for (int fd; (fd = ::open("/dev/null", O_RDONLY | O_CLOEXEC)) >= 0;) fillers.push_back(fd);

  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(port());
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  for (const int fd : pending) ::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
  const bool reported = reports.waitFor("Cannot accept a connection");
  // The refused clients see their connection end without a word.
  char byte = 0;
  pollfd p{pending.front(), POLLIN, 0};
  const ssize_t got = ::poll(&p, 1, 10000) == 1 ? ::recv(pending.front(), &byte, 1, 0) : -2;
  for (const int fd : fillers) ::close(fd);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &saved), 0);
  for (const int fd : pending) ::close(fd);

  EXPECT_TRUE(reported);
  EXPECT_EQ(got, 0);
  EXPECT_TRUE(served.ping());
  EXPECT_TRUE(RawClient(port()).ping());
}

// ---------------------------------------------------------------- memory budget

constexpr std::uint64_t kSmallBudget = 1 << 20;

// Sends bytes on another thread: a request that waits for the budget is not
// read, and its sender blocks once the socket buffers are full.
std::future<void> sendAsync(RawClient& c, std::string bytes) {
  return std::async(std::launch::async, [&c, b = std::move(bytes)] { c.send(b); });
}

TEST_F(TransportTest, PastTheMemoryBudgetNewRequestsWaitUntilAClientThatDoesNotReadIsEnded) {
  restartWithBudget(kSmallBudget);
  RawClient hog(port());
  hog.send(requestBytes(kBig, strField("67108864")));
  ASSERT_TRUE(eventually([&] { return server->bufferedBytes() > kSmallBudget; }));

  // Neither a new command nor a new large frame starts.
  RawClient small(port());
  RawClient large(port());
  const std::string text(600000, 'x');
  small.send(requestBytes(kEcho, strField("small")));
  auto sent = sendAsync(large, requestBytes(kEcho, strField(text)));
  ASSERT_TRUE(eventually([&] { return server->connectionsWaitingForMemory() == 2; }));
  EXPECT_TRUE(reports.has("Memory budget of 1 MiB reached"));

  // The stall timer ends the hog, and only that lets the others go on.
  EXPECT_EQ(answerOf(small), "small");
  EXPECT_TRUE(reports.has("has not read its answers"));
  EXPECT_TRUE(answerOf(large) == text);
  sent.get();
  EXPECT_EQ(server->connectionsWaitingForMemory(), 0u);
  // Everything counted is given back once the answers are read.
  EXPECT_TRUE(eventually([&] { return server->bufferedBytes() == 0; }));
}

TEST_F(TransportTest, AClientThatReadsItsLargeAnswerLateLetsTheWaitingRequestsGoOn) {
  // A stall timeout long enough that the slow reader is not ended.
  restartWithBudget(kSmallBudget, 20s);
  RawClient reader(port());
  RawClient other(port());
  reader.send(requestBytes(kBig, strField("67108864")));
  ASSERT_TRUE(eventually([&] { return server->bufferedBytes() > kSmallBudget; }));
  other.send(requestBytes(kEcho, strField("after the reader")));
  ASSERT_TRUE(eventually([&] { return server->connectionsWaitingForMemory() == 1; }));
  const auto big = reader.read(30s);
  ASSERT_TRUE(big && big->kind == FrameKind::Answer);
  EXPECT_EQ(answerOf(other), "after the reader");
  EXPECT_EQ(server->connectionCount(), 2u);
  EXPECT_TRUE(eventually([&] { return server->bufferedBytes() == 0; }));
}

// A large frame counts its whole length from its first bytes until its
// command ends; a frame that waits for room is not read meanwhile, and the
// stall timer, which counts only frames partly read, leaves it alone
// however long the wait.
TEST_F(TransportTest, ALargeFrameWaitsForRoomBeyondTheStallTimeoutAndThenGoesOn) {
  restartWithBudget(kSmallBudget);
  RawClient holder(port());
  const std::string held(700000, 'h');
  auto heldSent = sendAsync(holder, requestBytes(kBlock, strField(held)));
  ASSERT_TRUE(proc->waitStarted(held));
  heldSent.get();
  EXPECT_GE(server->bufferedBytes(), held.size());

  RawClient waiter(port());
  const std::string text(700000, 'w');
  auto sent = sendAsync(waiter, requestBytes(kEcho, strField(text)));
  ASSERT_TRUE(eventually([&] { return server->connectionsWaitingForMemory() == 1; }));
  // Three stall timeouts: the span under test, not a synchronisation.
  std::this_thread::sleep_for(3 * 300ms * kSlow);
  EXPECT_FALSE(reports.has("sent part of a frame"));
  EXPECT_EQ(server->connectionCount(), 2u);

  proc->openGate();
  EXPECT_TRUE(answerOf(holder) == held);
  EXPECT_TRUE(answerOf(waiter) == text);
  sent.get();
  EXPECT_TRUE(eventually([&] { return server->bufferedBytes() == 0; }));
}

TEST_F(TransportTest, AFrameLargerThanTheWholeBudgetIsServedWhenNothingElseIsCounted) {
  restartWithBudget(kSmallBudget);
  // Alone, at once.
  RawClient c(port());
  std::string text(3 << 20, '\0');
  for (std::size_t i = 0; i < text.size(); ++i) text[i] = static_cast<char>(i * 13 + 1);
  EXPECT_TRUE(echo(c, text) == text);

  // Beside a running command's reservation it waits for that to end.
  RawClient holder(port());
  const std::string held(100000, 'h');
  holder.send(requestBytes(kBlock, strField(held)));
  ASSERT_TRUE(proc->waitStarted(held));
  auto sent = sendAsync(c, requestBytes(kEcho, strField(text)));
  ASSERT_TRUE(eventually([&] { return server->connectionsWaitingForMemory() == 1; }));
  proc->openGate();
  EXPECT_TRUE(answerOf(holder) == held);
  EXPECT_TRUE(answerOf(c) == text);
  sent.get();

  // Connections that end with answers queued give them back.
  c.send(requestBytes(kBig, strField("67108864")));
  ASSERT_TRUE(eventually([&] { return server->bufferedBytes() > kSmallBudget; }));
  c.close(true);
  EXPECT_TRUE(eventually([&] { return server->bufferedBytes() == 0; }));
}

}  // namespace
}  // namespace transport_test
