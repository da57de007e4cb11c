// The Listener's factory, its dispatch and failure path, and the handlers
// that need no store, on connections without a network.

#include "ipc/listener.h"

#include <gtest/gtest.h>

#include <algorithm>

#include "engine/db_instances.h"
#include "protocol/fake_socket.h"
#include "support/log_capture.h"
#include "support/temp_dir.h"

namespace {

using namespace Ipc::DB;
using testing_support::FakeSocket;
using testing_support::LogCapture;

constexpr const char* kNoDatabase = "No database associated with current connection. Connect command failed?";
constexpr const char* kTerminating = "Terminating client connection due to processing error";

// A pool of databases below root.
std::shared_ptr<DB::DBInstances> poolAt(const std::filesystem::path& root) {
  const std::string r = root.string() + "/";
  return DB::DBInstances::create(DB::PoolSettings{}, DB::Paths(r, r, r + "db.backup/", "cvdb.edb"), sys::Env::posix());
}

struct ListenerTest : ::testing::Test {
  testing_support::TempDir dir;
  std::vector<std::shared_ptr<Ipc::CmdI>> answered;
  std::shared_ptr<Listener> listener = Listener::createDetached(
      [this](const std::shared_ptr<Ipc::CmdI>& cmd) { answered.push_back(cmd); }, poolAt(dir / "db"));
  std::shared_ptr<FakeSocket> socket = std::make_shared<FakeSocket>();
  LogCapture log;

  std::shared_ptr<Ipc::CmdI> received(std::uint8_t tag) {
    auto cmd = listener->makeCmd(tag);
    if (cmd) cmd->attachSocket(socket);
    return cmd;
  }
};

TEST_F(ListenerTest, KnownTagsBuildCommandsThatShareTheListenerAndUnknownOnesAreLoggedAsACharacter) {
  for (const CmdEntry& e : kCommandTable) {
    auto cmd = listener->makeCmd(e.tag);
    ASSERT_NE(cmd, nullptr) << e.name;
    EXPECT_EQ(cmd->name(), e.name);
    EXPECT_EQ(cmd->processor(), e.tag == Ipc::PingPong::kTag ? nullptr : listener);
  }
  EXPECT_TRUE(log.entries().empty());
  for (const int tag : {0, 2, 20, 65, 255}) {
    log.clear();
    EXPECT_EQ(listener->makeCmd(static_cast<std::uint8_t>(tag)), nullptr) << tag;
    // The tag byte as it was sent, made printable by the log.
    const std::string line =
        Log::printable(std::string("Ipc attempt to generate command with unknown tag: ") + static_cast<char>(tag));
    const auto entries = log.entries();
    ASSERT_EQ(entries.size(), 1u) << tag;
    EXPECT_EQ(entries[0].priority, Log::Error);
    EXPECT_TRUE(entries[0].text.ends_with(line)) << tag;
  }
}

TEST_F(ListenerTest, CommandsThatNeedADatabaseEndTheirConnectionBeforeAnyConnect) {
  for (const std::uint8_t tag : {4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15}) {
    socket = std::make_shared<FakeSocket>();
    log.clear();
    auto cmd = received(tag);
    listener->processCmd(cmd);
    EXPECT_TRUE(log.contains(Log::Error, "Dispatching command " + cmd->name() + " failed with " + kNoDatabase))
        << cmd->name();
    EXPECT_FALSE(socket->isOpen());
    EXPECT_EQ(socket->closeReason(), kTerminating);
    EXPECT_TRUE(socket->frames().empty());
  }
  EXPECT_TRUE(answered.empty());
}

TEST_F(ListenerTest, OnlyTheListenersOwnBindingCountsAsADatabase) {
  struct Foreign : Ipc::ConnInf {};
  auto cmd = received(GetData::kTag);
  EXPECT_THROW(Listener::dbOfConn(*cmd), std::runtime_error);
  socket->connInf() = std::make_unique<Foreign>();
  try {
    Listener::dbOfConn(*cmd);
    FAIL() << "a foreign record was taken for a database binding";
  } catch (const std::runtime_error& e) {
    EXPECT_STREQ(e.what(), kNoDatabase);
  }
  auto binding = std::make_unique<Listener::ConnDB>(poolAt(dir / "db"), "plant");
  Listener::ConnDB* raw = binding.get();
  socket->connInf() = std::move(binding);
  EXPECT_EQ(&Listener::dbOfConn(*cmd), &raw->db);

  GetData unattached;
  EXPECT_THROW(Listener::dbOfConn(unattached), std::runtime_error);
}

TEST_F(ListenerTest, AFailureWhileAnsweringEndsTheConnectionAndOtherExceptionsPropagate) {
  // A handler that succeeds (DBNames over an empty root) but whose answer
  // cannot be handed on.
  const auto pool = poolAt(dir / "none");
  auto failing =
      Listener::createDetached([](const std::shared_ptr<Ipc::CmdI>&) { throw std::runtime_error("send"); }, pool);
  auto cmd = failing->makeCmd(DBNames::kTag);
  cmd->attachSocket(socket);
  failing->processCmd(cmd);
  EXPECT_TRUE(log.contains(Log::Error, "Dispatching command DBNames failed with send"));
  EXPECT_EQ(socket->closeReason(), kTerminating);

  auto odd = Listener::createDetached([](const std::shared_ptr<Ipc::CmdI>&) { throw 42; }, pool);
  cmd = odd->makeCmd(DBNames::kTag);
  EXPECT_THROW(odd->processCmd(cmd), int);

  // Transport errors are only logged, as warnings.
  auto other = std::make_shared<FakeSocket>();
  listener->onIpcError(other, "Malformed frame from 127.0.0.1:1");
  EXPECT_TRUE(log.contains(Log::Warning, "Ipc Malformed frame from 127.0.0.1:1"));
  EXPECT_TRUE(other->isOpen());
}

// Only real databases: not the server's own folders, not a file of the
// database file's name among another database's data files (a client may
// name a data file so), not a file directly in the root.
TEST_F(ListenerTest, DBNamesListsEveryDatabaseBelowTheRootButNothingElse) {
  // A root that does not exist yet holds no database.
  listener->processCmd(received(DBNames::kTag));
  ASSERT_EQ(answered.size(), 1u);
  EXPECT_TRUE(std::static_pointer_cast<DBNames>(answered[0])->respList().empty());
  answered.clear();

  const auto root = dir / "db";
  const auto db = [&](const std::string& rel) { testing_support::writeFile(root / rel / "cvdb.edb", "x"); };
  db("plant");
  db("plant/line2");
  db("other/deep/er");
  db("db.backup/old");
  db("db.temp/work");
  db("plant/d/x");  // a data file named like the database file
  db("plant/d/x/d/y");
  db("docs/d/cvdb.edb/z");  // below a data folder of a folder that is no database
  std::filesystem::create_directory_symlink(root / "plant", root / "link");
  testing_support::writeFile(root / "notes" / "cvdb.edb.bak", "x");
  testing_support::writeFile(root / "cvdb.edb", "x");  // not inside a folder below the root

  auto cmd = received(DBNames::kTag);
  listener->processCmd(cmd);
  ASSERT_EQ(answered.size(), 1u);
  auto names = std::static_pointer_cast<DBNames>(answered[0])->respList();
  std::sort(names.begin(), names.end());
  EXPECT_EQ(names, (std::vector<std::string>{"other\\deep\\er", "plant", "plant\\line2"}));
  EXPECT_TRUE(socket->isOpen());
}

}  // namespace
