// Opening, creating and closing a database: the schema as the engine
// enforces it, sessions given back, and failures that must never cost an
// existing database or leave a half-made one behind.

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <stdexcept>

#include "engine/db_exc.h"
#include "engine/db_instances.h"
#include "engine/engine_errors.h"
#include "store/schema.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

namespace fs = std::filesystem;
using store_testing::entries;
using store_testing::FailingFileOps;
using store_testing::StoreTest;
using testing_support::LogCapture;

// A second connection on a database file, outside the engine layer, to see
// what the store made.
class RawDb {
 public:
  explicit RawDb(const std::string& file) {
    if (sqlite3_open_v2(file.c_str(), &db_, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
      throw std::runtime_error("cannot open " + file);
    }
  }
  ~RawDb() { sqlite3_close(db_); }
  // The SQLite result of running sql.
  int run(const std::string& sql) { return sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr); }
  std::string plan(const std::string& sql) {
    sqlite3_stmt* s = nullptr;
    std::string out;
    if (sqlite3_prepare_v2(db_, ("EXPLAIN QUERY PLAN " + sql).c_str(), -1, &s, nullptr) != SQLITE_OK) return "?";
    while (sqlite3_step(s) == SQLITE_ROW) out += std::string(reinterpret_cast<const char*>(sqlite3_column_text(s, 3))) + ";";
    sqlite3_finalize(s);
    return out;
  }

 private:
  sqlite3* db_ = nullptr;
};

std::uint64_t sessionsOf(const std::string& key) {
  const auto rec = DB::DBInstances::inst()->record(key);
  return rec ? rec->sessions : 0;
}

using Lifecycle = StoreTest;

TEST_F(Lifecycle, ANewDatabaseGetsItsFolderFileAndTablesAndIsAnnounced) {
  LogCapture log;
  auto db = open("Plant\\Line 2");
  EXPECT_EQ(db->name(), "plant\\line 2");
  EXPECT_EQ(db->folder(), root() + "plant/line 2/");
  EXPECT_TRUE(fs::is_regular_file(db->dbFile()));
  EXPECT_TRUE(db->isOpen());
  EXPECT_TRUE(log.contains(Log::Notice, "New database created in \"plant\\line 2\""));

  // The limits live in the schema, so every writer, the pack code
  // included, meets them.
  RawDb raw(db->dbFile());
  EXPECT_EQ(raw.run("INSERT INTO info VALUES(x'" + std::string(100, '6') + "', x'66', 1, NULL)"), SQLITE_OK);
  EXPECT_EQ(raw.run("INSERT INTO info VALUES(x'" + std::string(102, '6') + "', x'66', 1, NULL)"), SQLITE_CONSTRAINT);
  EXPECT_EQ(raw.run("INSERT INTO info VALUES(x'67', x'" + std::string(102, '6') + "', 1, NULL)"), SQLITE_CONSTRAINT);
  EXPECT_EQ(raw.run("INSERT INTO info VALUES(x'68', x'66', 2147483648, NULL)"), SQLITE_CONSTRAINT);
  EXPECT_EQ(raw.run("INSERT INTO info VALUES(x'69', x'66', -2147483648, zeroblob(10485760))"), SQLITE_OK);
  EXPECT_EQ(raw.run("INSERT INTO info VALUES(x'6a', x'66', 0, zeroblob(10485761))"), SQLITE_CONSTRAINT);
  EXPECT_EQ(raw.run("INSERT INTO info VALUES('text', x'66', 0, NULL)"), SQLITE_CONSTRAINT);
  EXPECT_EQ(raw.run("INSERT INTO meta VALUES('text', x'00')"), SQLITE_CONSTRAINT);
  EXPECT_EQ(raw.run("INSERT INTO meta VALUES(NULL, x'00')"), SQLITE_CONSTRAINT);
  EXPECT_EQ(raw.run("INSERT INTO meta VALUES(x'" + std::string(510, '6') + "', x'00')"), SQLITE_OK);
  EXPECT_EQ(raw.run("INSERT INTO meta VALUES(x'" + std::string(512, '6') + "', x'00')"), SQLITE_CONSTRAINT);

  // Listings and lookups search the primary key; the folder index serves
  // the pack listings in (folder, status, id) order without sorting.
  for (const std::string& sql : {std::string(DB::schema::sql::kMetaKeysInRange),
                                std::string(DB::schema::sql::kMetaKeysFrom), DB::schema::sql::selectMetaValue()}) {
    const auto plan = raw.plan(sql);
    EXPECT_NE(plan.find("SEARCH meta USING"), std::string::npos) << sql << ": " << plan;
    EXPECT_EQ(plan.find("SCAN"), std::string::npos) << sql << ": " << plan;
    EXPECT_EQ(plan.find("TEMP B-TREE"), std::string::npos) << sql << ": " << plan;
  }
  const auto byFolder = raw.plan("SELECT id FROM info WHERE folder = x'66' ORDER BY status, id");
  EXPECT_NE(byFolder.find("SEARCH info USING COVERING INDEX fldStaIdx"), std::string::npos) << byFolder;
  EXPECT_EQ(byFolder.find("TEMP B-TREE"), std::string::npos) << byFolder;
}

TEST_F(Lifecycle, AMissingDatabaseThatMustExistIsNeitherCreatedNorOpened) {
  DB::DBLocal db("nowhere");
  EXPECT_FALSE(db.exists(true));
  EXPECT_FALSE(db.isOpen());
  EXPECT_FALSE(fs::exists(root()));
  EXPECT_FALSE(DB::DBInstances::inst()->record("nowhere"));
  EXPECT_THROW(db.loadMetaBlob("k"), DB::DBExc);
}

TEST_F(Lifecycle, SessionsAreOwnedPerStoreAndGivenBackOnce) {
  LogCapture log;
  auto first = open("shared");
  auto second = open("shared");
  EXPECT_EQ(log.count("New database created"), 1u);
  EXPECT_NE(first->sessionId(), second->sessionId());
  EXPECT_EQ(sessionsOf("shared"), 2u);

  // Reopening an open store gives its old session back first.
  EXPECT_TRUE(second->exists(true));
  EXPECT_EQ(sessionsOf("shared"), 2u);

  EXPECT_TRUE(first->disconnect());
  EXPECT_FALSE(first->disconnect());
  EXPECT_EQ(sessionsOf("shared"), 1u);
  second.reset();
  EXPECT_EQ(sessionsOf("shared"), 0u);
  EXPECT_EQ(log.count(Log::Error, "unknown instance"), 0u);

  // An instance that was closed meanwhile attaches the existing file again.
  EXPECT_TRUE(DB::DBInstances::inst()->closeIfDormant("shared"));
  DB::DBLocal again("shared");
  EXPECT_TRUE(again.exists(true));
  EXPECT_EQ(log.count("New database created"), 1u);
}

TEST_F(Lifecycle, AnExistingButInaccessibleDatabaseIsReportedAndLeftAlone) {
  {
    auto db = open("kept");
    db->saveMetaBlob("v", 1, "k");
  }
  DB::DBInstances::teardown();
  const auto before = fs::file_size(root() + "kept/cvdb.edb");

  FailingFileOps ops;
  ops.access_ = {.nth = 1, .error = EACCES};
  DB::FileOps::Replacement replaced(ops);
  DB::DBLocal db("kept");
  try {
    db.exists(false);
    FAIL() << "an inaccessible database was opened";
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), DB::err::kFileAccessDenied);
    EXPECT_NE(std::string(e.what()).find(root() + "kept/cvdb.edb"), std::string::npos) << e.what();
  }
  EXPECT_FALSE(db.isOpen());
  EXPECT_EQ(fs::file_size(root() + "kept/cvdb.edb"), before);
  EXPECT_FALSE(DB::DBInstances::inst()->record("kept"));

  EXPECT_TRUE(db.exists(true));  // the next look succeeds: nothing was lost
  EXPECT_EQ(db.loadMetaBlob("k").view(), "v");
}

TEST_F(Lifecycle, AFailedCreationRemovesWhatItMadeAndNothingElse) {
  LogCapture log;
  DB::DBLocal::setCreationHookForTesting([](engine::Session&) { throw std::runtime_error("tables failed"); });

  // Everything new: no folder, file or instance stays.
  DB::DBLocal fresh("Deep\\Er");
  EXPECT_THROW(fresh.exists(false), std::runtime_error);
  EXPECT_TRUE(log.contains(Log::Error, "Failed to create new database in \"deep\\er\""));
  EXPECT_FALSE(fs::exists(root() + "deep"));
  EXPECT_FALSE(fs::exists(logRoot() + "deep"));
  EXPECT_FALSE(DB::DBInstances::inst()->record("deep\\er"));

  // A folder that was there before keeps what it held.
  DB::DBLocal closed("busy");
  closed.saveDataBlob("x", 1, "doc", "page");
  EXPECT_THROW(closed.exists(false), std::runtime_error);
  EXPECT_EQ(entries(root() + "busy"), std::vector<std::string>{"d"});
  EXPECT_EQ(closed.loadDataBlob("doc", "page").view(), "x");

  DB::DBLocal::setCreationHookForTesting({});
  EXPECT_TRUE(closed.exists(false));
  EXPECT_EQ(closed.loadDataBlob("doc", "page").view(), "x");
}

TEST_F(Lifecycle, ADatabaseThatAppearsBeforeItsCreationIsNeverOverwritten) {
  {
    auto db = open("raced");
    db->saveMetaBlob("v", 1, "k");
  }
  DB::DBInstances::teardown();
  // Both looks miss the file, as when another process made it just then:
  // the creation meets the file and must leave it be.
  struct BlindToTwoLooks : DB::FileOps {
    int looks = 0;
    int access(const char* path, int mode) override {
      if (++looks > 2) return DB::FileOps::access(path, mode);
      errno = ENOENT;
      return -1;
    }
  } blind;
  DB::FileOps::Replacement replaced(blind);
  DB::DBLocal db("raced");
  try {
    db.exists(false);
    FAIL() << "an existing database was created anew";
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), DB::err::kDatabaseDuplicate);
  }
  EXPECT_TRUE(db.exists(true));
  EXPECT_EQ(db.loadMetaBlob("k").view(), "v");
}

TEST_F(Lifecycle, ADatabaseCutOffBeforeItsTablesGetsThemAndOneMissingATableIsRefused) {
  {
    auto db = open("cut");
    auto half = open("half");
  }
  DB::DBInstances::teardown();
  RawDb(root() + "cut/cvdb.edb").run("DROP TABLE info; DROP TABLE meta;");
  RawDb(root() + "half/cvdb.edb").run("DROP TABLE info;");

  LogCapture log;
  auto cut = open("cut");
  cut->saveMetaBlob("v", 1, "k");
  EXPECT_TRUE(log.contains(Log::Notice, "Tables created in existing empty database \"cut\""));

  DB::DBLocal half("half");
  try {
    half.exists(true);
    FAIL() << "a database without its info table was opened";
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), DB::err::kInvalidDatabase);
    EXPECT_NE(std::string(e.what()).find("\"info\""), std::string::npos) << e.what();
  }
}

}  // namespace
