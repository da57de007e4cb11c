// Restore of a database from its archive: the round trip, what a restore
// reports and logs, the archives it refuses, that a failure at any file call
// leaves the database as it was, and that a power loss at any point leaves
// the previous or the restored database once recovery has run.

#include <gtest/gtest.h>

#include <map>

#include "maintenance/archive_reader.h"
#include "maintenance/archive_writer.h"
#include "maintenance/restore.h"
#include "maintenance/restore_journal.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

namespace fs = std::filesystem;
using store_testing::complete;
using store_testing::entries;
using store_testing::StoreTest;
using testing_support::FaultEnv;
using testing_support::LogCapture;
using testing_support::RawDb;
using testing_support::readFile;
using testing_support::writeFile;

class Texts : public DB::DBProgressCallback {
 public:
  explicit Texts(std::vector<std::string>& out, std::function<void(const std::string&)> then = {})
      : out_(out), then_(std::move(then)) {}
  void onProgress(std::uint32_t, const std::string& text) override {
    out_.push_back(text);
    if (then_) then_(text);
  }

 private:
  std::vector<std::string>& out_;
  std::function<void(const std::string&)> then_;
};

// Every file and folder below root, with the size and a hash of each
// file's content.
std::map<std::string, std::string> tree(const fs::path& root) {
  std::map<std::string, std::string> out;
  std::error_code ec;
  for (auto it = fs::recursive_directory_iterator(root, ec); it != fs::recursive_directory_iterator(); ++it) {
    const std::string rel = fs::relative(it->path(), root).string();
    if (it->is_directory()) {
      out[rel] = "<folder>";
    } else {
      const std::string content = readFile(it->path());
      out[rel] = std::to_string(content.size()) + ":" + std::to_string(std::hash<std::string>{}(content));
    }
  }
  return out;
}

bool has(const std::vector<std::string>& texts, const std::string& t) {
  return std::find(texts.begin(), texts.end(), t) != texts.end();
}

class Restore : public StoreTest {
 protected:
  Restore() {
    db->saveMetaBlob("{\"a\":1}", 7, "layout");
    db->updateInfo(complete("P1", "inbox", 1));
    for (const char* file : {"one", "two"}) db->saveDataBlob(file, 3, "doc", file);
    std::vector<std::string> ignored;
    db->backup(archive(), false, std::make_unique<Texts>(ignored));
  }
  std::string archive() const { return (dir_ / "sales.cvbak").string(); }
  std::vector<std::string> run(const std::string& target, bool all = false,
                               std::function<void(const std::string&)> then = {}) {
    std::vector<std::string> texts;
    db->restore(target, all, std::make_unique<Texts>(texts, std::move(then)));
    return texts;
  }
  // Changes every kind of content after the backup.
  void change() {
    db->saveMetaBlob("{\"b\":2}", 7, "layout");
    db->saveMetaBlob("x", 1, "added");
    db->removePack("P1");
    db->saveDataBlob("new", 3, "doc", "one");
    db->saveDataBlob("fresh", 5, "doc2", "f");
  }
  // The database's files as they rest with the database closed.
  std::map<std::string, std::string> files() {
    db->disconnect();
    pool()->closeIfDormant("sales");
    auto all = tree(root() + "sales");
    for (auto& [k, v] : tree(logRoot() + "sales")) all["log/" + k] = v;
    return all;
  }
  // Keeps a copy of the database's folders, and puts it back.
  void keep(const std::string& as) {
    files();
    fs::create_directories(dir_ / as);
    fs::copy(root() + "sales", dir_ / as / "db", fs::copy_options::recursive);
    fs::copy(logRoot() + "sales", dir_ / as / "log", fs::copy_options::recursive);
  }
  void putBack(const std::string& from) {
    fs::remove_all(root() + "sales");
    fs::remove_all(logRoot() + "sales");
    fs::remove_all(root() + "db.temp");
    fs::copy(dir_ / from / "db", root() + "sales", fs::copy_options::recursive);
    fs::copy(dir_ / from / "log", logRoot() + "sales", fs::copy_options::recursive);
  }
  // An archive with the given entries (name -> content).
  std::string craft(const std::string& name, const std::vector<std::pair<std::string, std::string>>& content) {
    const fs::path src = dir_ / ("src-" + name);
    maint::ArchiveWriter writer(env_, dir_ / name);
    int i = 0;
    for (const auto& [entry, bytes] : content) {
      const fs::path file = src / std::to_string(i++);
      writeFile(file, bytes);
      writer.add(file, entry);
    }
    writer.commit();
    return (dir_ / name).string();
  }
  // The entries of a good archive, unpacked.
  std::vector<std::pair<std::string, std::string>> goodEntries() {
    maint::ArchiveReader(env_, archive()).unpackTo(dir_ / "good");
    return {{"cvdb.edb", readFile(dir_ / "good" / "cvdb.edb")}};
  }
  std::unique_ptr<DB::DBLocal> db = open("sales");
};

TEST_F(Restore, ARestoredDatabaseReadsBackExactlyAsAtTheBackup) {
  change();
  LogCapture log;
  const auto texts = run(archive());
  EXPECT_TRUE(db->isOpen());  // the session that was open is open again
  EXPECT_EQ(db->loadMetaBlob("layout").view(), "{\"a\":1}");
  EXPECT_TRUE(db->loadMetaBlob("added").view().empty());
  ASSERT_NE(db->infoFor("P1"), nullptr);
  EXPECT_EQ(db->infoFor("P1")->folder(), "inbox");
  EXPECT_EQ(db->loadDataBlob("doc", "one").view(), "one");
  EXPECT_EQ(entries(root() + "sales/d"), std::vector<std::string>{"doc"});
  EXPECT_EQ(texts.front(), "Starting decompression ...");
  for (const char* t : {"Metadata restore started...", "Metadata restore finished", "Replacing binaries..."}) {
    EXPECT_TRUE(has(texts, t)) << t;
  }
  EXPECT_TRUE(log.contains(Log::Notice, "Database restored for \"sales\" from \"" + archive() + "\""));
  EXPECT_EQ(entries(root() + "db.temp"), std::vector<std::string>{});
  EXPECT_FALSE(pool()->record("sales") && pool()->record("sales")->maintenance);
}

// Every file call of a restore failed in turn: the restore fails, and the
// database's folders hold exactly what they held before.
TEST_F(Restore, AFailureAtAnyFileCallLeavesTheDatabaseAsItWas) {
  change();
  keep("before");
  const auto before = files();
  env_.resetCounts();
  run(archive());
  const auto restored = files();
  ASSERT_NE(restored, before);
  putBack("before");
  // Until a round makes fewer calls than its failure point.
  bool injected = true;
  std::uint64_t n = 1;
  for (; injected && n < 2000; ++n) {
    SCOPED_TRACE("call " + std::to_string(n));
    env_.resetCounts();
    env_.failNth(FaultEnv::kAny, n);
    const auto injectedBefore = env_.injected();
    bool failed = false;
    try {
      run(archive());
    } catch (const std::exception&) {
      failed = true;
    }
    env_.clearFailures();
    injected = env_.injected() > injectedBefore;
    const auto now = files();
    if (failed) {
      EXPECT_EQ(now, before);
    } else {
      EXPECT_EQ(now, restored);
    }
    putBack("before");
  }
  EXPECT_GT(n, 40u);
}

// A power loss at any file call of a restore (every later call fails, then
// what was not synced is lost), then the recovery of the next start: the
// database is exactly the previous or exactly the restored one, and it
// opens.
TEST_F(Restore, APowerLossAtAnyPointLeavesThePreviousOrTheRestoredDatabase) {
  change();
  keep("before");
  const auto before = files();
  env_.resetCounts();
  run(archive());
  const auto restored = files();
  std::size_t sawPrevious = 0;
  std::size_t sawRestored = 0;
  // Until a round ends before its crash point.
  bool crashed = true;
  for (std::uint64_t n = 1; crashed && n < 2000; ++n) {
    SCOPED_TRACE("crash at call " + std::to_string(n));
    env_.dropUnsynced();  // forgets the pending changes of the round before
    putBack("before");
    env_.resetCounts();
    std::atomic<std::uint64_t> seen{0};
    env_.setCallHook([&](FaultEnv::Op, const sys::Path&) {
      if (++seen == n) env_.failOnPath(FaultEnv::kAny, "");
    });
    try {
      run(archive());
    } catch (const std::exception&) {
    }
    env_.setCallHook({});
    crashed = seen >= n;
    env_.clearFailures();
    env_.dropUnsynced();
    EXPECT_TRUE(maint::recoverRestores(env_, pool()->paths()).empty());
    const auto now = files();
    if (now == before) {
      ++sawPrevious;
    } else {
      EXPECT_EQ(now, restored);
      ++sawRestored;
    }
    EXPECT_FALSE(fs::exists(root() + "db.temp/sales"));
    EXPECT_EQ(RawDb(root() + "sales/cvdb.edb").value("PRAGMA integrity_check"), "ok");
  }
  EXPECT_GT(sawPrevious, 0u);
  EXPECT_GT(sawRestored, 0u);
}

TEST_F(Restore, AMissingArchiveFailsBeforeTheDatabaseIsHeld) {
  std::vector<std::string> texts;
  const std::string missing = (dir_ / "none.cvbak").string();
  try {
    run(missing);
    FAIL() << "restored from nothing";
  } catch (const std::exception& e) {
    EXPECT_EQ(std::string(e.what()),
              "Database restore for \"sales\" can not find the backup file: \"" + missing + "\"");
  }
  EXPECT_FALSE(db->isOpen());  // a failure leaves the connection without a session
  EXPECT_FALSE(pool()->record("sales") && pool()->record("sales")->maintenance);
  // A relative target lies below the backup folder, "\" as separator.
  fs::create_directories(root() + "db.backup/sub");
  fs::copy_file(archive(), root() + "db.backup/sub/x.cvbak");
  run("sub\\x.cvbak");
  ASSERT_TRUE(db->exists(true));
  EXPECT_EQ(db->loadMetaBlob("layout").view(), "{\"a\":1}");
}

// Files that are not a database of this server, or one the store cannot
// use, are refused before the previous files are touched.
TEST_F(Restore, ArchivesWithoutAUsableDatabaseAreRefusedAndNothingChanges) {
  const auto before = files();
  const std::string foreign = craft("foreign.cvbak", {{"cvdb.edb", std::string(8192, 'x')}, {"d\\doc\\one", "1"}});
  const std::string empty = craft("empty.cvbak", {{"originDB.txt", "x\r\nsales"}});
  // Our identity, other tables: the store could not use it.
  {
    const fs::path odd = dir_ / "odd.edb";
    fs::copy_file(root() + "sales/cvdb.edb", odd);
    RawDb(odd).exec("DROP INDEX fldStaIdx");
  }
  const std::string unusable = craft("unusable.cvbak", {{"cvdb.edb", readFile(dir_ / "odd.edb")}});
  for (const auto& bad : {foreign, empty, unusable}) {
    try {
      run(bad);
      FAIL() << bad;
    } catch (const std::exception& e) {
      EXPECT_EQ(std::string(e.what()), "The backup format is not compatible with the engine version");
    }
    EXPECT_EQ(files(), before);
    EXPECT_EQ(entries(root() + "db.temp"), std::vector<std::string>{});
  }
}

TEST_F(Restore, UnsafeEntryNamesAreRefusedBeforeAnythingIsWritten) {
  const auto before = files();
  for (const char* name : {"..\\..\\escaped", "d\\..\\..\\..\\escaped", "/../escaped"}) {
    auto content = goodEntries();
    content.emplace_back(name, "evil");
    const std::string bad = craft("slip.cvbak", content);
    try {
      run(bad);
      FAIL() << name;
    } catch (const std::exception& e) {
      EXPECT_TRUE(std::string(e.what()).starts_with("Decompression error: ")) << e.what();
    }
    EXPECT_EQ(files(), before);
    EXPECT_FALSE(fs::exists(root() + "escaped"));
    EXPECT_FALSE(fs::exists(dir_ / "escaped"));
    fs::remove(bad);
  }
}

// Leading separators and directory entries; an archive without data files
// leaves the database without a data folder; percentages of four entries.
TEST_F(Restore, EntryNamesAreMappedAndDirectoryEntriesIgnored) {
  auto content = goodEntries();
  content.emplace_back("\\d\\", "");
  content.emplace_back("/d\\doc\\", "");
  content.emplace_back("\\/d\\doc\\one", "ONE");
  const auto texts = run(craft("mapped.cvbak", content));
  EXPECT_EQ(db->loadDataBlob("doc", "one").view(), "ONE");
  EXPECT_EQ(entries(root() + "sales/d/doc"), std::vector<std::string>{"one"});
  for (const char* t :
       {"Decompression 25% complete (1/4)", "Decompression 50% complete (2/4)", "Decompression 75% complete (3/4)"}) {
    EXPECT_TRUE(has(texts, t)) << t;
  }
  const auto single = run(craft("single.cvbak", goodEntries()));
  EXPECT_FALSE(std::any_of(single.begin(), single.end(), [](auto& t) { return t.starts_with("Decompression"); }));
  EXPECT_FALSE(fs::exists(root() + "sales/d"));
}

TEST_F(Restore, TheRecordedNameIsKeptForOneArchiveAndFollowedForAFolder) {
  auto content = goodEntries();
  content.emplace_back("originDB.txt", "/elsewhere/cvdb.edb\r\nother\\deep");
  const fs::path folder = dir_ / "folder";
  fs::create_directories(folder);
  const std::string named = craft("folder/sales.cvbak", content);
  writeFile(folder / "notes.txt", "not a backup");
  {
    LogCapture log;
    run(named);
    EXPECT_TRUE(log.contains(Log::Notice,
                             "Restore found different DB name in backup file (other\\deep), but will "
                             "restore to the requested DB: sales"));
    EXPECT_FALSE(fs::exists(root() + "other"));
  }
  LogCapture log;
  run(folder.string(), true);
  EXPECT_TRUE(log.contains(Log::Notice, "Restore will use DB name from backup file (other\\deep) instead of sales"));
  EXPECT_TRUE(log.contains(Log::Notice, "Database restored for \"other\\deep\" from \"" + named + "\""));
  EXPECT_TRUE(log.contains(Log::Notice, "Can not restore \"" + (folder / "notes.txt").string() +
                                            "\" since it does not look like a backup file. Skipped"));
  EXPECT_EQ(RawDb(root() + "other/deep/cvdb.edb").value("SELECT blob FROM meta WHERE id = CAST('layout' AS BLOB)"),
            "{\"a\":1}");

  // A recorded name no client could use is refused, naming the archive.
  content.back().second = "x\r\n..\\..\\outside";
  const std::string evil = craft("folder/sales.cvbak", content);
  fs::remove(folder / "notes.txt");
  try {
    run(folder.string(), true);
    FAIL();
  } catch (const std::exception& e) {
    EXPECT_NE(std::string(e.what()).find(evil), std::string::npos) << e.what();
  }
  EXPECT_FALSE(fs::exists(dir_ / "outside"));
}

TEST_F(Restore, ARestoreThatCannotFitFailsAtOnce) {
  const auto before = files();
  env_.setFreeSpace(1000);
  try {
    run(archive());
    FAIL();
  } catch (const std::exception& e) {
    EXPECT_TRUE(std::string(e.what()).starts_with("Not enough free space to restore")) << e.what();
  }
  env_.setFreeSpace(std::nullopt);
  EXPECT_EQ(files(), before);
}

// The restore waits, telling so, until the other client has left.
TEST_F(Restore, ARestoreWaitsForTheDatabasesOtherClients) {
  auto other = open("sales");
  const auto texts = run(archive(), false, [&](const std::string& t) {
    if (t.starts_with("Waiting for all clients connected to the database to exit (3/")) other->disconnect();
  });
  EXPECT_TRUE(std::any_of(texts.begin(), texts.end(), [](const std::string& t) {
    return t.starts_with("Waiting for all clients connected to the database to exit (1/");
  }));
  EXPECT_TRUE(db->isOpen());
}

// Recovery reads only journals it could have written: a journal naming a
// database outside the root is refused and changes nothing, and a journal
// inside an unpacked archive is never looked at.
TEST_F(Restore, RecoveryTrustsOnlyItsOwnJournals) {
  const std::string work = root() + "db.temp/sales/";
  writeFile(work + "restore.journal", "cvdb restore journal 1\nkey ..\\..\\x\nstate placing\n");
  writeFile(work + "unpacked/x/restore.journal", "cvdb restore journal 1\nkey sales\nstate placing\n");
  const auto before = files();
  LogCapture log;
  EXPECT_TRUE(maint::recoverRestores(env_, pool()->paths()).empty());
  EXPECT_TRUE(log.contains(Log::Error, "names no valid database"));
  EXPECT_EQ(files(), before);
  // A working folder without a journal is debris, and goes.
  writeFile(root() + "db.temp/other/unpacked/cvdb.edb", "x");
  maint::recoverRestores(env_, pool()->paths());
  EXPECT_FALSE(fs::exists(root() + "db.temp/other"));
}

// A previous file whose name something else took meanwhile comes back
// under a name of its own instead of going with the working folder.
TEST_F(Restore, RecoveryKeepsAPreviousFileWhoseNameWasTaken) {
  files();
  const std::string work = root() + "db.temp/sales/";
  writeFile(work + "restore.journal", "cvdb restore journal 1\nkey sales\nstate aside\n");
  writeFile(work + "db.restore/notes.txt", "previous");
  writeFile(root() + "sales/notes.txt", "written meanwhile");
  writeFile(root() + "sales/notes.txt.before-restore", "taken too");
  LogCapture log;
  EXPECT_TRUE(maint::recoverRestores(env_, pool()->paths()).empty());
  EXPECT_EQ(readFile(root() + "sales/notes.txt"), "written meanwhile");
  EXPECT_EQ(readFile(root() + "sales/notes.txt.before-restore"), "taken too");
  EXPECT_EQ(readFile(root() + "sales/notes.txt.before-restore.2"), "previous");
  EXPECT_TRUE(
      log.contains(Log::Error, "its previous version is kept as \"" + root() + "sales/notes.txt.before-restore.2\""));
  EXPECT_FALSE(fs::exists(work));
}

}  // namespace
