// What a restore asks of a database before placing it: the tables, columns
// and index the store uses, each one named when it is missing.

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "store/schema.h"
#include "store_fixture.h"

namespace {

using store_testing::StoreTest;
using testing_support::RawDb;

using Schema = StoreTest;

TEST_F(Schema, ADatabaseTheStoreMadeLacksNothing) {
  const std::string file = open("plant")->dbFile();
  EXPECT_EQ(DB::schema::whatIsMissing(RawDb(file).handle()), "");
}

TEST_F(Schema, EveryMissingOrUnfitTableColumnOrIndexIsNamed) {
  const std::string info = "CREATE TABLE info(id BLOB PRIMARY KEY, folder BLOB, status INTEGER, blob BLOB);";
  const std::string index = "CREATE INDEX fldStaIdx ON info(folder, status);";
  const std::string meta = "CREATE TABLE meta(id BLOB PRIMARY KEY, blob BLOB);";
  const std::string indexMissing = "index \"fldStaIdx\" on info(folder, status)";
  struct Case {
    const char* name;
    std::string schema;
    std::string missing;
  };
  const std::vector<Case> cases{
      {"another application's tables", "CREATE TABLE t(x);", "table \"info\", table \"meta\", " + indexMissing},
      {"names in another case",
       "CREATE TABLE INFO(ID BLOB PRIMARY KEY, Folder, STATUS, Blob);" +
           std::string("CREATE INDEX FLDSTAIDX ON INFO(FOLDER, STATUS);") + "CREATE TABLE Meta(Id, BLOB);",
       ""},
      {"info without status",
       "CREATE TABLE info(id BLOB PRIMARY KEY, folder BLOB, blob BLOB);" +
           std::string("CREATE INDEX fldStaIdx ON info(folder);") + meta,
       "column \"info.status\", " + indexMissing},
      {"info a view", "CREATE TABLE i(id, folder, status, blob); CREATE VIEW info AS SELECT * FROM i;" + meta,
       "table \"info\", " + indexMissing},
      {"meta without its value", info + index + "CREATE TABLE meta(id BLOB PRIMARY KEY, value BLOB);",
       "column \"meta.blob\""},
      {"meta without rowids", info + index + "CREATE TABLE meta(id BLOB PRIMARY KEY, blob BLOB) WITHOUT ROWID;",
       "rowids of table \"meta\""},
      {"no index", info + meta, indexMissing},
      {"index of the columns the other way round", info + meta + "CREATE INDEX fldStaIdx ON info(status, folder);",
       indexMissing},
      {"unique index", info + meta + "CREATE UNIQUE INDEX fldStaIdx ON info(folder, status);", indexMissing},
      {"partial index", info + meta + "CREATE INDEX fldStaIdx ON info(folder, status) WHERE status > 0;", indexMissing},
  };
  for (std::size_t i = 0; i < cases.size(); ++i) {
    SCOPED_TRACE(cases[i].name);
    RawDb db(dir_ / ("case" + std::to_string(i) + ".db"), true);
    ASSERT_EQ(db.exec(cases[i].schema), SQLITE_OK);
    EXPECT_EQ(DB::schema::whatIsMissing(db.handle()), cases[i].missing);
  }
}

}  // namespace
