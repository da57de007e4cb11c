// Backup of a database into its archive: the archive's path, what the
// archive holds and reports, that a failure at any file call leaves nothing
// behind, and the backup of every database.

#include <gtest/gtest.h>

#include <algorithm>
#include <stop_token>

#include "maintenance/archive_reader.h"
#include "maintenance/backup.h"
#include "store_fixture.h"

namespace {

namespace fs = std::filesystem;
using store_testing::entries;
using store_testing::StoreTest;
using testing_support::FaultEnv;
using testing_support::RawDb;
using testing_support::readFile;
using testing_support::writeFile;

class Texts : public DB::DBProgressCallback {
 public:
  explicit Texts(std::vector<std::string>& out) : out_(out) {}
  void onProgress(std::uint32_t, const std::string& text) override { out_.push_back(text); }

 private:
  std::vector<std::string>& out_;
};

class Backup : public StoreTest {
 protected:
  Backup() {
    db->saveMetaBlob("{\"a\":1}", 7, "layout");
    for (const char* file : {"one", "two", "three"}) db->saveDataBlob(file, 3, "doc", file);
  }
  std::vector<std::string> run(const std::string& target, bool all = false) {
    std::vector<std::string> texts;
    db->backup(target, all, std::make_unique<Texts>(texts));
    return texts;
  }
  std::vector<std::string> names(const fs::path& archive) {
    maint::ArchiveReader reader(env_, archive);
    std::vector<std::string> out;
    for (const auto& e : reader.entries()) out.push_back(e.name);
    return out;
  }
  std::unique_ptr<DB::DBLocal> db = open("Sales");
};

TEST_F(Backup, TheArchivePathFollowsTheTarget) {
  const DB::Paths& paths = pool()->paths();
  const std::string bak = root() + "db.backup/";
  fs::create_directories(dir_ / "existing");
  EXPECT_EQ(maint::archivePath(paths, env_, "", "team\\sales"), bak + "team_sales.cvbak");
  EXPECT_EQ(maint::archivePath(paths, env_, "sub\\x", "s"), bak + "sub/x.cvbak");
  EXPECT_EQ(maint::archivePath(paths, env_, (dir_ / "new").string() + "\\", "s"), (dir_ / "new").string() + "/s.cvbak");
  EXPECT_EQ(maint::archivePath(paths, env_, (dir_ / "existing").string(), "s"), (dir_ / "existing/s.cvbak").string());
  EXPECT_EQ(maint::archivePath(paths, env_, (dir_ / "a.cvbak").string(), "s"), (dir_ / "a.cvbak").string());
  EXPECT_EQ(maint::archivePath(paths, env_, (dir_ / "a.zip").string(), "s"), (dir_ / "a.zip.cvbak").string());
  EXPECT_EQ(maint::archivePath(paths, env_, (dir_ / "a.CVBAK").string(), "s"), (dir_ / "a.CVBAK.cvbak").string());
}

TEST_F(Backup, TheArchiveHoldsTheDatabaseItsOriginAndItsDataFiles) {
  const auto texts = run((dir_ / "out").string() + "/");
  const fs::path archive = dir_ / "out" / "sales.cvbak";
  auto listed = names(archive);
  ASSERT_EQ(listed.size(), 5u);
  std::sort(listed.begin(), listed.begin() + 2);  // the working folder's files in its listing order, first
  EXPECT_EQ(listed,
            (std::vector<std::string>{"cvdb.edb", "originDB.txt", "d\\doc\\one", "d\\doc\\two", "d\\doc\\three"}));
  // Read back: the database file is whole and holds the part; the origin
  // names the requester's file and the database.
  maint::ArchiveReader(env_, archive).unpackTo(dir_ / "unpacked");
  EXPECT_EQ(readFile(dir_ / "unpacked" / "originDB.txt"), root() + "sales/cvdb.edb\r\nsales");
  EXPECT_EQ(RawDb(dir_ / "unpacked" / "cvdb.edb").value("SELECT blob FROM meta WHERE id = CAST('layout' AS BLOB)"),
            "{\"a\":1}");
  EXPECT_EQ(readFile(dir_ / "unpacked" / "d" / "doc" / "two"), "two");
  EXPECT_FALSE(fs::exists(root() + "db.temp/sales"));  // the working folder is gone
  EXPECT_FALSE(pool()->record("sales")->maintenance);

  const auto has = [&](const std::string& t) { return std::find(texts.begin(), texts.end(), t) != texts.end(); };
  EXPECT_EQ(texts.front(), "Starting backup for \"sales\" ...");
  for (const char* t :
       {"Metadata backup started...", "Metadata backup finished", "Compressing metadata 50% complete (1/2)",
        "Compressing metadata 100% complete (2/2)", "Compressing binaries 33% complete (1/3)",
        "Compressing binaries 66% complete (2/3)", "Compressing binaries 100% complete (3/3)"}) {
    EXPECT_TRUE(has(t)) << t;
  }
}

// Every file call of a backup failed in turn: the backup fails, no partial
// archive (under its name or a temporary one) and no working folder remain,
// and the hold is released. Under the archive's name stays the older
// archive, or (when only the last folder sync failed) the whole new one.
TEST_F(Backup, AFailureAtAnyFileCallLeavesNothingBehind) {
  const fs::path out = dir_ / "out";
  const std::string target = (out / "s.cvbak").string();
  run(target);
  const std::string older = readFile(target);
  env_.resetCounts();
  run(target);
  const auto calls = env_.count(FaultEnv::kAny);
  ASSERT_GT(calls, 20u);
  for (std::uint64_t n = 1; n <= calls; ++n) {
    SCOPED_TRACE("call " + std::to_string(n));
    writeFile(target, older);
    env_.resetCounts();
    env_.failNth(FaultEnv::kAny, n);
    bool failed = false;
    try {
      run(target);
    } catch (const std::exception&) {
      failed = true;
    }
    env_.clearFailures();
    EXPECT_EQ(entries(out), std::vector<std::string>{"s.cvbak"});
    if (failed && readFile(target) != older) {
      EXPECT_EQ(names(target).size(), 5u) << "neither the older archive nor a whole new one";
    }
    // A failed removal of the working folder itself is only logged (the
    // next backup removes it first); any other failure leaves none.
    if (failed) {
      EXPECT_FALSE(fs::exists(root() + "db.temp/sales"));
    }
    EXPECT_FALSE(pool()->record("sales")->maintenance);
  }
}

// The server's stop reaches a backup through its stop token. Asked at any
// of its progress messages, the backup ends without completing, the older
// archive stays as it was, and neither the new archive's temporary file
// nor the working folder remains; the hold is released.
TEST_F(Backup, AStopAtAnyProgressMessageKeepsTheOlderArchiveAndLeavesNothingElse) {
  class StopAt : public DB::DBProgressCallback {
   public:
    StopAt(std::size_t at, std::stop_source& stop) : at_(at), stop_(stop) {}
    void onProgress(std::uint32_t, const std::string&) override {
      if (seen_++ == at_) stop_.request_stop();
    }

   private:
    std::size_t at_;
    std::size_t seen_ = 0;
    std::stop_source& stop_;
  };
  const fs::path out = dir_ / "out";
  const std::string target = (out / "s.cvbak").string();
  const auto texts = run(target);
  ASSERT_GT(texts.size(), 8u);
  const std::string older = readFile(target);
  for (std::size_t at = 0; at < texts.size(); ++at) {
    SCOPED_TRACE(texts[at]);
    std::stop_source stop;
    EXPECT_THROW(db->backup(target, false, std::make_unique<StopAt>(at, stop), stop.get_token()), std::exception);
    EXPECT_EQ(entries(out), std::vector<std::string>{"s.cvbak"});
    EXPECT_TRUE(readFile(target) == older);
    EXPECT_FALSE(fs::exists(root() + "db.temp/sales"));
    EXPECT_FALSE(pool()->record("sales")->maintenance);
  }
  EXPECT_NO_THROW(run(target));  // nothing stays stopped
}

// The temporary file of a data file being written (the reserved prefix and
// a unique suffix, beside its target), or one that a crash left in the
// middle of a write, is no data file: the archive leaves it out, as every
// other copy of data files does.
TEST_F(Backup, TheTemporaryFileOfAWriteIsLeftOut) {
  writeFile(root() + "sales/d/doc/" + std::string(DB::DBLocal::kTempPrefix) + "Ab12Cd", "half of a write");
  run((dir_ / "out").string() + "/");
  for (const auto& name : names(dir_ / "out" / "sales.cvbak")) {
    EXPECT_EQ(name.find(DB::DBLocal::kTempPrefix), std::string::npos) << name;
  }
}

TEST_F(Backup, ATargetInsideADatabaseFolderIsRefusedAndNothingIsWritten) {
  const auto before = entries(root() + "sales");
  EXPECT_THROW(run(root() + "sales/"), std::runtime_error);
  EXPECT_THROW(run(root() + "sales/d/doc/x.cvbak"), std::runtime_error);
  EXPECT_EQ(entries(root() + "sales"), before);
}

// Every database of the catalog, each into its own archive; the server's
// own folders and data files named like the database file are none.
TEST_F(Backup, AllBacksUpEveryDatabaseAndNothingElse) {
  open("Other\\Deep")->saveMetaBlob("x", 1, "k");
  db->saveDataBlob("no database", 11, "doc", "cvdb.edb");
  writeFile(root() + "db.temp/old/cvdb.edb", "leftover");
  writeFile(root() + "db.backup/x/cvdb.edb", "not one either");
  run((dir_ / "all").string(), true);
  EXPECT_EQ(entries(dir_ / "all"), (std::vector<std::string>{"other_deep.cvbak", "sales.cvbak"}));
}

}  // namespace
