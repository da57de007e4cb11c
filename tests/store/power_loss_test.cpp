// Power losses in the middle of the store's own file work: a data-file
// write (temporary file, flush, rename, folder flush) and the creation of
// a new database (its folders, the file made under a temporary name and
// linked into place). Each test first runs the operation cleanly and
// counts its file calls, then once for every call N: from call N on every
// call fails (the power is gone), whatever was not flushed is dropped, and
// the next start (a new pool, the start-up sweep) must find an
// acknowledged write whole, an unacknowledged one whole or absent, never
// partial, and a database that opens. SQLite's own files are its business;
// these tests drop only what went through the server's Env.

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>

#include "engine/db_instances.h"
#include "store/stale_files.h"
#include "store_fixture.h"

namespace {

namespace fs = std::filesystem;
using store_testing::entries;
using store_testing::StoreTest;
using testing_support::FaultEnv;
using testing_support::RawDb;

class PowerLoss : public StoreTest {
 protected:
  // A pool as the next start makes it, on the same folders and Env.
  std::shared_ptr<DB::DBInstances> restart() {
    DB::PoolSettings s;
    s.maintenanceTick = std::chrono::milliseconds(5);
    return DB::DBInstances::create(s, DB::Paths(root(), logRoot(), root() + "db.backup/", "cvdb.edb"), env_);
  }

  // Runs op with the power lost at its nth file call (none: not at all);
  // whether op returned. The dropped state is on disk afterwards.
  bool runWithPowerLossAt(std::uint64_t n, const std::function<void()>& op, std::uint64_t* calls) {
    std::atomic<std::uint64_t> seen{0};
    env_.setCallHook([&](FaultEnv::Op, const sys::Path&) {
      if (++seen == n) env_.failOnPath(FaultEnv::kAny, "");
    });
    bool acknowledged = true;
    try {
      op();
    } catch (const std::exception&) {
      acknowledged = false;
    }
    env_.setCallHook({});
    env_.clearFailures();
    env_.dropUnsynced();
    *calls = seen;
    return acknowledged;
  }

  // The start-up sweep of a new start; every temporary file is older.
  void sweep() { DB::removeStaleTempFiles(env_, pool()->paths(), sys::WallClock::now() + std::chrono::hours(1)); }
};

// A data file replaced, and one written into an id folder (and a data
// folder) that does not exist yet.
TEST_F(PowerLoss, ADataFileIsWholeOrAbsentAfterAPowerLossAtAnyStepOfItsWrite) {
  const std::string previous(50000, 'p');
  const std::string next(70000, 'n');
  for (const bool fresh : {false, true}) {
    SCOPED_TRACE(fresh ? "a new file in a new folder" : "a file replaced");
    const std::string id = fresh ? "new" : "old";
    std::size_t sawPrevious = 0, sawNext = 0;
    std::uint64_t calls = 0, most = 0;
    // Until a round ends before its power loss.
    for (std::uint64_t n = 1; n == 1 || calls >= n - 1; ++n) {
      SCOPED_TRACE("power lost at call " + std::to_string(n));
      fs::remove_all(root() + "docs");
      if (!fresh) {
        DB::DBLocal setUp(pool(), "docs");
        setUp.saveDataBlob(previous.data(), previous.size(), id, "scan");
      }
      env_.dropUnsynced();  // the previous content was flushed: nothing goes
      DB::DBLocal db(pool(), "docs");
      const bool acknowledged = runWithPowerLossAt(
          n, [&] { db.saveDataBlob(next.data(), next.size(), id, "scan"); }, &calls);
      EXPECT_TRUE(calls >= n || acknowledged);  // the run that had no power loss
      most = std::max(most, calls);

      sweep();
      const auto restarted = restart();
      DB::DBLocal after(restarted, "docs");
      const std::string now(after.loadDataBlob(id, "scan").view());
      if (acknowledged) {
        EXPECT_EQ(now.size(), next.size());
        EXPECT_EQ(now, next);
      } else if (now == next) {
        ++sawNext;
      } else {
        EXPECT_EQ(now.size(), fresh ? 0 : previous.size());
        EXPECT_EQ(now, fresh ? "" : previous);
        ++sawPrevious;
      }
      // Nothing but the file itself is left in its folder, and it can be
      // written again.
      const auto left = entries(root() + "docs/d/" + id);
      EXPECT_TRUE(left.empty() || left == std::vector<std::string>{"scan"}) << testing::PrintToString(left);
      after.saveDataBlob("again", 5, id, "scan");
      EXPECT_EQ(after.loadDataBlob(id, "scan").view(), "again");
      restarted->stop();
    }
    EXPECT_GT(most, 4u);  // temporary file, write, flush, close, rename, folder flush at least
    EXPECT_GT(sawPrevious, 0u);
  }
}

// A new database whose creation and first write the power cuts short at
// every step: the next start opens it (creating it again when its file is
// gone), an acknowledged write is in it, and nothing of the creation's
// temporary file is left once the database is open.
TEST_F(PowerLoss, ANewDatabaseOpensAfterAPowerLossAtAnyStepOfItsCreation) {
  std::size_t sawGone = 0, sawKept = 0;
  std::uint64_t calls = 0, most = 0;
  // Until a round ends before its power loss.
  for (std::uint64_t n = 1; n == 1 || calls >= n - 1; ++n) {
    SCOPED_TRACE("power lost at call " + std::to_string(n));
    const std::string name = "born\\n" + std::to_string(n);
    const std::string key = "born/n" + std::to_string(n);
    bool acknowledged = false;
    {
      const auto pool = restart();
      DB::DBLocal db(pool, name);
      acknowledged = runWithPowerLossAt(
          n,
          [&] {
            if (!db.exists(false)) throw std::runtime_error("not created");
            db.saveMetaBlob("first", 5, "k");
          },
          &calls);
      db.disconnect();
      pool->stop();
    }
    EXPECT_TRUE(calls >= n || acknowledged);
    most = std::max(most, calls);

    const auto restarted = restart();
    DB::DBLocal after(restarted, name);
    const bool found = after.exists(true);
    EXPECT_TRUE(found || !acknowledged);
    if (found) {
      ++sawKept;
      const std::string value(after.loadMetaBlob("k").view());
      EXPECT_TRUE(value == "first" || !acknowledged) << value;
      EXPECT_TRUE(value.empty() || value == "first") << value;
    } else {
      ++sawGone;
      ASSERT_TRUE(after.exists(false));  // created again over what is left
    }
    after.saveMetaBlob("second", 6, "k");
    EXPECT_EQ(after.loadMetaBlob("k").view(), "second");
    EXPECT_EQ(RawDb(root() + key + "/cvdb.edb").value("PRAGMA integrity_check"), "ok");
    for (const auto& e : entries(root() + key)) EXPECT_FALSE(e.ends_with(".creating")) << e;
    after.disconnect();
    restarted->stop();
  }
  EXPECT_GT(most, 3u);
  EXPECT_GT(sawGone, 0u);
  EXPECT_GT(sawKept, 0u);
}

}  // namespace
