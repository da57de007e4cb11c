// Online backup under writes, and restore with its refusals.

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <map>
#include <thread>
#include <vector>

#include "engine/backup.h"
#include "engine/database_file.h"
#include "engine/restore.h"
#include "engine_fixture.h"
#include "support/log_capture.h"
#include "support/raw_db.h"

namespace {

namespace fs = std::filesystem;
using namespace engine_testing;
using engine::StatusKind;
using engine::StatusNotification;
using testing_support::RawDb;
using testing_support::readFile;
using testing_support::writeFile;

class BackupRestore : public EngineTest {
 protected:
  // A database with two accounts that always sum to 1000, and some bulk so
  // that a copy takes many steps.
  void fill(engine::Session& session) {
    DB::runInTransaction(session, [&] {
      session.prepare("UPDATE counter SET value = 1000").run();
      session.prepare("INSERT INTO counter VALUES(2, 0)").run();
      auto bulk = session.prepare("INSERT INTO blobs(id, blob) VALUES(?, randomblob(2000))");
      for (int i = 0; i < 1000; ++i) {
        bulk.bindBlob(1, "row" + std::to_string(i)).run();
        bulk.reset();
      }
    });
  }

  // A backup folder copied from a live database: its file and write-ahead
  // log, taken while a session holds the database open. The file holds the
  // tables only; the rows (one row of "blobs" per transaction) are in the
  // log. With restartAfter, the log starts over after that many rows (all
  // of them moved into the file first): the later rows overwrite its
  // beginning, and frames of the earlier ones stay behind them.
  void copyLiveDatabase(const std::string& key, const fs::path& to, int rows, int restartAfter = 0) {
    auto instance = makeInstance(key);
    auto session = makeDatabase(instance);
    session->execute("PRAGMA wal_checkpoint(TRUNCATE)");
    session->execute("PRAGMA wal_autocheckpoint=0");
    for (int i = 0; i < rows; ++i) {
      if (i > 0 && i == restartAfter) session->execute("PRAGMA wal_checkpoint(RESTART)");
      DB::runInTransaction(*session, [&] {
        session->prepare("INSERT INTO blobs(id, blob) VALUES(?, randomblob(100))")
            .bindBlob(1, "row" + std::to_string(i))
            .run();
      });
    }
    const fs::path file = instance->settings().instanceFolder / "cvdb.edb";
    fs::create_directories(to);
    fs::copy_file(file, to / "cvdb.edb");
    fs::copy_file(engine::walFile(file), to / "cvdb.edb-wal");
  }

  std::vector<StatusNotification> notes_;
  engine::StatusCallback record_ = [this](const StatusNotification& n) { notes_.push_back(n); };
};

// Every file of a folder with its bytes: a refused restore leaves the
// destination's exactly as they were, and no file of its own.
std::map<std::string, std::string> filesOf(const fs::path& folder) {
  std::map<std::string, std::string> files;
  for (const auto& e : fs::directory_iterator(folder)) files[e.path().filename().string()] = readFile(e.path());
  return files;
}

void expectWellFormedReports(const std::vector<StatusNotification>& notes, engine::SnapshotOperation operation) {
  ASSERT_GE(notes.size(), 3u);
  EXPECT_EQ(notes.front().kind, StatusKind::Begin);
  EXPECT_EQ(notes.back().kind, StatusKind::Complete);
  std::uint32_t last = 0;
  for (std::size_t i = 1; i + 1 < notes.size(); ++i) {
    EXPECT_EQ(notes[i].operation, operation);
    ASSERT_EQ(notes[i].kind, StatusKind::Progress);
    ASSERT_TRUE(notes[i].done && notes[i].total);
    EXPECT_GE(*notes[i].done, last);
    EXPECT_LE(*notes[i].done, *notes[i].total);
    last = *notes[i].done;
  }
  EXPECT_EQ(last, *notes[notes.size() - 2].total);
}

TEST_F(BackupRestore, BackupUnderContinuousWritesIsAConsistentSnapshot) {
  auto instance = makeInstance("live");
  auto session = makeDatabase(instance);
  fill(*session);

  std::atomic<bool> stop{false};
  std::atomic<int> transfers{0};
  std::thread writer([&] {
    auto own = openSession(instance);
    while (!stop) {
      DB::runInTransaction(*own, [&] {
        own->prepare("UPDATE counter SET value = value - 1 WHERE id = 1").run();
        own->prepare("UPDATE counter SET value = value + 1 WHERE id = 2").run();
      });
      ++transfers;
    }
  });
  while (transfers < 20) std::this_thread::yield();
  // In the middle of the copy, writers get through (bounded wait: a writer
  // blocked by the copy fails the test instead of hanging it).
  int during = -1;
  const auto recordAndWait = [&](const StatusNotification& n) {
    record_(n);
    if (n.kind != StatusKind::Progress || during >= 0) return;
    const int mark = transfers;
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (transfers < mark + 5 && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
    during = transfers - mark;
  };
  const fs::path target = dir_.path() / "backup";
  engine::backupInstance(*instance, target, recordAndWait, 8);
  stop = true;
  writer.join();

  expectWellFormedReports(notes_, engine::SnapshotOperation::Backup);
  EXPECT_GT(notes_.size(), 10u);
  const fs::path copy = target / "cvdb.edb";
  EXPECT_EQ(fs::directory_iterator(target)->path(), copy);  // nothing but the copy
  RawDb db(copy);
  EXPECT_EQ(db.value("PRAGMA integrity_check"), "ok");
  EXPECT_EQ(db.number("PRAGMA application_id"), engine::kApplicationId);
  EXPECT_EQ(db.number("SELECT sum(value) FROM counter"), 1000);
  EXPECT_EQ(db.number("SELECT count(*) FROM blobs"), 1000);
  EXPECT_GE(during, 5);
}

TEST_F(BackupRestore, FailedBackupLeavesNoCopy) {
  auto instance = makeInstance("failing");
  auto session = makeDatabase(instance);
  fill(*session);
  const fs::path target = dir_.path() / "backup";
  int calls = 0;
  EXPECT_THROW(engine::backupInstance(
                   *instance, target,
                   [&](const StatusNotification& n) {
                     if (n.kind == StatusKind::Progress && ++calls == 3) throw std::runtime_error("client went away");
                   },
                   8),
               std::runtime_error);
  EXPECT_TRUE(fs::is_empty(target));

  EXPECT_EQ(codeOf([&] { engine::backupInstance(*engine::Instance::create(settingsFor("none")), target, record_); }),
            err::kNotInitialized);
}

// The restored file replaces the destination's, whatever its name in the
// backup; a write-ahead log left beside the destination is not replayed
// onto it.
TEST_F(BackupRestore, RestorePlacesTheBackupUnderAnyNameAndDropsAStaleLog) {
  const fs::path backup = dir_.path() / "backup";
  const fs::path file = root() + "r/cvdb.edb";
  const fs::path savedWal = dir_.path() / "saved-wal";
  {
    auto instance = makeInstance("r");
    auto session = makeDatabase(instance);
    fill(*session);
    engine::backupInstance(*instance, backup, nullptr);
    // Changes after the backup, kept in the write-ahead log only.
    session->execute("PRAGMA wal_autocheckpoint=0");
    DB::runInTransaction(*session, [&] {
      session->prepare("UPDATE counter SET value = 1 WHERE id = 1").run();
      session->prepare("DELETE FROM blobs WHERE rowid % 2 = 0").run();
    });
    fs::copy_file(engine::walFile(file), savedWal);
  }
  fs::copy_file(savedWal, engine::walFile(file));
  fs::rename(backup / "cvdb.edb", backup / "old-name.db");
  writeFile(backup / "originDB.txt", "x\r\nr");

  const engine::InstanceSettings settings = settingsFor("r");
  auto held = engine::Instance::create(settings);
  engine::restoreInstance(*held, backup, settings.instanceFolder, record_);
  expectWellFormedReports(notes_, engine::SnapshotOperation::Restore);
  EXPECT_FALSE(fs::exists(engine::walFile(file)));
  EXPECT_TRUE(fs::exists(backup / "old-name.db"));  // the backup itself is left as it was
  held->term();
  // Two files with our identity: neither is taken.
  fs::copy_file(backup / "old-name.db", backup / "other.db");
  EXPECT_EQ(codeOf([&] {
              engine::restoreInstance(*engine::Instance::create(settings), backup, settings.instanceFolder, nullptr);
            }),
            err::kBadBackupFormat);

  RawDb db(file);
  EXPECT_EQ(db.number("SELECT value FROM counter WHERE id = 1"), 1000);
  EXPECT_EQ(db.value("PRAGMA integrity_check"), "ok");
  EXPECT_EQ(db.number("SELECT count(*) FROM blobs"), 1000);
}

std::vector<std::string> namesIn(const fs::path& folder) {
  std::vector<std::string> names;
  for (const auto& [name, bytes] : filesOf(folder)) names.push_back(name);
  return names;
}

// The offset of frame n (from 1) of a write-ahead log: a 32-byte header,
// then frames of a 24-byte header and a page each.
std::size_t frameAt(const std::string& log, std::size_t n) {
  const auto page = (std::size_t{static_cast<unsigned char>(log[10])} << 8) | static_cast<unsigned char>(log[11]);
  return 32 + (n - 1) * (24 + page);
}

// A folder copied from a live database holds committed transactions in its
// write-ahead log only; the restore applies them, under the configured name
// and under the name of a file found by its identity.
TEST_F(BackupRestore, RestoreAppliesTheWriteAheadLogShippedBesideTheFile) {
  const fs::path backup = dir_.path() / "backup";
  copyLiveDatabase("src", backup, 21);
  const fs::path alone = dir_.path() / "alone";
  fs::create_directories(alone);
  fs::copy_file(backup / "cvdb.edb", alone / "cvdb.edb");
  ASSERT_EQ(RawDb(alone / "cvdb.edb").number("SELECT count(*) FROM blobs"), 0);  // the rows are in the log only
  const auto shipped = filesOf(backup);

  const auto restoreAndCount = [&](const fs::path& from, const std::string& key) {
    const engine::InstanceSettings settings = settingsFor(key);
    engine::restoreInstance(*engine::Instance::create(settings), from, settings.instanceFolder, record_);
    EXPECT_EQ(namesIn(settings.instanceFolder), std::vector<std::string>{"cvdb.edb"});
    RawDb db(settings.instanceFolder / "cvdb.edb");
    EXPECT_EQ(db.value("PRAGMA integrity_check"), "ok");
    return db.number("SELECT count(*) FROM blobs");
  };
  EXPECT_EQ(restoreAndCount(backup, "a"), 21);
  expectWellFormedReports(notes_, engine::SnapshotOperation::Restore);
  EXPECT_TRUE(filesOf(backup) == shipped) << "the backup changed";

  fs::rename(backup / "cvdb.edb", backup / "old.db");
  fs::rename(backup / "cvdb.edb-wal", backup / "old.db-wal");
  EXPECT_EQ(restoreAndCount(backup, "b"), 21);

  // A log left beside the staged copy by a restore that did not finish is
  // not replayed onto the next one's copy.
  const engine::InstanceSettings settings = settingsFor("c");
  fs::create_directories(settings.instanceFolder);
  fs::copy_file(backup / "old.db-wal", settings.instanceFolder / "cvdb.edb.restoring-wal");
  EXPECT_EQ(restoreAndCount(alone, "c"), 0);
}

// A log is applied only whole: one that would lose a transaction it
// records as committed, or is no regular file, is refused and the
// destination keeps exactly its files. What a log may hold beyond its last
// commit (a transaction still being written when the folder was copied,
// frames of the log's earlier rounds) is left out, as SQLite leaves it.
TEST_F(BackupRestore, ALogThatCannotBeAppliedWholeIsRefused) {
  const fs::path live = dir_.path() / "live";
  copyLiveDatabase("src", live, 21);
  const std::string log = readFile(live / "cvdb.edb-wal");
  ASSERT_GT(log.size(), frameAt(log, 42));  // two frames (table and index) a row

  const std::string dest = root() + "dest/";
  makeDatabase(makeInstance("dest"));
  const auto destBefore = filesOf(dest);
  ASSERT_EQ(namesIn(dest), std::vector<std::string>{"cvdb.edb"});

  const auto damaged = [&](std::size_t at) {
    std::string bytes = log;
    bytes[at] = static_cast<char>(bytes[at] ^ 0x5a);
    return bytes;
  };
  struct Refused {
    const char* name;
    std::function<void(const fs::path&)> make;
    const char* reason;  // in the refusal's log line
  };
  const std::vector<Refused> refused{
      {"header fails its checksum", [&](const fs::path& f) { writeFile(f, damaged(17)); }, "has a damaged header"},
      {"cut inside its header", [&](const fs::path& f) { writeFile(f, log.substr(0, 20)); }, "cut inside its header"},
      {"frame damaged before later commits",
       [&](const fs::path& f) { writeFile(f, damaged(frameAt(log, 2) + 24 + 100)); },
       "frame 2 of the write-ahead log \"cvdb.edb-wal\" is damaged"},
      {"link", [&](const fs::path& f) { fs::create_symlink(live / "cvdb.edb-wal", f); }, "is not a regular file"},
  };
  for (const auto& c : refused) {
    SCOPED_TRACE(c.name);
    testing_support::TempDir backup;
    fs::copy_file(live / "cvdb.edb", backup / "cvdb.edb");
    c.make(backup / "cvdb.edb-wal");
    testing_support::LogCapture captured;
    auto held = engine::Instance::create(settingsFor("dest"));
    EXPECT_EQ(codeOf([&] { engine::restoreInstance(*held, backup.path(), dest, nullptr); }), err::kBadBackupFormat);
    EXPECT_TRUE(captured.contains(Log::Warning, c.reason));
    EXPECT_TRUE(filesOf(dest) == destBefore) << "destination changed";
  }

  const fs::path restarted = dir_.path() / "restarted";
  copyLiveDatabase("src2", restarted, 21, 15);
  struct Kept {
    const char* name;
    fs::path file;
    std::string log;
    std::int64_t rows;
  };
  const std::vector<Kept> kept{
      {"last frame cut short", live / "cvdb.edb", log.substr(0, log.size() - 1000), 20},
      {"empty log", live / "cvdb.edb", "", 0},
      {"earlier round's frames behind the last commit", restarted / "cvdb.edb", readFile(restarted / "cvdb.edb-wal"),
       21},
  };
  for (std::size_t i = 0; i < kept.size(); ++i) {
    SCOPED_TRACE(kept[i].name);
    testing_support::TempDir backup;
    fs::copy_file(kept[i].file, backup / "cvdb.edb");
    writeFile(backup / "cvdb.edb-wal", kept[i].log);
    const engine::InstanceSettings settings = settingsFor("kept" + std::to_string(i));
    engine::restoreInstance(*engine::Instance::create(settings), backup.path(), settings.instanceFolder, nullptr);
    EXPECT_EQ(RawDb(settings.instanceFolder / "cvdb.edb").number("SELECT count(*) FROM blobs"), kept[i].rows);
  }
}

// The caller's schema check runs on the staged copy, with the log applied
// and before anything is placed; what it says is missing refuses the
// restore and is logged, and the destination keeps exactly its files.
TEST_F(BackupRestore, TheSchemaCheckDecidesOnTheStagedCopy) {
  const fs::path backup = dir_.path() / "backup";
  copyLiveDatabase("src", backup, 21);
  std::string checked;
  std::int64_t rowsSeen = -1;
  const engine::SchemaCheck counting = [&](sqlite3* db) {
    checked = fs::path(sqlite3_db_filename(db, "main")).filename().string();
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v2(db, "SELECT count(*) FROM blobs", -1, &s, nullptr) == SQLITE_OK &&
        sqlite3_step(s) == SQLITE_ROW) {
      rowsSeen = sqlite3_column_int64(s, 0);
    }
    sqlite3_finalize(s);
    return std::string();
  };
  const engine::InstanceSettings settings = settingsFor("a");
  engine::restoreInstance(*engine::Instance::create(settings), backup, settings.instanceFolder, nullptr, counting);
  EXPECT_EQ(checked, "cvdb.edb.restoring");
  EXPECT_EQ(rowsSeen, 21);
  EXPECT_EQ(RawDb(settings.instanceFolder / "cvdb.edb").number("SELECT count(*) FROM blobs"), 21);

  const std::string dest = root() + "dest/";
  makeDatabase(makeInstance("dest"));
  const auto destBefore = filesOf(dest);
  testing_support::LogCapture captured;
  const engine::SchemaCheck lacking = [](sqlite3*) { return std::string("no table \"info\""); };
  EXPECT_EQ(codeOf([&] {
              engine::restoreInstance(*engine::Instance::create(settingsFor("dest")), backup, dest, nullptr, lacking);
            }),
            err::kBadBackupFormat);
  EXPECT_TRUE(captured.contains(Log::Warning, "no table \"info\""));
  EXPECT_TRUE(filesOf(dest) == destBefore) << "destination changed";
}

// Backups that are not ours, are newer, are damaged, or are not regular
// files are refused with -514, and the destination keeps exactly its files.
TEST_F(BackupRestore, UnusableBackupsAreRefusedAndTheDestinationIsUntouched) {
  const fs::path good = dir_.path() / "good";
  const std::string dest = root() + "dest/";
  {
    auto instance = makeInstance("dest");
    auto session = makeDatabase(instance);
    fill(*session);
    engine::backupInstance(*instance, good, nullptr);
    session->execute("PRAGMA wal_autocheckpoint=0");
    DB::runInTransaction(*session, [&] { session->prepare("UPDATE counter SET value = 5").run(); });
    // Keep the destination with a live write-ahead log: copy its files.
    for (const std::string& f : {dest + "cvdb.edb", dest + "cvdb.edb-wal"}) fs::copy_file(f, f + ".keep");
  }
  for (const std::string& f : {dest + "cvdb.edb", dest + "cvdb.edb-wal"}) fs::rename(f + ".keep", f);
  const auto destBefore = filesOf(dest);
  ASSERT_EQ(destBefore.size(), 2u);  // the file and its log
  const auto goodBytes = readFile(good / "cvdb.edb");

  struct Case {
    const char* name;
    std::function<void(const fs::path&)> make;
  };
  const std::vector<Case> cases{
      {"missing", [](const fs::path&) {}},
      {"not SQLite", [](const fs::path& f) { writeFile(f, std::string(4096, 'E')); }},
      {"another application",
       [](const fs::path& f) { RawDb(f, true).exec("CREATE TABLE t(x); INSERT INTO t VALUES(1);"); }},
      {"newer format",
       [&](const fs::path& f) {
         writeFile(f, goodBytes);
         RawDb(f).exec("PRAGMA user_version=" + std::to_string(engine::kFormatVersion + 1));
       }},
      {"truncated", [&](const fs::path& f) { writeFile(f, goodBytes.substr(0, goodBytes.size() / 2)); }},
      // A page size the copy would divide by, and ones that are no power of two.
      {"page size 0",
       [&](const fs::path& f) { writeFile(f, goodBytes.substr(0, 16) + std::string(2, '\0') + goodBytes.substr(18)); }},
      {"page size 1000",
       [&](const fs::path& f) { writeFile(f, goodBytes.substr(0, 16) + "\x03\xe8" + goodBytes.substr(18)); }},
      {"page size 3000",
       [&](const fs::path& f) { writeFile(f, goodBytes.substr(0, 16) + "\x0b\xb8" + goodBytes.substr(18)); }},
      // Under the configured name a link to a good database, or a folder:
      // refused, not passed over for another file of ours beside it.
      {"link",
       [&](const fs::path& f) {
         fs::create_symlink(good / "cvdb.edb", f);
         writeFile(f.parent_path() / "spare.db", goodBytes);
       }},
      {"folder",
       [&](const fs::path& f) {
         fs::create_directory(f);
         writeFile(f.parent_path() / "spare.db", goodBytes);
       }},
      {"damaged",
       [&](const fs::path& f) {
         std::string bytes = goodBytes;
         for (std::size_t i = 3 * 4096 + 8; i < 6 * 4096; ++i) bytes[i] = static_cast<char>(i * 7);
         writeFile(f, bytes);
       }},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    testing_support::TempDir backup;
    c.make(backup / "cvdb.edb");
    auto held = engine::Instance::create(settingsFor("dest"));
    EXPECT_EQ(codeOf([&] { engine::restoreInstance(*held, backup.path(), dest, nullptr); }), err::kBadBackupFormat);
    EXPECT_TRUE(filesOf(dest) == destBefore) << "destination changed";
  }

  auto initialised = makeInstance("other");
  EXPECT_EQ(codeOf([&] { engine::restoreInstance(*initialised, good, dest, nullptr); }), err::kAfterInitialization);
}

// SQLite writes the largest page size, 65,536, as 1 in the header's two
// bytes: such a database is restored, not refused as one of page size 1.
TEST_F(BackupRestore, ADatabaseOfTheLargestPageSizeIsRestored) {
  testing_support::TempDir backup;
  const fs::path source = backup / "cvdb.edb";
  RawDb(source, true)
      .exec("PRAGMA page_size=65536; PRAGMA journal_mode=WAL; PRAGMA application_id=" +
            std::to_string(engine::kApplicationId) + "; PRAGMA user_version=" + std::to_string(engine::kFormatVersion) +
            "; CREATE TABLE t(x); INSERT INTO t VALUES(7);");
  ASSERT_EQ(readFile(source).substr(16, 2), std::string("\0\x01", 2));

  const engine::InstanceSettings settings = settingsFor("big");
  engine::restoreInstance(*engine::Instance::create(settings), backup.path(), settings.instanceFolder, nullptr);
  RawDb db(settings.instanceFolder / "cvdb.edb");
  EXPECT_EQ(db.number("PRAGMA page_size"), 65536);
  EXPECT_EQ(db.number("SELECT x FROM t"), 7);
}

// Every file-system call that creating a database file, backing one up or
// restoring one makes, failed in turn: what each promises on failure holds
// every time. A creation leaves no file (or a whole one) and no building
// file; a backup leaves no copy; a restore (of a folder whose log is
// applied) leaves the destination's file and write-ahead log exactly as they
// were (the log may hold committed transactions) and nothing of its own.
TEST_F(BackupRestore, EveryFailingFileCallLeavesWhatTheHeadersPromise) {
  using testing_support::FaultEnv;
  const auto sweep = [&](const char* what, const std::function<void(int)>& run, const std::function<void(int)>& check) {
    env_.resetCounts();
    run(0);
    const auto calls = env_.count(FaultEnv::kAny);
    ASSERT_GT(calls, 3u) << what;
    for (std::uint64_t n = 1; n <= calls; ++n) {
      SCOPED_TRACE(std::string(what) + " call " + std::to_string(n));
      env_.resetCounts();
      env_.failNth(FaultEnv::kAny, n);
      try {
        run(static_cast<int>(n));
      } catch (const DB::DBExc&) {
        // Checked below.
      }
      env_.clearFailures();
      check(static_cast<int>(n));
    }
  };

  sweep(
      "creation",
      [&](int n) {
        auto instance = makeInstance("c" + std::to_string(n));
        instance->beginSession()->createDatabase(root() + "c" + std::to_string(n) + "/cvdb.edb");
      },
      [&](int n) {
        const std::string file = root() + "c" + std::to_string(n) + "/cvdb.edb";
        EXPECT_FALSE(fs::exists(file + ".creating"));
        if (fs::exists(file)) {
          EXPECT_EQ(RawDb(file).value("PRAGMA application_id"), std::to_string(engine::kApplicationId));
        }
      });

  auto source = makeInstance("src");
  auto session = makeDatabase(source);
  fill(*session);
  sweep(
      "backup", [&](int n) { engine::backupInstance(*source, dir_.path() / ("b" + std::to_string(n)), nullptr); },
      [&](int n) {
        const fs::path target = dir_.path() / ("b" + std::to_string(n));
        if (!fs::exists(target / "cvdb.edb")) return;
        EXPECT_EQ(RawDb(target / "cvdb.edb").value("PRAGMA integrity_check"), "ok");
      });
  // The restores take a folder copied from the live database, with a
  // transfer that is in its write-ahead log only.
  const fs::path good = dir_.path() / "live";
  session->execute("PRAGMA wal_checkpoint(TRUNCATE)");
  session->execute("PRAGMA wal_autocheckpoint=0");
  DB::runInTransaction(*session, [&] { session->prepare("UPDATE counter SET value = 999 WHERE id = 1").run(); });
  fs::create_directories(good);
  for (const std::string name : {"cvdb.edb", "cvdb.edb-wal"}) fs::copy_file(root() + "src/" + name, good / name);

  const std::string dest = root() + "dest/";
  {
    auto instance = makeInstance("dest");
    auto s = makeDatabase(instance);
    s->execute("PRAGMA wal_autocheckpoint=0");
    DB::runInTransaction(*s, [&] { s->prepare("UPDATE counter SET value = 5").run(); });
    for (const std::string& f : {dest + "cvdb.edb", dest + "cvdb.edb-wal"}) fs::copy_file(f, f + ".keep");
  }
  const auto before = [&] {
    for (const std::string& f : {dest + "cvdb.edb", dest + "cvdb.edb-wal"}) {
      fs::remove(f);
      fs::copy_file(f + ".keep", f);
    }
  };
  before();
  const auto destBytes = readFile(dest + "cvdb.edb");
  const auto walBytes = readFile(dest + "cvdb.edb-wal");
  sweep(
      "restore",
      [&](int) {
        before();
        engine::restoreInstance(*engine::Instance::create(settingsFor("dest")), good, dest, nullptr);
      },
      [&](int) {
        std::vector<std::string> names;
        for (const auto& e : fs::directory_iterator(dest)) {
          // A log set aside whose removal failed stays under a name SQLite never reads.
          if (e.path().filename() != "cvdb.edb-wal.replaced") names.push_back(e.path().filename().string());
        }
        std::sort(names.begin(), names.end());
        if (readFile(dest + "cvdb.edb") != destBytes) {
          // Restored (a failure could only come from the folder's sync after
          // the rename): the new file is in place, whole, and the old log is
          // out of SQLite's way.
          EXPECT_EQ(names, (std::vector<std::string>{"cvdb.edb", "cvdb.edb-wal.keep", "cvdb.edb.keep"}));
          EXPECT_EQ(RawDb(dest + "cvdb.edb").number("SELECT value FROM counter WHERE id = 1"), 999);
        } else {
          EXPECT_TRUE(readFile(dest + "cvdb.edb-wal") == walBytes) << "write-ahead log lost";
          EXPECT_EQ(names,
                    (std::vector<std::string>{"cvdb.edb", "cvdb.edb-wal", "cvdb.edb-wal.keep", "cvdb.edb.keep"}));
        }
      });
}

}  // namespace
