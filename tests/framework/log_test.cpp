#include "framework/log.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "framework/platform.h"
#include "support/temp_dir.h"

namespace {

TEST(Log, EntriesCarryTimeThreadPriorityAndTextAndTheFileRotatesAtTheRecycleSize) {
  testing_support::TempDir dir;
  const auto old = Platform::inst().logDir();
  Platform::inst().changeLogDir(dir.path());
  Log::Lock(Log::Warning).logStreamLine() << "disk nearly full";
  Log::Lock(Log::Notice).logStreamLine() << "client connected";
  // Read without a flush: an operator following the file sees each entry
  // as soon as it is written.
  // [2026-12-06 07:37:38.123] [1234] [warning] disk nearly full
  const std::string text = testing_support::readFile(dir.path() / Log::kLogFileName);
  EXPECT_NE(text.find("] [warning] disk nearly full"), std::string::npos) << text;
  EXPECT_NE(text.find("] [notice] client connected"), std::string::npos) << text;
  EXPECT_EQ(text.substr(0, 1) + text.substr(5, 1), "[-");

  const std::string line(64 * 1024, 'x');
  for (std::uint64_t i = 0; i < Log::kRecycleLogFileSize / line.size() + 8; ++i) {
    Log::Lock(Log::Notice).logStreamLine() << line;
  }
  Log::flush();
  Platform::inst().changeLogDir(old);
  EXPECT_LE(std::filesystem::file_size(dir.path() / Log::kLogFileName), Log::kRecycleLogFileSize);
  EXPECT_TRUE(std::filesystem::exists(dir.path() / "cvdbserver.1.log"));
}

// Client texts inside an entry cannot end it or put control bytes into
// the file; the server's own indented continuation lines and UTF-8 stay.
TEST(Log, EntriesArePrintableWhateverTheyQuote) {
  EXPECT_EQ(Log::printable("db \"x\n2026-12-06 [ERROR] forged\""), "db \"x\\x0a2026-12-06 [ERROR] forged\"");
  EXPECT_EQ(Log::printable(std::string("tag: \0\x7f\x1b[31m", 12)), "tag: \\x00\\x7f\\x1b[31m");
  EXPECT_EQ(Log::printable("caf\xC3\xA9 \xE9 \xED\xA0\x80"), "caf\xC3\xA9 \\xe9 \\xed\\xa0\\x80");
  EXPECT_EQ(Log::printable("Engine initialized\n\tline\ttab\r\nx\n"), "Engine initialized\n\tline\ttab\\x0d\\x0ax\n");
}

}  // namespace
