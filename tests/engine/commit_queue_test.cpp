// Group commit: which writes share a commit, and that each keeps its own
// outcome inside its group.
//
// Groups are formed deterministically: the first writer's body holds its
// (one-request) group open until the others have queued behind it, one at
// a time so that their arrival order is known; they then form the next
// group together.

#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <latch>
#include <string>
#include <thread>
#include <vector>

#include "engine/commit_queue.h"
#include "engine_fixture.h"

namespace {

using namespace engine_testing;

class CommitQueueTest : public EngineTest {
 protected:
  struct Writer {
    std::unique_ptr<engine::Session> session;
    std::function<void(engine::Session&)> body;
    std::exception_ptr error;
  };

  engine::CommitQueue& queue() { return instance_->commitQueue(); }

  void waitUntilQueued(std::size_t n) {
    while (queue().queued() < n) std::this_thread::yield();
  }

  // Runs the writers' bodies as one group behind a blocker and returns
  // when all are done.
  void runAsOneGroup(std::vector<Writer>& writers) {
    std::latch release(1);
    std::thread blocker([&] { queue().run(*first_, 0, [&](engine::Session&) { release.wait(); }); });
    waitUntilQueued(1);
    std::vector<std::thread> threads;
    for (std::size_t i = 0; i < writers.size(); ++i) {
      threads.emplace_back([&, i] {
        try {
          queue().run(*writers[i].session, 0, writers[i].body);
        } catch (...) {
          writers[i].error = std::current_exception();
        }
      });
      waitUntilQueued(i + 2);
    }
    release.count_down();
    blocker.join();
    for (auto& t : threads) t.join();
  }

  // A writer that appends its name to the "log" row and records the log it
  // saw before, so that order and visibility show in the result.
  Writer appender(const std::string& name, std::vector<std::string>& seen, std::size_t slot) {
    return Writer{openSession(instance_),
                  [name, &seen, slot](engine::Session& s) {
                    auto read = s.prepare("SELECT blob FROM blobs WHERE id = CAST('log' AS BLOB)");
                    seen[slot] = read.step() ? std::string(read.columnBytes(0)) : std::string();
                    read.reset();
                    auto write = s.prepare("INSERT OR REPLACE INTO blobs VALUES(CAST('log' AS BLOB), ?1)");
                    write.bindBlob(1, seen[slot] + name + ";");
                    write.run();
                  },
                  nullptr};
  }

  std::string log(engine::Session& s) {
    auto read = s.prepare("SELECT blob FROM blobs WHERE id = CAST('log' AS BLOB)");
    return read.step() ? std::string(read.columnBytes(0)) : std::string("<none>");
  }

  std::shared_ptr<engine::Instance> instance_ = makeInstance("group");
  std::unique_ptr<engine::Session> first_ = makeDatabase(instance_);
};

std::string messageOf(const std::exception_ptr& error) {
  if (!error) return "";
  try {
    std::rethrow_exception(error);
  } catch (const std::exception& e) {
    return e.what();
  }
}

// A failing body is rolled back to its savepoint and fails alone; a body
// with a retryable failure runs again alone after the group; the rest of
// the group commits once, in arrival order, each seeing those before it.
TEST_F(CommitQueueTest, EachRequestOfAGroupKeepsItsOwnOutcome) {
  const auto before = engine::CommitQueue::stats();
  std::vector<std::string> seen(5);
  std::vector<Writer> writers;
  for (std::size_t i = 0; i < 5; ++i) writers.push_back(appender(std::string(1, char('a' + i)), seen, i));

  // c writes, then is refused: nothing of it may stay.
  auto cBody = writers[2].body;
  writers[2].body = [cBody](engine::Session& s) {
    cBody(s);
    throw DB::DBExc("refused in the middle of a group");
  };
  // d conflicts on its first run only.
  int dRuns = 0;
  auto dBody = writers[3].body;
  writers[3].body = [dBody, &dRuns](engine::Session& s) {
    dBody(s);
    if (++dRuns == 1) DB::throwEngineError(err::kWriteConflict);
  };

  runAsOneGroup(writers);

  EXPECT_EQ(messageOf(writers[2].error), "refused in the middle of a group");
  for (std::size_t i : {0, 1, 3, 4}) EXPECT_FALSE(writers[i].error) << i << ": " << messageOf(writers[i].error);
  EXPECT_EQ(seen[1], "a;");    // b saw a
  EXPECT_EQ(seen[4], "a;b;");  // e saw neither c (refused) nor d (not yet retried)
  EXPECT_EQ(dRuns, 2);
  EXPECT_EQ(seen[3], "a;b;e;");  // d, alone, after its group
  EXPECT_EQ(log(*first_), "a;b;e;d;");

  const auto after = engine::CommitQueue::stats();
  // The blocker's group, the group of five, and d alone.
  EXPECT_EQ(after.commits - before.commits, 3u);
  EXPECT_EQ(after.requests - before.requests, 7u);
  EXPECT_GE(after.largest, 5u);
}

// A commit that fails fails every request of its group and stores nothing
// of any of them; the queue serves the next writer normally.
TEST_F(CommitQueueTest, AFailedCommitFailsTheWholeGroup) {
  // A deferred foreign key is checked only by COMMIT.
  first_->execute(
      "CREATE TABLE parent(id INTEGER PRIMARY KEY);"
      "CREATE TABLE child(id INTEGER PRIMARY KEY, parent INTEGER REFERENCES parent(id) DEFERRABLE INITIALLY "
      "DEFERRED);");
  std::vector<std::string> seen(3);
  std::vector<Writer> writers;
  for (std::size_t i = 0; i < 3; ++i) writers.push_back(appender(std::string(1, char('a' + i)), seen, i));
  for (auto& w : writers) w.session->execute("PRAGMA foreign_keys = ON");
  auto bBody = writers[1].body;
  writers[1].body = [bBody](engine::Session& s) {
    bBody(s);
    s.prepare("INSERT INTO child VALUES(1, 42)").run();  // no parent 42
  };

  runAsOneGroup(writers);

  for (const auto& w : writers) EXPECT_FALSE(messageOf(w.error).empty());
  EXPECT_EQ(log(*first_), "<none>");
  EXPECT_FALSE(first_->inTransaction());

  std::vector<std::string> again(1);
  std::vector<Writer> next;
  next.push_back(appender("z", again, 0));
  runAsOneGroup(next);
  EXPECT_FALSE(next[0].error);
  EXPECT_EQ(log(*first_), "z;");
}

// Many writers at once: every acknowledged write is there, every refused
// one left nothing, whatever groups formed.
TEST_F(CommitQueueTest, ConcurrentWritersLoseNothingAndLeaveNoRefusedWrite) {
  constexpr int kThreads = 6;
  constexpr int kWrites = 150;
  std::atomic<int> acknowledged{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      auto session = openSession(instance_);
      for (int i = 0; i < kWrites; ++i) {
        const bool refuse = i % 7 == 3;
        try {
          queue().run(*session, 16, [&](engine::Session& s) {
            auto put = s.prepare("INSERT INTO blobs VALUES(?1, ?2)");
            put.bindBlob(1, std::to_string(t) + "/" + std::to_string(i));
            put.bindBlob(2, refuse ? "refused" : "kept");
            put.run();
            s.prepare("UPDATE counter SET value = value + 1").run();
            if (refuse) throw DB::DBExc("refused");
          });
          ASSERT_FALSE(refuse);
          ++acknowledged;
        } catch (const DB::DBExc& e) {
          ASSERT_TRUE(refuse) << e.what();
        }
      }
    });
  }
  for (auto& t : threads) t.join();

  EXPECT_EQ(counter(*first_), acknowledged.load());
  auto rows = first_->prepare("SELECT count(*), sum(blob = CAST('refused' AS BLOB)) FROM blobs");
  ASSERT_TRUE(rows.step());
  EXPECT_EQ(rows.columnInt64(0), acknowledged.load());
  EXPECT_EQ(rows.columnInt64(1), 0);
}

}  // namespace
