// DB::DBExc texts and the translation of real SQLite conflicts into the
// engine's codes.

#include <gtest/gtest.h>

#include <chrono>

#include "engine_fixture.h"

namespace {

using namespace engine_testing;

// The texts travel into the log and to clients as they are.
TEST(DBExc, TextsNameTheCallSiteOrKeepTheGivenText) {
  const DB::DBExc copy = DB::DBExc(-1102, "store.cpp", 25);
  EXPECT_EQ(copy.code(), -1102);
  EXPECT_STREQ(copy.what(), "DB Engine error -1102, file \"store.cpp\", line 25");
  EXPECT_STREQ(DB::DBExc(-1808, "meta_blobs.cpp", 68).what(),
               "DB Engine error -1808 (disk full), file \"meta_blobs.cpp\", line 68");
  EXPECT_EQ(DB::DBExc("Operation timeout!").code(), DB::DBExc::kTextCode);
  EXPECT_STREQ(DB::DBExc(std::string("Operation timeout!")).what(), "Operation timeout!");

  const auto line = std::source_location::current().line() + 1;
  EXPECT_EQ(failureOf([] { DB::throwEngineError(err::kInvalidParameter); }),
            "DB Engine error -1003, file \"errors_test.cpp\", line " + std::to_string(line));
}

using Conflicts = EngineTest;

// A write on a snapshot older than the last commit fails at once: SQLite's
// BUSY_SNAPSHOT, a write conflict that runInTransaction retries.
TEST_F(Conflicts, StaleSnapshotWriteIsAWriteConflict) {
  auto instance = makeInstance("stale");
  auto writer = makeDatabase(instance);
  auto reader = openSession(instance);
  reader->execute("BEGIN");
  EXPECT_EQ(counter(*reader), 0);
  DB::runInTransaction(*writer, [&] { writer->prepare("UPDATE counter SET value = 1").run(); });

  EXPECT_EQ(codeOf([&] { reader->prepare("UPDATE counter SET value = 2").run(); }), err::kWriteConflict);
  EXPECT_TRUE(DB::Transaction::isRetryableCode(err::kWriteConflict));
  reader->execute("ROLLBACK");
  EXPECT_EQ(counter(*reader), 1);
}

// A writer that waits longer than the busy timeout for the write lock gets
// a write conflict, and the lock holder is not disturbed.
TEST_F(Conflicts, WaitForTheWriteLockBeyondTheTimeoutIsAWriteConflict) {
  engine::InstanceSettings settings = settingsFor("timeout");
  settings.busyTimeout = std::chrono::milliseconds(200);
  auto instance = makeInstance(settings);
  auto holder = makeDatabase(instance);
  auto waiter = openSession(instance);

  DB::Transaction held(*holder);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(codeOf([&] { waiter->beginWrite(); }), err::kWriteConflict);
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(200));
  EXPECT_FALSE(waiter->inTransaction());
  holder->prepare("UPDATE counter SET value = 5").run();
  held.commit();
  EXPECT_EQ(counter(*waiter), 5);
}

TEST_F(Conflicts, ConstraintsMapToTheEngineCodes) {
  auto instance = makeInstance("constraints");
  auto session = makeDatabase(instance);
  auto insert = [&](auto bindKey) {
    auto s = session->prepare("INSERT INTO blobs(id, blob) VALUES(?, x'00')");
    bindKey(s);
    s.run();
  };
  const auto blobKey = [](engine::Statement& s) { s.bindBlob(1, std::string_view("k")); };
  insert(blobKey);
  EXPECT_EQ(codeOf([&] { insert(blobKey); }), err::kKeyDuplicate);
  EXPECT_EQ(codeOf([&] { insert([](engine::Statement& s) { s.bindNull(1); }); }), err::kNullInvalid);
  // A text key in a BLOB column of a STRICT table is refused rather than
  // stored as a second, different key.
  EXPECT_EQ(codeOf([&] { insert([](engine::Statement& s) { s.bindText(1, "k"); }); }), err::kInvalidParameter);
  EXPECT_EQ(codeOf([&] { session->prepare("SELECT * FROM missing"); }), err::kInvalidParameter);
}

}  // namespace
