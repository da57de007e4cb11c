// Named values: whole replacement, long values streamed, keys compared as
// bytes, prefix listings that are exact for any byte, and writers of two
// sessions that lose nothing.

#include <gtest/gtest.h>

#include <random>
#include <thread>

#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

using store_testing::StoreTest;
using testing_support::LogCapture;
using testing_support::VerboseLog;
using Keys = std::vector<std::string>;

std::string randomBytes(std::size_t n, unsigned seed) {
  std::mt19937 gen(seed);
  std::string out(n, '\0');
  for (auto& c : out) c = static_cast<char>(gen());
  return out;
}

void save(DB::DBLocal& db, const std::string& key, const std::string& value) {
  db.saveMetaBlob(value.data(), value.size(), key);
}

using MetaBlobs = StoreTest;

TEST_F(MetaBlobs, ValuesAreReplacedWholeAndEmptyReadsLikeMissing) {
  VerboseLog verbose;
  LogCapture log;
  auto db = open("m");
  const auto s = std::to_string(db->sessionId());
  EXPECT_TRUE(db->loadMetaBlob("k").empty());
  save(*db, "k", "a longer value");
  EXPECT_TRUE(log.contains(Log::Debug, "DB:saveMetaBlob S:" + s + " Stored metadata for key k size: 14"));
  save(*db, "k", "short");
  EXPECT_EQ(db->loadMetaBlob("k").view(), "short");
  EXPECT_TRUE(log.contains(Log::Debug, "DB:loadMetaBlob S:" + s + " Returning metadata for key k size: 5"));

  save(*db, "k", "");
  log.clear();
  EXPECT_TRUE(db->loadMetaBlob("k").empty());
  EXPECT_TRUE(log.contains(Log::Debug, "DB:loadMetaBlob S:" + s + " No metadata for key k"));
  EXPECT_EQ(db->metaBlobsWithPrefix(""), Keys{"k"});  // the row is there

  EXPECT_TRUE(db->removeMetaBlob("k"));
  EXPECT_TRUE(log.contains(Log::Debug, "DB:removeMetaBlob S:" + s + " Deleted metadata for k"));
  EXPECT_FALSE(db->removeMetaBlob("k"));
  EXPECT_TRUE(log.contains(Log::Debug, "DB:removeMetaBlob S:" + s + " No metadata found for k"));
  EXPECT_TRUE(db->metaBlobsWithPrefix("").empty());
}

TEST_F(MetaBlobs, LongValuesRoundTripAcrossTheInlineLimit) {
  auto db = open("m");
  constexpr auto limit = static_cast<std::size_t>(DB::DBLocal::kInlineValueBytes);
  // Each size replaces the previous value of the same key, growing and
  // shrinking across the limit between bound and streamed values.
  for (const std::size_t size : {limit, limit + 1, std::size_t{9} << 20, std::size_t{3}, limit + 1, std::size_t{0}}) {
    const std::string value = randomBytes(size, static_cast<unsigned>(size));
    save(*db, "doc", value);
    const auto back = db->loadMetaBlob("doc");
    ASSERT_EQ(back.size(), size);
    EXPECT_TRUE(back.view() == value) << size;
  }
  // Another session reads what was committed.
  const std::string value = randomBytes(5 << 20, 7);
  save(*db, "doc", value);
  EXPECT_TRUE(open("m")->loadMetaBlob("doc").view() == value);
}

TEST_F(MetaBlobs, KeysAreBytesAndPrefixesMatchExactly) {
  auto db = open("m");
  const Keys stored = {std::string("\0", 1), std::string("\0\0", 2), "%", "%x", "A", "_", "_y", "a", "ab",
                       "abc", "abd", "a\xff", "a\xff\x01", "a\xff\xff", "b", "\xff", "\xff\xff"};
  for (const auto& k : stored) save(*db, k, "v:" + k);

  // Byte order, upper case before lower case, NUL first, 0xFF last.
  EXPECT_EQ(db->metaBlobsWithPrefix(""), stored);
  EXPECT_EQ(db->loadMetaBlob("A").view(), "v:A");
  EXPECT_EQ(db->loadMetaBlob(std::string("\0\0", 2)).view(), std::string("v:\0\0", 4));

  EXPECT_EQ(db->metaBlobsWithPrefix("ab"), (Keys{"ab", "abc", "abd"}));
  EXPECT_EQ(db->metaBlobsWithPrefix("%"), (Keys{"%", "%x"}));  // no LIKE wildcard
  EXPECT_EQ(db->metaBlobsWithPrefix("_"), (Keys{"_", "_y"}));
  EXPECT_EQ(db->metaBlobsWithPrefix(std::string("\0", 1)), (Keys{std::string("\0", 1), std::string("\0\0", 2)}));
  EXPECT_EQ(db->metaBlobsWithPrefix("a\xff"), (Keys{"a\xff", "a\xff\x01", "a\xff\xff"}));
  EXPECT_EQ(db->metaBlobsWithPrefix("\xff"), (Keys{"\xff", "\xff\xff"}));
  EXPECT_EQ(db->metaBlobsWithPrefix("\xff\xff\xff"), Keys{});
  EXPECT_EQ(db->metaBlobsWithPrefix("aa"), Keys{});  // keys sort after it, none begins with it
  EXPECT_EQ(db->metaBlobsWithPrefix("abcd"), Keys{});
  EXPECT_EQ(db->metaBlobsWithPrefix("").size(), stored.size());
}

TEST_F(MetaBlobs, TheEngineRefusesKeysAndValuesBeyondTheLimits) {
  auto db = open("m");
  save(*db, std::string(255, 'k'), "fits");
  try {
    save(*db, std::string(256, 'k'), "too long a key");
    FAIL() << "a 256-byte key was stored";
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), DB::err::kInvalidParameter);
  }
  EXPECT_EQ(db->metaBlobsWithPrefix("k"), Keys{std::string(255, 'k')});

  // Beyond SQLite's length limit: refused before a byte is read, and the
  // old value stays.
  save(*db, "huge", "old");
  try {
    db->saveMetaBlob("", std::uint64_t{2} << 30, "huge");
    FAIL() << "a value beyond the length limit was accepted";
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), DB::err::kColumnTooBig);
  }
  EXPECT_EQ(db->loadMetaBlob("huge").view(), "old");
  save(*db, "after", "still usable");
  EXPECT_EQ(db->loadMetaBlob("after").view(), "still usable");
}

TEST_F(MetaBlobs, WritersOfTwoSessionsLoseNothing) {
  auto first = open("m");
  auto second = open("m");
  constexpr int kRounds = 40;
  const auto writer = [](DB::DBLocal& db, const std::string& who) {
    for (int i = 0; i < kRounds; ++i) {
      save(db, "shared", who + std::to_string(i));
      save(db, who + std::to_string(i), std::string(i % 2 ? 70000 : 10, 'x'));
    }
  };
  std::thread a(writer, std::ref(*first), "a");
  std::thread b(writer, std::ref(*second), "b");
  a.join();
  b.join();
  EXPECT_EQ(first->metaBlobsWithPrefix("a").size(), static_cast<std::size_t>(kRounds));
  EXPECT_EQ(second->metaBlobsWithPrefix("b").size(), static_cast<std::size_t>(kRounds));
  const auto last = first->loadMetaBlob("shared");
  EXPECT_TRUE(last.view() == "a" + std::to_string(kRounds - 1) || last.view() == "b" + std::to_string(kRounds - 1))
      << last.view();
}

TEST_F(MetaBlobs, AClosedStoreRefusesTableOperations) {
  DB::DBLocal db("never");
  for (const auto& op : std::vector<std::function<void()>>{
           [&] { db.loadMetaBlob("k"); }, [&] { save(db, "k", "v"); }, [&] { db.removeMetaBlob("k"); },
           [&] { db.metaBlobsWithPrefix(""); }}) {
    try {
      op();
      FAIL() << "a closed store ran a table operation";
    } catch (const DB::DBExc& e) {
      EXPECT_EQ(e.code(), DB::err::kInvalidDatabaseId);
    }
  }
}

}  // namespace
