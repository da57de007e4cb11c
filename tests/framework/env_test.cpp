// The file-system and clock seam: the real calls report failures with the
// system's error number and the path, and the fault double fails what it
// is told to and forgets what was not synced.

#include "framework/env.h"

#include <gtest/gtest.h>

#include <thread>

#include "support/fault_env.h"
#include "support/temp_dir.h"

namespace {

using namespace std::chrono_literals;
using sys::FileType;
using sys::OpenMode;
using testing_support::FaultEnv;
using testing_support::readFile;
using testing_support::TempDir;
using testing_support::writeFile;

// The error number of what f throws, and that its text names the path.
template <typename F>
int errorOf(F f, const std::string& path) {
  try {
    f();
  } catch (const std::system_error& e) {
    EXPECT_NE(std::string(e.what()).find(path), std::string::npos) << e.what();
    return e.code().value();
  }
  return 0;
}

TEST(PosixEnv, FilesAndFoldersAndHowTheyFail) {
  TempDir dir;
  sys::Env& env = sys::Env::posix();
  const auto deep = dir / "a/b/c";
  const auto made = env.createFolders(deep);
  ASSERT_EQ(made.size(), 3u);
  EXPECT_EQ(made.front(), dir / "a");
  EXPECT_TRUE(env.createFolders(deep).empty());

  env.writeFileDurably(deep / "f", "first");
  env.writeFileDurably(deep / "f", "second");
  EXPECT_EQ(env.readFile(deep / "f"), "second");
  EXPECT_EQ(env.list(deep).size(), 1u);  // no temporary file stays
  EXPECT_EQ(env.copyFile(deep / "f", deep / "g"), 6u);
  std::filesystem::create_symlink(deep / "f", deep / "l");
  EXPECT_EQ(env.stat(deep / "l").type, FileType::Link);
  EXPECT_EQ(env.stat(deep / "l", true).type, FileType::Regular);
  EXPECT_EQ(env.stat(deep / "missing").type, FileType::Missing);
  EXPECT_EQ(env.stat(deep / "f" / "below").type, FileType::Missing);
  EXPECT_FALSE(env.readWritable(deep / "missing"));
  EXPECT_TRUE(env.readWritable(deep / "f"));

  const auto then = sys::WallClock::now() - 7h;
  env.setModified(deep / "g", then);
  EXPECT_LT(std::chrono::abs(env.stat(deep / "g").modified - then), 1s);
  EXPECT_GT(env.freeSpace(dir.path()), 0u);

  EXPECT_EQ(errorOf([&] { env.open(deep / "missing", OpenMode::Read); }, (deep / "missing").string()), ENOENT);
  EXPECT_EQ(errorOf([&] { env.open(deep / "f", OpenMode::CreateNew); }, (deep / "f").string()), EEXIST);
  EXPECT_EQ(errorOf([&] { env.link(deep / "f", deep / "g"); }, (deep / "f").string()), EEXIST);
  EXPECT_EQ(errorOf([&] { env.list(deep / "f"); }, (deep / "f").string()), ENOTDIR);
  EXPECT_FALSE(env.remove(deep / "missing"));
  EXPECT_TRUE(env.remove(deep / "l"));
  EXPECT_TRUE(env.stat(deep / "f").type == FileType::Regular);  // the link went, not its target
  EXPECT_EQ(env.removeAll(dir / "a"), 5u);
  EXPECT_EQ(env.removeAll(dir / "a"), 0u);

  // Reads and writes at offsets and from the current position.
  auto file = env.open(dir / "rw", OpenMode::CreateNew);
  file->write("hello world", 11);
  file->writeAt(0, "J", 1);
  char buf[16] = {};
  EXPECT_EQ(file->readAt(6, buf, sizeof buf), 5u);
  EXPECT_EQ(std::string(buf, 5), "world");
  file->sync();
  file->close();
  EXPECT_EQ(readFile(dir / "rw"), "Jello world");
}

TEST(PosixEnv, ASleepEndsWhenItsStopIsRequested) {
  std::stop_source stop;
  std::thread stopper([&] {
    std::this_thread::sleep_for(20ms);
    stop.request_stop();
  });
  const auto t0 = std::chrono::steady_clock::now();
  EXPECT_FALSE(sys::Env::posix().sleepFor(60s, stop.get_token()));
  EXPECT_LT(std::chrono::steady_clock::now() - t0, 10s);
  stopper.join();
  EXPECT_TRUE(sys::Env::posix().sleepFor(1ms));
}

TEST(FaultEnv, FailsTheNthCallOrCallsOnAPathAndCountsThem) {
  TempDir dir;
  FaultEnv env(dir / "scratch");
  auto file = env.open(dir / "f", OpenMode::CreateNew);
  env.failNth(FaultEnv::Op::Write, 2, ENOSPC);
  file->write("a", 1);
  EXPECT_EQ(errorOf([&] { file->write("b", 1); }, (dir / "f").string()), ENOSPC);
  file->write("c", 1);
  EXPECT_EQ(env.count(FaultEnv::Op::Write), 3u);
  EXPECT_EQ(env.injected(), 1u);

  env.failOnPath(FaultEnv::Op::Rename, "/f");
  EXPECT_EQ(errorOf([&] { env.rename(dir / "f", dir / "g"); }, (dir / "f").string()), EIO);
  env.clearFailures();
  env.rename(dir / "f", dir / "g");
  EXPECT_EQ(readFile(dir / "g"), "ac");

  // Any kind: the third call from now, whatever it is.
  env.failNth(FaultEnv::kAny, 3);
  env.stat(dir / "g");
  env.list(dir.path());
  EXPECT_THROW(env.readFile(dir / "g"), std::system_error);
}

TEST(FaultEnv, APowerLossDropsWhatWasNotSynced) {
  TempDir dir;
  FaultEnv env(dir / "scratch");
  env.createFolders(dir / "data");
  env.syncFolder(dir.path());
  env.writeFileDurably(dir / "data" / "kept", "old");  // synced, folder synced

  // Replaced by rename, but the folder was not synced: the old file returns.
  sys::Path temp;
  auto replacement = env.createTemp(dir / "data", ".tmp.", &temp);
  replacement->write("new", 3);
  replacement->sync();
  replacement->close();
  env.rename(temp, dir / "data" / "kept");
  // Created and written, never synced.
  auto fresh = env.open(dir / "data" / "fresh", OpenMode::CreateNew);
  fresh->write("lost", 4);
  // Synced content in a synced folder, then more that was not synced.
  auto grown = env.open(dir / "grown", OpenMode::CreateNew);
  grown->write("safe", 4);
  grown->sync();
  env.syncFolder(dir.path());
  grown->write("+more", 5);

  env.dropUnsynced();
  EXPECT_EQ(readFile(dir / "data" / "kept"), "old");
  EXPECT_FALSE(std::filesystem::exists(dir / "data" / "fresh"));
  EXPECT_FALSE(std::filesystem::exists(temp));
  EXPECT_EQ(readFile(dir / "grown"), "safe");
}

TEST(FaultEnv, AManualClockMovesOnlyWhenTold) {
  TempDir dir;
  FaultEnv env(dir / "scratch");
  const sys::WallClock::time_point start(std::chrono::seconds(1'700'000'000));
  env.useManualClock(start);
  EXPECT_EQ(env.nowSeconds(), 1'700'000'000);
  EXPECT_TRUE(env.sleepFor(90s));
  env.advance(10s);
  EXPECT_EQ(env.now(), start + 100s);
  std::stop_source stop;
  stop.request_stop();
  EXPECT_FALSE(env.sleepFor(1s, stop.get_token()));
  EXPECT_EQ(env.now(), start + 100s);
}

}  // namespace
