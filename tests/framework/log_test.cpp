#include "framework/log.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "framework/platform.h"
#include "support/log_capture.h"
#include "support/temp_dir.h"

namespace {

using testing_support::LogCapture;
using testing_support::VerboseLog;

TEST(Log, DebugEntriesOnlyWhenVerbose) {
  LogCapture capture;
  {
    VerboseLog quiet(false);
    Log::Lock(Log::Debug).logStreamLine() << "hidden";
    Log::Lock(Log::Notice).logStreamLine() << "shown";
  }
  {
    VerboseLog verbose;
    Log::Lock(Log::Debug).logStreamLine() << "debug shown";
  }
  EXPECT_EQ(capture.count("hidden"), 0u);
  EXPECT_TRUE(capture.contains(Log::Notice, "shown"));
  EXPECT_TRUE(capture.contains(Log::Debug, "debug shown"));
}

TEST(Log, FileRotatesAtTheRecycleSize) {
  testing_support::TempDir dir;
  const auto old = Platform::inst().logDir();
  Platform::inst().changeLogDir(dir.path());
  const std::string line(64 * 1024, 'x');
  const auto entries = Log::kRecycleLogFileSize / line.size() + 8;
  for (std::uint64_t i = 0; i < entries; ++i) Log::Lock(Log::Notice).logStreamLine() << line;
  Log::flush();
  Platform::inst().changeLogDir(old);

  const auto file = dir.path() / Log::kLogFileName;
  ASSERT_TRUE(std::filesystem::exists(file));
  EXPECT_LE(std::filesystem::file_size(file), Log::kRecycleLogFileSize);
  EXPECT_TRUE(std::filesystem::exists(dir.path() / "cvdbserver.1.log"));
}

TEST(Log, EntryCarriesTimeThreadPriorityAndText) {
  testing_support::TempDir dir;
  const auto old = Platform::inst().logDir();
  Platform::inst().changeLogDir(dir.path());
  Log::Lock(Log::Warning).logStreamLine() << "disk nearly full";
  Log::flush();
  Platform::inst().changeLogDir(old);
  const std::string text = testing_support::readFile(dir.path() / Log::kLogFileName);
  // [2026-12-06 07:37:38.123] [1234] [warning] disk nearly full
  EXPECT_NE(text.find("] [warning] disk nearly full"), std::string::npos) << text;
  EXPECT_EQ(text[0], '[');
  EXPECT_EQ(text[5], '-');
}

}  // namespace
