// Data files: whole files under one folder per id, names that cannot leave
// that folder, writes that never leave a half file, and the copy of an
// id's folder.

#include <gtest/gtest.h>

#include "engine/db_exc.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

namespace fs = std::filesystem;
using store_testing::entries;
using store_testing::FailingFileOps;
using store_testing::StoreTest;
using testing_support::LogCapture;
using testing_support::readFile;
using testing_support::VerboseLog;
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

TEST_F(DataFiles, FilesAreWrittenAndReadWhole) {
  VerboseLog verbose;
  LogCapture log;
  DB::DBLocal db("docs");  // data files need no open database
  EXPECT_EQ(db.dataDir("1234"), root() + "docs/d/1234/");
  EXPECT_TRUE(db.loadDataBlob("1234", "page.tif").empty());
  EXPECT_TRUE(log.contains(Log::Debug, "DB:loadDataBlob S:0 Can not find file \"1234/page.tif\""));

  const std::string content("binary\0bytes\xff", 13);
  save(db, "1234", "page.tif", content);
  EXPECT_EQ(readFile(root() + "docs/d/1234/page.tif"), content);
  EXPECT_TRUE(log.contains(Log::Debug, "DB:saveDataBlob S:0 Stored data in file \"1234/page.tif\" size: 13"));
  EXPECT_EQ(db.loadDataBlob("1234", "page.tif").view(), content);
  EXPECT_TRUE(log.contains(Log::Debug, "DB:loadDataBlob S:0 Returning data file \"1234/page.tif\" size: 13"));

  save(db, "1234", "page.tif", "");
  EXPECT_EQ(fs::file_size(root() + "docs/d/1234/page.tif"), 0u);
  EXPECT_TRUE(db.loadDataBlob("1234", "page.tif").empty());
  EXPECT_TRUE(log.contains(Log::Debug, "Returning data file \"1234/page.tif\" size: 0"));

  // A folder of that name is no file.
  fs::create_directories(root() + "docs/d/1234/sub");
  EXPECT_TRUE(db.loadDataBlob("1234", "sub").empty());
  // Nothing but the data files is left in the folder.
  EXPECT_EQ(entries(root() + "docs/d/1234"), (std::vector<std::string>{"page.tif", "sub"}));
}

TEST_F(DataFiles, NamesThatAreNotOnePathComponentAreRefusedBeforeAnyFileIsTouched) {
  writeFile(dir_ / "secret", "outside the root");
  DB::DBLocal db("docs");
  const std::vector<std::string> bad = {"", ".", "..", "../../../secret", "a/b", "a\\b", "/abs",
                                        std::string("x\0y", 3), "x/"};
  for (const auto& name : bad) {
    for (const auto& [id, file] : {std::pair{name, std::string("f")}, std::pair{std::string("id"), name}}) {
      const std::string what = messageOf([&] { save(db, id, file, "overwritten"); });
      EXPECT_NE(what.find("is not valid"), std::string::npos) << what;
      EXPECT_NE(what.find("one path component"), std::string::npos) << what;
      EXPECT_THROW(db.loadDataBlob(id, file), DB::DBExc);
    }
    EXPECT_THROW(db.copyDataFolder(name, "id"), DB::DBExc);
    EXPECT_THROW(db.copyDataFolder("id", name), DB::DBExc);
  }
  const std::string control = messageOf([&] { save(db, std::string("a\x01/", 3), "f", ""); });
  EXPECT_NE(control.find("\"a\\x01/\""), std::string::npos) << control;
  // Names of files being written are not for clients.
  EXPECT_THROW(save(db, "id", ".cvtmp.abc123", "x"), DB::DBExc);
  EXPECT_THROW(db.loadDataBlob("id", ".cvtmp.abc123"), DB::DBExc);

  EXPECT_EQ(entries(dir_.path()), (std::vector<std::string>{"secret"}));
  EXPECT_EQ(readFile(dir_ / "secret"), "outside the root");
}

TEST_F(DataFiles, AWriteThatFailsHalfWayKeepsThePreviousContent) {
  LogCapture log;
  DB::DBLocal db("docs");
  const std::string old = "the previous content";
  save(db, "7", "scan", old);
  const std::string path = root() + "docs/d/7/scan";

  for (const auto& [step, fail] : std::vector<std::pair<std::string, std::function<void(FailingFileOps&)>>>{
           {"write", [](FailingFileOps& f) { f.write_ = {.nth = 1, .error = ENOSPC, .partial = 4096}; }},
           {"flush", [](FailingFileOps& f) { f.fsync_ = {.nth = 1, .error = EIO}; }},
           {"rename", [](FailingFileOps& f) { f.rename_ = {.nth = 1, .error = EXDEV}; }}}) {
    FailingFileOps ops;
    fail(ops);
    DB::FileOps::Replacement replaced(ops);
    log.clear();
    const std::string what = messageOf([&] { save(db, "7", "scan", std::string(1 << 20, 'n')); });
    EXPECT_EQ(what, "Error writing to database file: \"" + path + '"') << step;
    EXPECT_TRUE(log.contains(Log::Warning, "Failed to " + step)) << step;
    EXPECT_EQ(db.loadDataBlob("7", "scan").view(), old) << step;
    EXPECT_EQ(entries(root() + "docs/d/7"), std::vector<std::string>{"scan"}) << step;
  }
  // A failure after the rename (flushing the folder) is reported, though
  // the new content is in place.
  FailingFileOps ops;
  ops.fsync_ = {.nth = 2, .error = EIO};
  DB::FileOps::Replacement replaced(ops);
  EXPECT_THROW(save(db, "7", "scan", "new"), DB::DBExc);
  EXPECT_EQ(db.loadDataBlob("7", "scan").view(), "new");
}

TEST_F(DataFiles, CopyingAFolderMergesIntoTheTargetAndKeepsTheSource) {
  LogCapture log;
  DB::DBLocal db("docs");
  save(db, "old", "a", "A");
  save(db, "old", "b", "B");
  writeFile(root() + "docs/d/old/nested/c", "C");
  writeFile(root() + "docs/d/old/.cvtmp.half", "half written");
  save(db, "new", "b", "stale");
  save(db, "new", "own", "kept");

  db.copyDataFolder("old", "new");
  EXPECT_EQ(entries(root() + "docs/d/new"), (std::vector<std::string>{"a", "b", "nested", "own"}));
  EXPECT_EQ(db.loadDataBlob("new", "b").view(), "B");
  EXPECT_EQ(db.loadDataBlob("new", "own").view(), "kept");
  EXPECT_EQ(readFile(root() + "docs/d/new/nested/c"), "C");
  EXPECT_EQ(db.loadDataBlob("old", "a").view(), "A");

  db.copyDataFolder("old", "fresh");
  EXPECT_EQ(db.loadDataBlob("fresh", "a").view(), "A");
  db.copyDataFolder("old", "old");
  EXPECT_EQ(db.loadDataBlob("old", "b").view(), "B");

  EXPECT_EQ(messageOf([&] { db.copyDataFolder("none", "other"); }), "Error renaming data folder none to other");
  EXPECT_TRUE(log.contains(Log::Error, "Failed to rename (copy) data folder for none to other. "));
  EXPECT_FALSE(fs::exists(root() + "docs/d/other"));
}

}  // namespace
