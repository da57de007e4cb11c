// Opening, creating and closing a database: the schema as the engine
// enforces it, sessions given back, and failures that must never cost an
// existing database or leave a half-made one behind.

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <stdexcept>

#include "engine/db_exc.h"
#include "engine/db_instances.h"
#include "engine/engine_errors.h"
#include "store/pack_sql.h"
#include "store/schema.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

namespace fs = std::filesystem;
using store_testing::entries;
using store_testing::StoreTest;
using testing_support::LogCapture;
using testing_support::RawDb;

std::uint64_t sessionsOf(const DB::DBInstances& pool, const std::string& key) {
  const auto rec = pool.record(key);
  return rec ? rec->sessions : 0;
}

void expectCode(const std::function<void()>& op, std::int32_t code, const std::string& inText = "") {
  try {
    op();
    ADD_FAILURE() << "no failure, expected " << code;
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), code) << e.what();
    EXPECT_NE(std::string(e.what()).find(inText), std::string::npos) << e.what();
  }
}

using Lifecycle = StoreTest;

TEST_F(Lifecycle, ANewDatabaseGetsItsFileAndTablesWhoseLimitsTheEngineEnforces) {
  LogCapture log;
  auto db = open("Plant\\Line 2");
  EXPECT_EQ(db->dbFile(), root() + "plant/line 2/cvdb.edb");
  EXPECT_TRUE(log.contains(Log::Notice, "New database created in \"plant\\line 2\""));

  RawDb raw(db->dbFile());
  const auto hex = [](std::size_t bytes) { return "x'" + std::string(2 * bytes, '6') + "'"; };
  EXPECT_EQ(raw.exec("INSERT INTO info VALUES(" + hex(50) + ", x'66', -2147483648, zeroblob(10485760))"), SQLITE_OK);
  for (const std::string& refused :
       {"INSERT INTO info VALUES(" + hex(51) + ", x'66', 1, NULL)",
        "INSERT INTO info VALUES(x'01', " + hex(51) + ", 1, NULL)",
        std::string("INSERT INTO info VALUES(x'02', x'66', 2147483648, NULL)"),
        std::string("INSERT INTO info VALUES(x'03', x'66', 0, zeroblob(10485761))"),
        std::string("INSERT INTO info VALUES('text', x'66', 0, NULL)"),
        std::string("INSERT INTO meta VALUES('text', x'00')"), std::string("INSERT INTO meta VALUES(NULL, x'00')"),
        "INSERT INTO meta VALUES(" + hex(256) + ", x'00')"}) {
    EXPECT_EQ(raw.exec(refused), SQLITE_CONSTRAINT) << refused;
  }
  // Lookups and listings search a key and never sort, even once statistics
  // are there; the folder index gives the pack listings their (folder,
  // status, id) order.
  raw.exec("ANALYZE");
  for (const std::string& sql :
       {std::string(DB::schema::sql::kMetaKeysInRange), std::string(DB::schema::sql::kMetaKeysFrom),
        DB::schema::sql::selectMetaValue(), std::string(DB::pack_sql::kInfosOfFolder),
        std::string(DB::pack_sql::kAllInfos), std::string(DB::pack_sql::kSelectInfo)}) {
    const auto plan = raw.plan(sql);
    EXPECT_TRUE(plan.starts_with("SEARCH") || plan.starts_with("SCAN info USING INDEX fldStaIdx")) << plan;
    EXPECT_EQ(plan.find("TEMP B-TREE"), std::string::npos) << plan;
  }
  EXPECT_TRUE(raw.plan(DB::pack_sql::kInfosOfFolder).starts_with("SEARCH info USING INDEX fldStaIdx (folder=?)"));
  EXPECT_TRUE(raw.plan(DB::pack_sql::kSelectInfo).starts_with("SEARCH info USING PRIMARY KEY (id=?)"));
}

TEST_F(Lifecycle, SessionsAreTakenOnlyForExistingOrCreatedDatabasesAndGivenBackOnce) {
  DB::DBLocal missing(pool(), "nowhere");
  EXPECT_FALSE(missing.exists(true));
  EXPECT_FALSE(missing.isOpen());
  EXPECT_FALSE(fs::exists(root()));

  LogCapture log;
  auto first = open("shared");
  auto second = open("shared");
  EXPECT_EQ(log.count("New database created"), 1u);
  EXPECT_EQ(sessionsOf(*pool(), "shared"), 2u);
  EXPECT_TRUE(second->exists(true));  // gives its old session back first
  EXPECT_EQ(sessionsOf(*pool(), "shared"), 2u);
  EXPECT_TRUE(first->disconnect());
  EXPECT_FALSE(first->disconnect());
  second.reset();
  EXPECT_EQ(sessionsOf(*pool(), "shared"), 0u);
  EXPECT_EQ(log.count(Log::Error, "unknown instance"), 0u);
}

TEST_F(Lifecycle, AnExistingButInaccessibleDatabaseIsReportedAndLeftAlone) {
  open("kept")->saveMetaBlob("v", 1, "k");
  ASSERT_TRUE(pool()->closeIfDormant("kept"));
  env_.failNth(testing_support::FaultEnv::Op::Access, 1, EACCES);
  DB::DBLocal db(pool(), "kept");
  expectCode([&] { db.exists(false); }, DB::err::kFileAccessDenied, root() + "kept/cvdb.edb");
  EXPECT_FALSE(pool()->record("kept"));
  EXPECT_TRUE(db.exists(true));  // the next look succeeds: nothing was lost
  EXPECT_EQ(db.loadMetaBlob("k").view(), "v");
}

TEST_F(Lifecycle, ADatabaseThatAppearsBeforeItsCreationIsNeverOverwritten) {
  open("raced")->saveMetaBlob("v", 1, "k");
  ASSERT_TRUE(pool()->closeIfDormant("raced"));
  // Both looks miss the file, as when another process made it just then.
  env_.failNth(testing_support::FaultEnv::Op::Access, 1, ENOENT);
  env_.failNth(testing_support::FaultEnv::Op::Access, 2, ENOENT);
  DB::DBLocal db(pool(), "raced");
  expectCode([&] { db.exists(false); }, DB::err::kDatabaseDuplicate);
  EXPECT_TRUE(db.exists(true));
  EXPECT_EQ(db.loadMetaBlob("k").view(), "v");
}

TEST_F(Lifecycle, AFailedCreationRemovesWhatItMadeAndNothingElse) {
  LogCapture log;
  // The database file cannot be put in place.
  env_.failOnPath(testing_support::FaultEnv::Op::Link, ".creating");
  DB::DBLocal fresh(pool(), "Deep\\Er");
  EXPECT_THROW(fresh.exists(false), std::runtime_error);
  EXPECT_TRUE(log.contains(Log::Error, "Failed to create new database in \"deep\\er\""));
  EXPECT_FALSE(fs::exists(root() + "deep"));
  EXPECT_FALSE(fs::exists(logRoot() + "deep"));
  EXPECT_FALSE(pool()->record("deep\\er"));

  // A folder that was there before keeps what it held.
  DB::DBLocal closed(pool(), "busy");
  closed.saveDataBlob("x", 1, "doc", "page");
  EXPECT_THROW(closed.exists(false), std::runtime_error);
  EXPECT_EQ(entries(root() + "busy"), std::vector<std::string>{"d"});
  env_.clearFailures();
  EXPECT_TRUE(closed.exists(false));
  EXPECT_EQ(closed.loadDataBlob("doc", "page").view(), "x");
}

TEST_F(Lifecycle, ADatabaseCutOffBeforeItsTablesGetsThemAndOneMissingATableIsRefused) {
  open("cut");
  open("half");
  ASSERT_TRUE(pool()->closeIfDormant("cut") && pool()->closeIfDormant("half"));
  RawDb(root() + "cut/cvdb.edb").exec("DROP TABLE info; DROP TABLE meta;");
  RawDb(root() + "half/cvdb.edb").exec("DROP TABLE info;");
  open("cut")->saveMetaBlob("v", 1, "k");
  DB::DBLocal half(pool(), "half");
  expectCode([&] { half.exists(true); }, DB::err::kInvalidDatabase, "\"info\"");
}

}  // namespace
