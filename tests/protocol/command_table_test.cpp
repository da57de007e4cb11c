// The command table, dispatch to the processor, the progress stream, and the
// protocol document kept in step with the table.

#include <gtest/gtest.h>

#include <fstream>
#include <sstream>
#include <thread>

#include "protocol/commands.h"
#include "protocol/fake_socket.h"

namespace {

using namespace Ipc::DB;
using testing_support::FakeSocket;

// Records which process overload each command reached.
class RecordingProcessor : public CmdProcessorDBI {
 public:
  std::string last;
  void processCmd(std::shared_ptr<Ipc::CmdI>) override {}
#define CVDB_RECORD(tag, Class) \
  void process(Class&) override { last = #Class; }
  CVDB_DB_COMMANDS(CVDB_RECORD)
#undef CVDB_RECORD
};

TEST(CommandTable, EveryTagBuildsItsClassAndReachesItsOwnHandler) {
  auto processor = std::make_shared<RecordingProcessor>();
  std::set<std::uint8_t> tags;
  for (const CmdEntry& e : kCommandTable) {
    EXPECT_TRUE(tags.insert(e.tag).second) << "duplicate tag " << int(e.tag);
    auto cmd = makeCommand(e.tag, processor);
    ASSERT_NE(cmd, nullptr) << e.name;
    EXPECT_EQ(cmd->tag(), e.tag);
    EXPECT_EQ(cmd->name(), e.name);
    if (e.tag == Ipc::PingPong::kTag) {
      EXPECT_EQ(cmd->processor(), nullptr);
      continue;
    }
    EXPECT_EQ(cmd->processor(), processor);
    processor->last.clear();
    cmd->accept(*processor);
    EXPECT_EQ(processor->last, e.name);
    EXPECT_EQ(cmd->streamsProgress(), e.name == "Backup" || e.name == "Restore" || e.name == "Cleanup");
  }
  for (int tag = 0; tag < 256; ++tag) {
    if (!tags.count(static_cast<std::uint8_t>(tag))) {
      EXPECT_EQ(makeCommand(static_cast<std::uint8_t>(tag), processor), nullptr) << tag;
    }
  }
  EXPECT_EQ(tags, (std::set<std::uint8_t>{1, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16, 17, 18, 19}));
}

TEST(CommandTable, AcceptRefusesAForeignProcessor) {
  struct Other : Ipc::CmdProcessorI {
    void processCmd(std::shared_ptr<Ipc::CmdI>) override {}
  } other;
  GetData cmd;
  EXPECT_THROW(cmd.accept(other), std::bad_cast);
}

TEST(CommandTable, TheProtocolDocumentDescribesEveryCommand) {
  std::ifstream in(std::string(CVDB_SOURCE_DIR) + "/docs/protocol.md");
  ASSERT_TRUE(in) << "docs/protocol.md is missing";
  std::stringstream text;
  text << in.rdbuf();
  for (const CmdEntry& e : kCommandTable) {
    const std::string heading = "### Tag " + std::to_string(e.tag) + ": " + std::string(e.name);
    EXPECT_NE(text.str().find(heading), std::string::npos) << "no section \"" << heading << "\"";
  }
}

struct Progress {
  std::uint32_t percent;
  std::string text;
};

Progress progressOf(const testing_support::SentFrame& f) {
  wire::Reader in(f.payload);
  auto [p, t] = ProgressCmdsBase::readProgress(in);
  return {p, t};
}

TEST(ProgressStream, FirstMoreAndEndInOrderAndTheEndOnlyOnce) {
  auto socket = std::make_shared<FakeSocket>();
  Backup cmd;
  cmd.attachSocket(socket);
  cmd.firstProgressMsg("Starting Database Backup...");
  cmd.sendMoreProgress(40, "Copying");
  cmd.sendNoMoreProgress();
  cmd.sendMoreProgress(100, "late");  // after the end: dropped
  cmd.sendNoMoreProgress();           // once only

  const auto frames = socket->frames();
  ASSERT_EQ(frames.size(), 3u);
  for (const auto& f : frames) EXPECT_EQ(f.tag, Backup::kTag);
  EXPECT_EQ(frames[0].kind, wire::FrameKind::Progress);
  EXPECT_EQ(progressOf(frames[0]).percent, 0u);
  EXPECT_EQ(progressOf(frames[0]).text, "Starting Database Backup...");
  EXPECT_EQ(progressOf(frames[1]).percent, 40u);
  EXPECT_EQ(progressOf(frames[1]).text, "Copying");
  EXPECT_EQ(frames[2].kind, wire::FrameKind::ProgressEnd);
  EXPECT_TRUE(frames[2].payload.empty());
  EXPECT_EQ(socket->doneCalls(), 1);
}

TEST(ProgressStream, SendsAfterTheConnectionWentOrWithoutOneAreHarmless) {
  auto socket = std::make_shared<FakeSocket>();
  auto cmd = std::make_shared<Cleanup>();
  cmd->attachSocket(socket);
  cmd->firstProgressMsg("Starting Database Cleanup...");
  socket->close("gone");
  std::thread worker([cmd] {
    cmd->sendMoreProgress(50, "half");
    cmd->sendNoMoreProgress();
  });
  worker.join();
  EXPECT_EQ(socket->frames().size(), 1u);

  Restore unattached;
  EXPECT_NO_THROW(unattached.firstProgressMsg("x"));
  EXPECT_NO_THROW(unattached.sendNoMoreProgress());
}

TEST(ProgressStream, TheEndIsLastWhenThreadsRace) {
  for (int round = 0; round < 50; ++round) {
    auto socket = std::make_shared<FakeSocket>();
    auto cmd = std::make_shared<Restore>();
    cmd->attachSocket(socket);
    std::thread reporter([cmd] {
      for (std::uint32_t i = 0; i < 100; ++i) cmd->sendMoreProgress(i, "step");
    });
    std::thread ender([cmd] { cmd->sendNoMoreProgress(); });
    reporter.join();
    ender.join();
    const auto frames = socket->frames();
    ASSERT_FALSE(frames.empty());
    EXPECT_EQ(frames.back().kind, wire::FrameKind::ProgressEnd);
    std::size_t ends = 0;
    for (const auto& f : frames) ends += f.kind == wire::FrameKind::ProgressEnd;
    EXPECT_EQ(ends, 1u);
    EXPECT_EQ(socket->doneCalls(), 1);
  }
}

}  // namespace
