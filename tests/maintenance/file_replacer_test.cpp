// Setting a folder's content aside and bringing it back: what moves, what
// stays, and what a failure in the middle leaves.

#include "maintenance/file_replacer.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <map>

#include "maintenance/temp_folder.h"
#include "support/fault_env.h"
#include "support/log_capture.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using testing_support::FaultEnv;
using testing_support::LogCapture;
using testing_support::readFile;
using testing_support::TempDir;
using testing_support::writeFile;

// Every file below root with its content ("dir/" for an empty folder).
std::map<std::string, std::string> tree(const fs::path& root) {
  std::map<std::string, std::string> out;
  if (!fs::exists(root)) return out;
  for (const auto& e : fs::recursive_directory_iterator(root)) {
    const std::string rel = fs::relative(e.path(), root).string();
    if (e.is_symlink())
      out[rel] = "-> " + fs::read_symlink(e.path()).string();
    else if (e.is_regular_file())
      out[rel] = readFile(e.path());
    else if (fs::is_empty(e.path()))
      out[rel + "/"] = "";
  }
  return out;
}

// A database folder: two files, the data subfolder, another subfolder and
// a link.
void fillTarget(const fs::path& target) {
  writeFile(target / "db.sqlite", "old database");
  writeFile(target / "db.sqlite-wal", "old log");
  writeFile(target / "d/1/a.bin", "old data");
  writeFile(target / "other/keep.txt", "untouched");
  fs::create_symlink("db.sqlite", target / "link");
}

const char* const kCritical = "Critical: Failed to restore original file(s) at \"";

TEST(FileReplacer, MovesFilesAndTheKeptSubfolderAsideAndRollsTheNewContentBack) {
  TempDir dir;
  const auto target = dir / "db";
  const auto holding = dir / "work/db.restore";
  fillTarget(target);
  const auto before = tree(target);
  {
    maint::FileReplacer replacer(sys::Env::posix(), target, holding, "d");
    EXPECT_EQ(replacer.moved().size(), 3u);
    // Only the other subfolder and the link stay behind.
    EXPECT_EQ(tree(target),
              (std::map<std::string, std::string>{{"link", "-> db.sqlite"}, {"other/keep.txt", "untouched"}}));
    EXPECT_EQ(readFile(holding / "d/1/a.bin"), "old data");
    // The failed operation's new content, including a new file name.
    writeFile(target / "db.sqlite", "new database");
    writeFile(target / "new.bin", "new");
    writeFile(target / "d/2/b.bin", "new data");
  }
  EXPECT_EQ(tree(target), before);
  EXPECT_TRUE(fs::is_empty(holding));
}

TEST(FileReplacer, WithoutAKeptSubfolderOnlyTopLevelFilesMove) {
  TempDir dir;
  const auto target = dir / "log";
  fillTarget(target);
  {
    maint::FileReplacer replacer(sys::Env::posix(), target, dir / "hold", "");
    EXPECT_EQ(replacer.moved().size(), 2u);
    EXPECT_TRUE(fs::exists(target / "d/1/a.bin"));
  }
  EXPECT_EQ(readFile(target / "db.sqlite"), "old database");
}

TEST(FileReplacer, CommittedReplacerTouchesNothing) {
  TempDir dir;
  const auto target = dir / "db";
  fillTarget(target);
  FaultEnv env(dir / "scratch");
  {
    maint::FileReplacer replacer(env, target, dir / "hold", "d");
    writeFile(target / "db.sqlite", "new database");
    replacer.commit();
    env.resetCounts();
  }
  EXPECT_EQ(env.count(FaultEnv::kAny), 0u);
  EXPECT_EQ(readFile(target / "db.sqlite"), "new database");
  EXPECT_EQ(readFile(dir / "hold/db.sqlite"), "old database");
}

TEST(FileReplacer, MissingTargetMovesNothingAndRollbackDeletesWhatAppeared) {
  TempDir dir;
  const auto target = dir / "db";
  {
    maint::FileReplacer replacer(sys::Env::posix(), target, dir / "hold", "d");
    EXPECT_FALSE(fs::exists(dir / "hold"));
    writeFile(target / "db.sqlite", "new");
    writeFile(target / "d/x", "new");
    writeFile(target / "other/y", "stays");
  }
  EXPECT_EQ(tree(target), (std::map<std::string, std::string>{{"other/y", "stays"}}));
}

TEST(FileReplacer, RollbackRecreatesADeletedTarget) {
  TempDir dir;
  const auto target = dir / "a/db";
  fillTarget(target);
  fs::remove(target / "link");
  fs::remove_all(target / "other");
  const auto before = tree(target);
  {
    maint::FileReplacer replacer(sys::Env::posix(), target, dir / "hold", "d");
    fs::remove_all(dir / "a");
  }
  EXPECT_EQ(tree(target), before);
}

// A rename that fails at each point of the creation: the error reaches the
// caller and every file already moved is back under its old name.
TEST(FileReplacer, FailureDuringCreationPutsMovedFilesBack) {
  TempDir dir;
  const auto target = dir / "db";
  fillTarget(target);
  const auto before = tree(target);
  for (int n = 1; n <= 3; ++n) {
    FaultEnv env(dir / "scratch");
    env.failNth(FaultEnv::Op::Rename, n, EXDEV);
    LogCapture log;
    try {
      maint::FileReplacer replacer(env, target, dir / "hold", "d");
      FAIL() << "creation should fail at rename " << n;
    } catch (const std::system_error& e) {
      EXPECT_EQ(e.code().value(), EXDEV);
    }
    EXPECT_EQ(tree(target), before) << "rename " << n;
    EXPECT_EQ(log.count(kCritical), 0u);
  }
  // The listing and the holding folder's creation fail the same way.
  for (auto op : {FaultEnv::Op::List, FaultEnv::Op::CreateFolders, FaultEnv::Op::Stat}) {
    FaultEnv env(dir / "scratch");
    env.failNth(op, 1);
    EXPECT_THROW(maint::FileReplacer(env, target, dir / "hold", "d"), std::system_error);
    EXPECT_EQ(tree(target), before);
  }
}

// A rollback that cannot finish stops at its first failure, logs the
// critical line once and leaves the rest in the holding folder.
TEST(FileReplacer, FailedRollbackIsLoggedAndDoesNotThrow) {
  TempDir dir;
  const auto target = dir / "db";
  fillTarget(target);
  FaultEnv env(dir / "scratch");
  LogCapture log;
  {
    maint::FileReplacer replacer(env, target, dir / "hold", "d");
    env.failNth(FaultEnv::Op::Rename, 2);
  }
  EXPECT_EQ(log.count(Log::Error,
                      std::string(kCritical) + target.string() + "\"! Database may be left in unpredictable state."),
            1u);
  // One entry came back, the failed one and the rest stayed aside.
  EXPECT_EQ(fs::exists(target / "db.sqlite") + fs::exists(target / "db.sqlite-wal") + fs::exists(target / "d"), 1);
  EXPECT_EQ(fs::exists(dir / "hold/db.sqlite") + fs::exists(dir / "hold/db.sqlite-wal") + fs::exists(dir / "hold/d"),
            2);
}

TEST(TempFolder, RemovesItsPathUnlessDismissedAndLogsAFailure) {
  TempDir dir;
  writeFile(dir / "work/a/b", "x");
  writeFile(dir / "keep/a", "x");
  writeFile(dir / "file", "x");
  fs::create_symlink(dir / "keep", dir / "work/link");
  { maint::TempFolder work(sys::Env::posix(), dir / "work"); }
  EXPECT_FALSE(fs::exists(dir / "work"));
  EXPECT_TRUE(fs::exists(dir / "keep/a"));  // through the link: not followed
  { maint::TempFolder file(sys::Env::posix(), dir / "file"); }
  EXPECT_FALSE(fs::exists(dir / "file"));
  {
    maint::TempFolder keep(sys::Env::posix(), dir / "keep");
    keep.dismiss();
  }
  EXPECT_TRUE(fs::exists(dir / "keep/a"));

  FaultEnv env(dir / "scratch");
  LogCapture log;
  { maint::TempFolder empty(env, ""); }
  EXPECT_EQ(env.count(FaultEnv::kAny), 0u);
  env.failNth(FaultEnv::Op::RemoveAll, 1);
  { maint::TempFolder keep(env, dir / "keep"); }
  EXPECT_EQ(log.count(Log::Error, "Failed to clean up file(s) at \"" + (dir / "keep").string() + '"'), 1u);
}

}  // namespace
