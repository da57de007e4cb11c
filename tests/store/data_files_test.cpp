// Data files: names that cannot leave their folder, writes that never
// leave a half file, and the copy of an id's folder.

#include <gtest/gtest.h>

#include "engine/db_exc.h"
#include "store/stale_files.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

namespace fs = std::filesystem;
using store_testing::entries;
using store_testing::StoreTest;
using testing_support::LogCapture;
using testing_support::readFile;
using testing_support::writeFile;

void save(DB::DBLocal& db, const std::string& id, const std::string& file, const std::string& content) {
  db.saveDataBlob(content.data(), content.size(), id, file);
}

std::string messageOf(const std::function<void()>& op) {
  try {
    op();
  } catch (const DB::DBExc& e) {
    return e.what();
  }
  return "(no failure)";
}

using DataFiles = StoreTest;

TEST_F(DataFiles, FilesAreWrittenAndReadWholeUnderTheirIdsFolder) {
  DB::DBLocal db(pool(), "docs");  // data files need no open database
  EXPECT_TRUE(db.loadDataBlob("1234", "page.tif").empty());
  const std::string content("binary\0bytes\xff", 13);
  save(db, "1234", "page.tif", content);
  EXPECT_EQ(readFile(root() + "docs/d/1234/page.tif"), content);
  EXPECT_EQ(db.loadDataBlob("1234", "page.tif").view(), content);
  save(db, "1234", "page.tif", "");
  EXPECT_TRUE(db.loadDataBlob("1234", "page.tif").empty());
  EXPECT_EQ(fs::file_size(root() + "docs/d/1234/page.tif"), 0u);
  fs::create_directories(root() + "docs/d/1234/sub");
  EXPECT_TRUE(db.loadDataBlob("1234", "sub").empty());  // a folder is no file
}

TEST_F(DataFiles, NamesThatAreNotOnePathComponentAreRefusedBeforeAnyFileIsTouched) {
  writeFile(dir_ / "secret", "outside the root");
  DB::DBLocal db(pool(), "docs");
  for (const std::string& name : {std::string(""), std::string("."), std::string(".."), std::string("../../../secret"),
                                  std::string("a/b"), std::string("a\\b"), std::string("x\0y", 3)}) {
    for (const auto& idAndFile : {std::pair{name, std::string("f")}, std::pair{std::string("id"), name}}) {
      const std::string& id = idAndFile.first;  // no structured binding: clang 14 cannot capture one
      const std::string& file = idAndFile.second;
      EXPECT_NE(messageOf([&] { save(db, id, file, "overwritten"); }).find("must be one path component"),
                std::string::npos);
      EXPECT_THROW(db.loadDataBlob(id, file), DB::DBExc);
    }
    EXPECT_THROW(db.copyDataFolder(name, "id"), DB::DBExc);
    EXPECT_THROW(db.copyDataFolder("id", name), DB::DBExc);
  }
  EXPECT_THROW(save(db, "id", ".cvtmp.abc123", "x"), DB::DBExc);  // names of files being written
  EXPECT_EQ(entries(dir_.path()), std::vector<std::string>{"secret"});
  EXPECT_EQ(readFile(dir_ / "secret"), "outside the root");
}

TEST_F(DataFiles, AWriteThatFailsHalfWayKeepsThePreviousContent) {
  LogCapture log;
  DB::DBLocal db(pool(), "docs");
  save(db, "7", "scan", "the previous content");
  const std::string path = root() + "docs/d/7/scan";
  using Op = testing_support::FaultEnv::Op;
  for (const auto& [op, step, error] : std::vector<std::tuple<Op, std::string, int>>{
           {Op::Write, "write", ENOSPC}, {Op::Sync, "flush", EIO}, {Op::Rename, "rename", EXDEV}}) {
    env_.failNth(op, 1, error);
    EXPECT_EQ(messageOf([&] { save(db, "7", "scan", std::string(1 << 20, 'n')); }),
              "Error writing to database file: \"" + path + '"');
    EXPECT_TRUE(log.contains(Log::Warning, "Failed to injected: " + step)) << step;
    EXPECT_EQ(db.loadDataBlob("7", "scan").view(), "the previous content") << step;
    EXPECT_EQ(entries(root() + "docs/d/7"), std::vector<std::string>{"scan"}) << step;  // no leftover
  }
}

TEST_F(DataFiles, CopyingAFolderMergesIntoTheTargetAndKeepsTheSource) {
  LogCapture log;
  DB::DBLocal db(pool(), "docs");
  save(db, "old", "a", "A");
  save(db, "old", "b", "B");
  writeFile(root() + "docs/d/old/nested/c", "C");
  writeFile(root() + "docs/d/old/.cvtmp.half", "being written");
  save(db, "new", "b", "stale");
  save(db, "new", "own", "kept");
  db.copyDataFolder("old", "new");
  EXPECT_EQ(entries(root() + "docs/d/new"), (std::vector<std::string>{"a", "b", "nested", "own"}));
  EXPECT_EQ(db.loadDataBlob("new", "b").view(), "B");
  EXPECT_EQ(db.loadDataBlob("new", "own").view(), "kept");
  EXPECT_EQ(readFile(root() + "docs/d/new/nested/c"), "C");
  EXPECT_EQ(db.loadDataBlob("old", "a").view(), "A");

  EXPECT_EQ(messageOf([&] { db.copyDataFolder("none", "other"); }), "Error renaming data folder none to other");
  EXPECT_TRUE(log.contains(Log::Error, "Failed to rename (copy) data folder for none to other. "));
  EXPECT_FALSE(fs::exists(root() + "docs/d/other"));
}

// Temporary files that interrupted writes left behind go at the start,
// also one that a crash left just before it; those of this process's own
// writes, files younger than the start, and the data files stay.
TEST_F(DataFiles, StaleTemporaryFilesOfInterruptedWritesAreRemoved) {
  auto db = open("s");
  db->saveDataBlob("data", 4, "doc", "page");
  const std::string folder = root() + "s/d/doc/";
  const std::string own = DB::processTempPrefix() + "run789";
  ASSERT_TRUE(own.starts_with(".cvtmp.") && own < ".cvtmp.new456");  // hex digits sort first
  writeFile(folder + ".cvtmp.old123", "half a write");
  writeFile(folder + ".cvtmp.just5", "cut");
  writeFile(folder + ".cvtmp.new456", "running");
  writeFile(folder + own, "this process");
  writeFile(folder + "page.cvtmp.x", "a client's file");
  const auto start = sys::WallClock::now();
  env_.setModified(folder + ".cvtmp.old123", start - std::chrono::hours(1));
  env_.setModified(folder + ".cvtmp.just5", start - std::chrono::milliseconds(20));
  env_.setModified(folder + ".cvtmp.new456", start + std::chrono::seconds(1));
  env_.setModified(folder + own, start - std::chrono::hours(1));
  env_.setModified(folder + "page.cvtmp.x", start - std::chrono::hours(1));
  LogCapture log;
  const auto report = DB::removeStaleTempFiles(env_, pool()->paths(), start);
  EXPECT_EQ(report.removed, 2u);
  EXPECT_EQ(report.bytes, 15u);
  EXPECT_EQ(entries(folder), (std::vector<std::string>{own, ".cvtmp.new456", "page", "page.cvtmp.x"}));
  EXPECT_TRUE(log.contains(Log::Notice, "Removed 2 temporary file(s) (15 bytes)"));
  // A sweep that finds nothing says so too: its end is always visible.
  EXPECT_EQ(DB::removeStaleTempFiles(env_, pool()->paths(), start).removed, 0u);
  EXPECT_TRUE(log.contains(Log::Notice, "No temporary files of interrupted data-file writes found"));
}

// A write in progress carries this process's prefix, so the sweep of this
// process never takes it away from under the write.
TEST_F(DataFiles, AWriteUnderWayIsNeverSwept) {
  DB::DBLocal db(pool(), "docs");
  std::vector<std::string> seen;
  env_.setCallHook([&](testing_support::FaultEnv::Op op, const sys::Path& path) {
    if (op != testing_support::FaultEnv::Op::Rename || !seen.empty()) return;
    seen = entries(path.parent_path());
    DB::removeStaleTempFiles(env_, pool()->paths(), sys::WallClock::now() + std::chrono::hours(1));
  });
  save(db, "doc", "page", "content");
  env_.setCallHook({});
  ASSERT_EQ(seen.size(), 1u);
  EXPECT_TRUE(seen[0].starts_with(DB::processTempPrefix())) << seen[0];
  EXPECT_EQ(db.loadDataBlob("doc", "page").view(), "content");
}

}  // namespace
