// Configuration parts and pack records read through the pool's read cache:
// each write of a key, through another connection, is seen by the next
// read; the use-list time limit applies to a kept record as to a fresh one;
// a read that raced a commit does not leave its old value behind; a
// restored database is read anew.

#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <thread>

#include "engine/db_exc.h"
#include "store_fixture.h"

namespace {

using Ipc::PackInfo;
using Ipc::UseInfo;
using store_testing::complete;
using store_testing::StoreTest;
using store_testing::useRequest;

class CachedReads : public StoreTest {
 protected:
  std::unique_ptr<DB::DBLocal> reader = open("sales");
  std::unique_ptr<DB::DBLocal> writer = open("sales");

  std::string part(const std::string& key) { return *reader->cfgPartText(key); }
  std::string packName(const std::string& id) {
    const auto info = reader->infoFor(id);
    return info ? info->name : "(none)";
  }
  std::uint64_t hits() const { return pool()->readCache().stats().hits; }
  void savePart(const std::string& key, const std::string& text) {
    writer->saveMetaBlob(text.data(), text.size(), key);
  }
  void savePack(const PackInfo& p, const std::string& content) {
    writer->savePackMeta(p, content.data(), content.size());
  }
};

TEST_F(CachedReads, ARepeatedReadIsAHitAndAnswersWhatTheStoreHolds) {
  savePart("layout", "{ \"b\": [1, 2],  \"a\": \"x\" }");
  // The answer is the part's compact text, as the stored object dumps.
  EXPECT_EQ(part("layout"), "{\"b\":[1,2],\"a\":\"x\"}");
  const auto before = hits();
  EXPECT_EQ(part("layout"), "{\"b\":[1,2],\"a\":\"x\"}");
  EXPECT_EQ(part("missing"), "");
  EXPECT_EQ(part("missing"), "");
  EXPECT_EQ(hits(), before + 2);

  // Bytes that are not a JSON object (a pack content under the key) are
  // refused on every read, never kept.
  savePack(complete("P1", "inbox", 1), "not json");
  EXPECT_THROW(part("P1"), json::Exc);
  EXPECT_THROW(part("P1"), json::Exc);

  // A closed store answers nothing, kept or not.
  ASSERT_NE(reader->infoFor("P1"), nullptr);
  reader->disconnect();
  EXPECT_THROW(part("layout"), DB::DBExc);
  EXPECT_THROW(reader->infoFor("P1"), DB::DBExc);
}

// Every write of a key, through another connection, reaches the next read
// of a connection that had it cached: parts and records, each writer.
TEST_F(CachedReads, EveryWriteOfAKeyIsSeenByTheNextRead) {
  savePart("k", "{\"v\":1}");
  EXPECT_EQ(part("k"), "{\"v\":1}");
  savePart("k", "{\"v\":2}");
  EXPECT_EQ(part("k"), "{\"v\":2}");
  writer->removeMetaBlob("k");
  EXPECT_EQ(part("k"), "");
  // A pack content written under the same key replaces the part too.
  savePart("P9", "{\"v\":3}");
  EXPECT_EQ(part("P9"), "{\"v\":3}");
  savePack(complete("P9", "inbox", 1), "{\"v\":4}");
  EXPECT_EQ(part("P9"), "{\"v\":4}");
  writer->removePack("P9");
  EXPECT_EQ(part("P9"), "");

  EXPECT_EQ(packName("P1"), "(none)");
  writer->updateInfo(complete("P1", "inbox", 1, "first"));
  EXPECT_EQ(packName("P1"), "first");
  PackInfo rename("P1");
  rename.name = "second";
  writer->updateInfo(rename);
  EXPECT_EQ(packName("P1"), "second");
  savePack(complete("P1", "inbox", 1, "third"), "content");
  EXPECT_EQ(packName("P1"), "third");
  // A fetch that opens the pack changes its use list.
  ASSERT_TRUE(reader->infoFor("P1")->uses.empty());
  writer->packMetadata(useRequest("P1", UseInfo::OpenForEdit, "hostA"));
  ASSERT_EQ(reader->infoFor("P1")->uses.size(), 1u);
  EXPECT_EQ(reader->infoFor("P1")->uses[0].host, "hostA");
  writer->removePack("P1");
  EXPECT_EQ(packName("P1"), "(none)");

  // A refused write drops the key all the same (it changed nothing here).
  EXPECT_EQ(packName("P2"), "(none)");
  const auto dropped = pool()->readCache().stats().invalidations;
  PackInfo partial("P2");
  partial.name = "x";
  EXPECT_THROW(writer->updateInfo(partial), DB::DBExc);
  EXPECT_EQ(pool()->readCache().stats().invalidations, dropped + 1);
}

TEST_F(CachedReads, AKeptRecordLosesUseEntriesAsTheyAgeLikeAFreshOne) {
  const std::int64_t t0 = 1'800'000'000;
  env_.useManualClock(sys::WallClock::time_point(std::chrono::seconds(t0)));
  writer->updateInfo(complete("P1", "inbox", 1));
  writer->packMetadata(useRequest("P1", UseInfo::OpenForEdit, "early"));
  env_.advance(std::chrono::seconds(600));
  writer->packMetadata(useRequest("P1", UseInfo::LockForUpload, "late"));

  ASSERT_EQ(reader->infoFor("P1")->uses.size(), 2u);  // kept now
  const auto before = hits();
  // Past the limit for the first entry only, then for both.
  env_.advance(std::chrono::seconds(Ipc::kUseLimitSeconds - 300));
  const auto one = reader->infoFor("P1");
  ASSERT_EQ(one->uses.size(), 1u);
  EXPECT_EQ(one->uses[0].host, "late");
  env_.advance(std::chrono::seconds(600));
  EXPECT_TRUE(reader->infoFor("P1")->uses.empty());
  EXPECT_EQ(hits(), before + 2);
  // Each hit answered what a read past the cache answers at that moment.
  const auto fresh = writer->packMetadata(PackInfo("P1")).info;
  EXPECT_EQ(*reader->infoFor("P1"), *fresh);
}

// A reader holds between its engine read and its insert (the cache's test
// hook) while a writer commits and is answered; then the reader goes on.
// Its old value must not be kept: the read after the write sees the write.
class RacedReads : public CachedReads {
 protected:
  // Runs read on a thread of its own, holds it at its insert, runs write,
  // lets the reader finish; returns what the reader read.
  template <class Read, class Write>
  void race(Read read, Write write) {
    std::mutex m;
    std::condition_variable cv;
    bool held = false;
    bool go = false;
    bool once = false;
    pool()->readCache().setInsertHook([&] {
      std::unique_lock lock(m);
      if (once) return;
      once = true;
      held = true;
      cv.notify_all();
      cv.wait(lock, [&] { return go; });
    });
    std::thread r(read);
    {
      std::unique_lock lock(m);
      cv.wait(lock, [&] { return held; });
    }
    write();
    {
      std::lock_guard lock(m);
      go = true;
    }
    cv.notify_all();
    r.join();
    pool()->readCache().setInsertHook({});
  }
};

TEST_F(RacedReads, APartReadBeforeACommitIsNotKeptAfterIt) {
  savePart("k", "{\"v\":1}");
  std::string raced;
  race([&] { raced = part("k"); }, [&] { savePart("k", "{\"v\":2}"); });
  EXPECT_EQ(raced, "{\"v\":1}");  // it began before the write
  EXPECT_EQ(part("k"), "{\"v\":2}");
  EXPECT_EQ(pool()->readCache().stats().refused, 1u);
}

TEST_F(RacedReads, ARecordReadBeforeACommitIsNotKeptAfterIt) {
  writer->updateInfo(complete("P1", "inbox", 1, "old"));
  std::string raced;
  race([&] { raced = packName("P1"); }, [&] { writer->updateInfo(complete("P1", "inbox", 1, "new")); });
  EXPECT_EQ(raced, "old");
  EXPECT_EQ(packName("P1"), "new");
}

class DummyProgress : public DB::DBProgressCallback {
 public:
  void onProgress(std::uint32_t, const std::string&) override {}
};

TEST_F(CachedReads, ARestoredDatabaseIsReadAnew) {
  savePart("layout", "{\"v\":\"backed up\"}");
  writer->updateInfo(complete("P1", "inbox", 1, "backed up"));
  const std::string archive = (dir_ / "sales.cvbak").string();
  writer->backup(archive, false, std::make_unique<DummyProgress>());
  savePart("layout", "{\"v\":\"later\"}");
  writer->removePack("P1");
  writer->updateInfo(complete("P2", "inbox", 1, "later"));
  EXPECT_EQ(part("layout"), "{\"v\":\"later\"}");
  EXPECT_EQ(packName("P1"), "(none)");
  EXPECT_EQ(packName("P2"), "later");

  // The restore waits for every session of the database to end.
  reader->disconnect();
  writer->restore(archive, false, std::make_unique<DummyProgress>());
  ASSERT_TRUE(reader->exists(true));
  EXPECT_EQ(part("layout"), "{\"v\":\"backed up\"}");
  EXPECT_EQ(packName("P1"), "backed up");
  EXPECT_EQ(packName("P2"), "(none)");
}

TEST_F(CachedReads, AClosedDatabaseLeavesNothingInTheCache) {
  savePart("k", "{}");
  EXPECT_EQ(part("k"), "{}");
  EXPECT_GT(pool()->readCache().stats().entries, 0u);
  reader->disconnect();
  writer->disconnect();
  ASSERT_TRUE(pool()->closeIfDormant("sales"));
  EXPECT_EQ(pool()->readCache().stats().entries, 0u);
  EXPECT_EQ(pool()->readCache().stats().bytes, 0u);
}

}  // namespace
