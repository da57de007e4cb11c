// Named values: whole replacement on both sides of the streaming limit,
// keys compared as bytes, prefix listings exact for any byte, and the
// engine's limits.

#include <gtest/gtest.h>

#include <random>

#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

using store_testing::StoreTest;
using testing_support::LogCapture;
using testing_support::VerboseLog;
using Keys = std::vector<std::string>;

std::string randomBytes(std::size_t n) {
  std::mt19937 gen(static_cast<unsigned>(n));
  std::string out(n, '\0');
  for (auto& c : out) c = static_cast<char>(gen());
  return out;
}

void save(DB::DBLocal& db, const std::string& key, const std::string& value) {
  db.saveMetaBlob(value.data(), value.size(), key);
}

using MetaBlobs = StoreTest;

TEST_F(MetaBlobs, ValuesAreReplacedWholeAcrossTheStreamingLimit) {
  auto db = open("m");
  constexpr auto limit = static_cast<std::size_t>(DB::DBLocal::kInlineValueBytes);
  // Growing and shrinking across the limit between bound and streamed
  // values; each read must give exactly the last value.
  for (const std::size_t size : {std::size_t{14}, limit, limit + 1, std::size_t{9} << 20, std::size_t{5}, limit + 1}) {
    const std::string value = randomBytes(size);
    save(*db, "doc", value);
    EXPECT_TRUE(db->loadMetaBlob("doc").view() == value) << size;
  }
  EXPECT_TRUE(open("m")->loadMetaBlob("doc").view() == randomBytes(limit + 1));  // another session

  VerboseLog verbose;
  LogCapture log;
  const auto s = std::to_string(db->sessionId());
  save(*db, "doc", "");
  EXPECT_TRUE(db->loadMetaBlob("doc").empty());
  EXPECT_TRUE(log.contains(Log::Debug, "DB:loadMetaBlob S:" + s + " No metadata for key doc"));
  EXPECT_EQ(db->metaBlobsWithPrefix(""), Keys{"doc"});  // an empty value is still a row
  EXPECT_TRUE(db->removeMetaBlob("doc"));
  EXPECT_FALSE(db->removeMetaBlob("doc"));
  EXPECT_TRUE(log.contains(Log::Debug, "DB:removeMetaBlob S:" + s + " No metadata found for doc"));
  EXPECT_TRUE(db->metaBlobsWithPrefix("").empty());
}

TEST_F(MetaBlobs, KeysAreBytesAndPrefixesMatchExactly) {
  auto db = open("m");
  const Keys stored = {std::string("\0", 1),
                       std::string("\0\0", 2),
                       "%",
                       "%x",
                       "A",
                       "_",
                       "_y",
                       "a",
                       "ab",
                       "abc",
                       "abd",
                       "a\xff",
                       "a\xff\x01",
                       "a\xff\xff",
                       "b",
                       "\xff",
                       "\xff\xff"};
  for (const auto& k : stored) save(*db, k, "v:" + k);

  EXPECT_EQ(db->metaBlobsWithPrefix(""), stored);  // byte order: NUL first, 0xFF last, case apart
  EXPECT_EQ(db->loadMetaBlob(std::string("\0\0", 2)).view(), std::string("v:\0\0", 4));
  EXPECT_EQ(db->metaBlobsWithPrefix("ab"), (Keys{"ab", "abc", "abd"}));
  EXPECT_EQ(db->metaBlobsWithPrefix("%"), (Keys{"%", "%x"}));  // no LIKE wildcards
  EXPECT_EQ(db->metaBlobsWithPrefix("_"), (Keys{"_", "_y"}));
  EXPECT_EQ(db->metaBlobsWithPrefix(std::string("\0", 1)), (Keys{std::string("\0", 1), std::string("\0\0", 2)}));
  EXPECT_EQ(db->metaBlobsWithPrefix("a\xff"), (Keys{"a\xff", "a\xff\x01", "a\xff\xff"}));
  EXPECT_EQ(db->metaBlobsWithPrefix("\xff"), (Keys{"\xff", "\xff\xff"}));
  EXPECT_EQ(db->metaBlobsWithPrefix("aa"), Keys{});  // keys sort after it, none begins with it
  EXPECT_EQ(db->metaBlobsWithPrefix("\xff\xff\xff"), Keys{});
}

TEST_F(MetaBlobs, TheEngineRefusesKeysAndValuesBeyondTheLimitsAndKeepsTheOldValue) {
  auto db = open("m");
  save(*db, std::string(255, 'k'), "fits");
  try {
    save(*db, std::string(256, 'k'), "too long a key");
    ADD_FAILURE() << "a 256-byte key was stored";
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), DB::err::kInvalidParameter);
  }
  save(*db, "huge", "old");
  try {
    // Beyond SQLite's length limit: refused before a byte is read.
    db->saveMetaBlob("", std::uint64_t{2} << 30, "huge");
    ADD_FAILURE() << "a value beyond the length limit was accepted";
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), DB::err::kColumnTooBig);
  }
  EXPECT_EQ(db->loadMetaBlob("huge").view(), "old");
  EXPECT_EQ(db->metaBlobsWithPrefix("k"), Keys{std::string(255, 'k')});
}

}  // namespace
