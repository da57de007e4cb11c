#include "store/schema.h"

#include <algorithm>
#include <cctype>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string_view>
#include <vector>

#include "store/db_local.h"

namespace DB::schema {
namespace {

struct StatementFinalizer {
  void operator()(sqlite3_stmt* s) const noexcept { sqlite3_finalize(s); }
};

using Rows = std::vector<std::vector<std::string>>;

// Every row of a query whose parameters are bound as text, each column as
// lower-case text; nullopt when the query fails.
std::optional<Rows> rowsOf(sqlite3* db, const char* sql, std::initializer_list<std::string_view> params) {
  sqlite3_stmt* raw = nullptr;
  if (sqlite3_prepare_v2(db, sql, -1, &raw, nullptr) != SQLITE_OK) return std::nullopt;
  const std::unique_ptr<sqlite3_stmt, StatementFinalizer> statement(raw);
  int index = 0;
  for (const auto param : params) {
    sqlite3_bind_text(raw, ++index, param.data(), static_cast<int>(param.size()), SQLITE_TRANSIENT);
  }
  Rows rows;
  int rc = SQLITE_OK;
  while ((rc = sqlite3_step(raw)) == SQLITE_ROW) {
    auto& row = rows.emplace_back();
    for (int c = 0; c < sqlite3_column_count(raw); ++c) {
      const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(raw, c));
      std::string value = text != nullptr ? text : "";
      std::transform(value.begin(), value.end(), value.begin(),
                     [](unsigned char ch) { return static_cast<char>(std::tolower(ch)); });
      row.push_back(std::move(value));
    }
  }
  if (rc != SQLITE_DONE) return std::nullopt;
  return rows;
}

}  // namespace

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

std::string whatIsMissing(sqlite3* db) {
  struct Table {
    const char* name;
    std::vector<std::string> columns;
  };
  const Table tables[] = {{kInfoTable, {"id", "folder", "status", kBlobColumn}}, {kMetaTable, {"id", kBlobColumn}}};
  std::vector<std::string> missing;
  const auto unreadable = [db] { return std::string("the schema cannot be read (") + sqlite3_errmsg(db) + ")"; };

  for (const auto& table : tables) {
    // wr: 1 for a table without rowid.
    const auto found = rowsOf(db,
                              "SELECT wr FROM pragma_table_list"
                              " WHERE schema = 'main' AND type = 'table' AND name = ?1 COLLATE NOCASE",
                              {table.name});
    if (!found) return unreadable();
    if (found->empty()) {
      missing.push_back("table \"" + std::string(table.name) + "\"");
      continue;
    }
    // Long values are streamed through blob I/O, which needs rowids.
    if (table.name == std::string_view(kMetaTable) && found->front().front() != "0") {
      missing.push_back("rowids of table \"" + std::string(table.name) + "\"");
    }
    const auto columns = rowsOf(db, "SELECT name FROM pragma_table_info(?1)", {table.name});
    if (!columns) return unreadable();
    for (const auto& column : table.columns) {
      if (std::find(columns->begin(), columns->end(), std::vector<std::string>{column}) == columns->end()) {
        missing.push_back("column \"" + std::string(table.name) + "." + column + "\"");
      }
    }
  }

  // A unique index would refuse a second pack of a folder and status; a
  // partial one would not serve every listing.
  const auto index = rowsOf(db,
                            "SELECT \"unique\", partial FROM pragma_index_list(?1)"
                            " WHERE name = 'fldStaIdx' COLLATE NOCASE",
                            {kInfoTable});
  const auto keys = rowsOf(db, "SELECT name FROM pragma_index_info('fldStaIdx') ORDER BY seqno", {});
  if (!index || !keys) return unreadable();
  if (*index != Rows{{"0", "0"}} || *keys != Rows{{"folder"}, {"status"}}) {
    missing.push_back("index \"fldStaIdx\" on info(folder, status)");
  }

  std::string text;
  for (const auto& item : missing) text += (text.empty() ? "" : ", ") + item;
  return text;
}

}  // namespace DB::schema
