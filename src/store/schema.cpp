#include "store/schema.h"

#include "store/db_local.h"

namespace DB::schema {

const std::string& sql::selectMetaValue() {
  // One statement gives the row's rowid and length and, for a short
  // value, the value itself: the common read costs one lookup. A long
  // value is left out here and streamed.
  static const std::string text =
      "SELECT rowid, length(blob), CASE WHEN length(blob) <= " + std::to_string(DBLocal::kInlineValueBytes) +
      " THEN blob END FROM meta WHERE id = ?1";
  return text;
}

void create(engine::Session& session) {
  session.execute(
      "CREATE TABLE info("
      " id BLOB NOT NULL PRIMARY KEY CHECK(length(id) <= 50),"
      " folder BLOB NOT NULL CHECK(length(folder) <= 50),"
      " status INTEGER NOT NULL CHECK(status BETWEEN -2147483648 AND 2147483647),"
      " blob BLOB CHECK(length(blob) <= 10485760)"
      ") STRICT, WITHOUT ROWID;"
      "CREATE INDEX fldStaIdx ON info(folder, status);"
      "CREATE TABLE meta("
      " id BLOB NOT NULL PRIMARY KEY CHECK(length(id) <= 255),"
      " blob BLOB"
      ") STRICT;");
}

Present present(engine::Session& session) {
  Present p;
  auto s = session.prepare("SELECT name FROM sqlite_schema WHERE type = 'table' AND name IN ('info', 'meta')");
  while (s.step()) {
    const auto name = s.columnBytes(0);
    if (name == kInfoTable) p.info = true;
    if (name == kMetaTable) p.meta = true;
  }
  return p;
}

}  // namespace DB::schema
