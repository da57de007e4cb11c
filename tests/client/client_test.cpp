// The client library over loopback against the real transport, once with
// the server's Listener and once with a scripted processor for the answers
// the Listener cannot give yet (data, progress streams, silence).

#include "client/client.h"

#include <gtest/gtest.h>

#include <future>
#include <thread>

#include "engine/db_instances.h"
#include "ipc/listener.h"
#include "support/log_capture.h"
#include "support/temp_dir.h"

namespace {

using namespace std::chrono_literals;
using testing_support::LogCapture;

constexpr const char* kTerminating = "Terminating client connection due to processing error";

cvdb::ClientOptions at(std::uint16_t port) {
  cvdb::ClientOptions o;
  o.port = port;
  o.ioTimeout = 10s;
  o.progressTimeout = 10s;
  return o;
}

class WithListener : public ::testing::Test {
 protected:
  LogCapture log;
  testing_support::TempDir dir;
  std::shared_ptr<Ipc::DB::Listener> listener =
      Ipc::DB::createListener(0, true,
                              DB::DBInstances::create(DB::PoolSettings{},
                                                      DB::Paths(dir.path().string() + "/", dir.path().string() + "/",
                                                                dir.path().string() + "/db.backup/", "cvdb.edb"),
                                                      sys::Env::posix()));
  std::uint16_t port = Ipc::DB::serverOf(*listener).port();

  ~WithListener() override {
    Ipc::DB::serverOf(*listener).signalStop();
    Ipc::DB::serverOf(*listener).waitToFinish();
  }
};

// The server's refusal is an answer; its end of the connection is reported
// with its reason by the next request, however late that comes, and every
// later call fails without a word from the server.
TEST_F(WithListener, ARefusalKeepsTheConnectionAndTheServersEndIsReportedByTheNextRequest) {
  cvdb::Client c(at(port));
  try {
    c.request(20, "");
    FAIL() << "tag 20 was answered";
  } catch (const cvdb::Refused& e) {
    EXPECT_EQ(e.tag(), 20);
  }
  c.ping();

  // A frame the server refuses by its length alone. The request waits until
  // the server has let the connection go, so that it never depends on the
  // server's grace for the peer to close.
  c.sendRaw(std::string("\xff\xff\xff\x7f\x07\x00", 6));
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (Ipc::DB::serverOf(*listener).connectionCount() > 0 && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(2ms);
  }
  ASSERT_EQ(Ipc::DB::serverOf(*listener).connectionCount(), 0u);
  try {
    c.ping();
    FAIL() << "the ping was answered";
  } catch (const cvdb::ConnectionEnded& e) {
    EXPECT_TRUE(e.byServer());
    EXPECT_TRUE(e.reason().starts_with("Malformed frame")) << e.reason();
  }
  EXPECT_FALSE(c.isOpen());
  try {
    c.ping();
    FAIL() << "a closed client sent a request";
  } catch (const cvdb::ConnectionEnded& e) {
    EXPECT_FALSE(e.byServer());
  }
}

// A processor with scripted answers, on a command server of its own.
class ScriptedProcessor : public Ipc::DB::CmdProcessorDBI {
 public:
  Ipc::SvcStub* server = nullptr;
  std::map<std::string, SharedMemBuffer> files;
  std::shared_future<void> release;  // what a silent command waits for

  // The streaming threads hold their commands, which hold this processor:
  // they are joined by the test, not by the destructor.
  void joinAll() {
    std::vector<std::thread> all;
    {
      std::lock_guard lock(mutex_);
      all.swap(threads_);
    }
    for (auto& t : all) t.join();
  }

  void processCmd(std::shared_ptr<Ipc::CmdI> cmd) override {
    try {
      cmd->accept(*this);
      server->onRespReady(cmd);
    } catch (const std::exception&) {
      cmd->onTransferError(kTerminating);
    }
  }

#define CVDB_UNSCRIPTED(tag, Class) \
  void process(Ipc::DB::Class&) override { throw std::runtime_error("not scripted"); }
  CVDB_UNSCRIPTED(3, Connect)
  CVDB_UNSCRIPTED(4, GetCfgPart)
  CVDB_UNSCRIPTED(5, SetCfgPart)
  CVDB_UNSCRIPTED(6, CfgIds)
  CVDB_UNSCRIPTED(9, GetPackInfos)
  CVDB_UNSCRIPTED(10, GetPackInfo)
  CVDB_UNSCRIPTED(11, UpdatePackInfo)
  CVDB_UNSCRIPTED(12, SavePack)
  CVDB_UNSCRIPTED(13, ChangeDocId)
  CVDB_UNSCRIPTED(15, ErasePack)
  CVDB_UNSCRIPTED(17, Restore)
  CVDB_UNSCRIPTED(19, DBNames)
#undef CVDB_UNSCRIPTED

  void process(Ipc::DB::SetData& cmd) override { files[cmd.id() + "/" + cmd.fileName()] = cmd.data(); }
  void process(Ipc::DB::GetData& cmd) override {
    const SharedMemBuffer& b = files[cmd.id() + "/" + cmd.fileName()];
    cmd.setResp(MemBuffer::copyOf(b.data(), b.size()));
  }
  // Fetching a pack is the command that never answers.
  void process(Ipc::DB::GetPack&) override { release.wait(); }

  // Backup streams from a thread of its own, as the server's maintenance
  // commands do; Cleanup fails the way they fail.
  void process(Ipc::DB::Backup& cmd) override {
    cmd.firstProgressMsg("Starting Database Backup...");
    auto self = std::static_pointer_cast<Ipc::DB::Backup>(cmd.shared_from_this());
    start([self] {
      for (std::uint32_t p = 20; p <= 100; p += 40) self->sendMoreProgress(p, "Copying " + std::to_string(p));
      self->sendNoMoreProgress();
    });
  }
  void process(Ipc::DB::Cleanup& cmd) override {
    cmd.firstProgressMsg("Starting Database Cleanup...");
    auto self = std::static_pointer_cast<Ipc::DB::Cleanup>(cmd.shared_from_this());
    start([self] {
      self->sendMoreProgress(100, "DB operation failed with error: Operation timeout!");
      self->onTransferError(kTerminating);
      self->sendNoMoreProgress();
    });
  }

 private:
  void start(std::function<void()> body) {
    std::lock_guard lock(mutex_);
    threads_.emplace_back(std::move(body));
  }

  std::mutex mutex_;
  std::vector<std::thread> threads_;
};

class WithScript : public ::testing::Test {
 protected:
  std::promise<void> releaseSilent;
  std::shared_ptr<ScriptedProcessor> processor = std::make_shared<ScriptedProcessor>();
  std::unique_ptr<Ipc::SvcStub> server;

  WithScript() {
    processor->release = releaseSilent.get_future().share();
    server = std::make_unique<Ipc::SvcStub>(0, true,
                                            [p = processor](std::uint8_t tag) { return Ipc::DB::makeCommand(tag, p); });
    processor->server = server.get();
  }
  ~WithScript() override {
    releaseSilent.set_value();
    processor->joinAll();
    server->signalStop();
    server->waitToFinish();
  }
};

TEST_F(WithScript, LargeContentTravelsBothWays) {
  cvdb::Client c(at(server->port()));
  std::string bytes(24 << 20, '\0');
  for (std::size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<char>((i * 131) >> 3);
  c.setData("doc", "scan.tif", SharedMemBuffer(MemBuffer::copyOf(bytes)));
  EXPECT_EQ(c.getData("doc", "scan.tif").view(), bytes);
  EXPECT_TRUE(c.getData("doc", "missing").empty());
}

TEST_F(WithScript, ProgressStreamsEndInSuccessOrInTheFailureMessage) {
  cvdb::Client c(at(server->port()));
  std::vector<std::pair<std::uint32_t, std::string>> seen;
  c.backup("", false, [&](std::uint32_t p, const std::string& t) { seen.emplace_back(p, t); });
  const std::vector<std::pair<std::uint32_t, std::string>> expected = {
      {0, "Starting Database Backup..."}, {20, "Copying 20"}, {60, "Copying 60"}, {100, "Copying 100"}};
  EXPECT_EQ(seen, expected);
  c.ping();  // the connection goes on after a successful stream

  seen.clear();
  try {
    c.cleanup({"a"}, [&](std::uint32_t p, const std::string& t) { seen.emplace_back(p, t); });
    FAIL() << "a failed cleanup reported success";
  } catch (const cvdb::OperationFailed& e) {
    EXPECT_EQ(e.reason(), "DB operation failed with error: Operation timeout!");
  }
  ASSERT_EQ(seen.size(), 2u);
  EXPECT_EQ(seen[1].first, 100u);
  EXPECT_FALSE(c.isOpen());
}

TEST_F(WithScript, AnAnswerThatDoesNotComeInTimeClosesTheClient) {
  cvdb::ClientOptions o = at(server->port());
  o.ioTimeout = 200ms;
  cvdb::Client c(o);
  try {
    c.getPack("P1");
    FAIL() << "an answer arrived";
  } catch (const cvdb::ConnectionEnded& e) {
    EXPECT_FALSE(e.byServer());
  }
  EXPECT_FALSE(c.isOpen());
}

}  // namespace
