// DB::DBExc texts and the translation of real SQLite conflicts into the
// engine's codes.

#include <gtest/gtest.h>

#include <chrono>

#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/session.h"
#include "engine/transaction.h"
#include "engine_fixture.h"

namespace {

using engine_testing::EngineTest;
namespace err = DB::err;

TEST(DBExc, TextFromCodeNamesTheCallSite) {
  const DB::DBExc e(-1102, "store.cpp", 25);
  EXPECT_EQ(e.code(), -1102);
  EXPECT_STREQ(e.what(), "DB Engine error -1102, file \"store.cpp\", line 25");

  const DB::DBExc copy = e;
  EXPECT_EQ(copy.code(), -1102);
  EXPECT_STREQ(copy.what(), e.what());
}

TEST(DBExc, TextIsKeptWithTheTextCode) {
  EXPECT_EQ(DB::DBExc("Operation timeout!").code(), -99998);
  EXPECT_STREQ(DB::DBExc(std::string("Operation timeout!")).what(), "Operation timeout!");
}

TEST(DBExc, ThrownFromASourceLocationCarriesTheBaseNameAndLine) {
  const auto line = std::source_location::current().line() + 2;
  try {
    DB::throwEngineError(err::kInvalidParameter);
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), err::kInvalidParameter);
    EXPECT_EQ(std::string(e.what()), "DB Engine error -1003, file \"errors_test.cpp\", line " + std::to_string(line));
    return;
  }
  FAIL() << "nothing thrown";
}

class Conflicts : public EngineTest {};

int codeOf(const std::function<void()>& action) {
  try {
    action();
  } catch (const DB::DBExc& e) {
    return e.code();
  }
  return 0;
}

// A write on a snapshot older than the last commit fails at once: SQLite's
// BUSY_SNAPSHOT, a write conflict that runInTransaction retries.
TEST_F(Conflicts, StaleSnapshotWriteIsAWriteConflict) {
  auto instance = makeInstance("stale");
  auto writer = makeDatabase(instance);
  auto reader = instance->beginSession();
  reader->openDatabase();

  reader->execute("BEGIN");
  EXPECT_EQ(counter(*reader), 0);
  DB::runInTransaction(*writer, [&] { writer->prepare("UPDATE counter SET value = 1").run(); });

  EXPECT_EQ(codeOf([&] { reader->prepare("UPDATE counter SET value = 2").run(); }), err::kWriteConflict);
  EXPECT_TRUE(DB::Transaction::isRetryableCode(err::kWriteConflict));
  reader->execute("ROLLBACK");
  EXPECT_EQ(counter(*reader), 1);
}

// A connection that already reads and then wants to write while another
// holds the write lock gets BUSY at once (no busy wait could help it).
TEST_F(Conflicts, WriteWhileAnotherHoldsTheLockIsAWriteConflict) {
  auto instance = makeInstance("busy");
  auto holder = makeDatabase(instance);
  auto other = instance->beginSession();
  other->openDatabase();

  other->execute("BEGIN");
  EXPECT_EQ(counter(*other), 0);
  holder->execute("BEGIN IMMEDIATE");
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(codeOf([&] { other->prepare("UPDATE counter SET value = 2").run(); }), err::kWriteConflict);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
  other->execute("ROLLBACK");
  holder->execute("ROLLBACK");
}

// A writer that waits longer than the busy timeout for the write lock gets
// a write conflict, and the lock holder is not disturbed.
TEST_F(Conflicts, WaitForTheWriteLockBeyondTheTimeoutIsAWriteConflict) {
  engine::InstanceSettings settings;
  settings.key = "timeout";
  settings.instanceFolder = root() + "timeout/";
  settings.logFolder = root() + "timeout/";
  settings.databaseFileName = "cvdb.edb";
  settings.busyTimeout = std::chrono::milliseconds(200);
  auto instance = engine::Instance::create(settings);
  instance->init();
  auto holder = makeDatabase(instance);
  auto waiter = instance->beginSession();
  waiter->openDatabase();

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
  insert([](engine::Statement& s) { s.bindBlob(1, std::string_view("k")); });
  EXPECT_EQ(codeOf([&] { insert([](engine::Statement& s) { s.bindBlob(1, std::string_view("k")); }); }),
            err::kKeyDuplicate);
  EXPECT_EQ(codeOf([&] { insert([](engine::Statement& s) { s.bindNull(1); }); }), err::kNullInvalid);
  // A text key in a BLOB column of a STRICT table is refused rather than
  // stored as a second, different key.
  EXPECT_EQ(codeOf([&] { insert([](engine::Statement& s) { s.bindText(1, "k"); }); }), err::kInvalidParameter);
  EXPECT_EQ(codeOf([&] { session->prepare("SELECT * FROM missing"); }), err::kInvalidParameter);
}

}  // namespace
