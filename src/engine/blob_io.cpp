#include "engine/blob_io.h"

#include <algorithm>
#include <cctype>
#include <cstring>

#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/session.h"
#include "engine/sqlite_errors.h"

namespace engine {
namespace {

bool isIdentifier(std::string_view name) {
  if (name.empty() || name.size() > 64) return false;
  if (!(std::isalpha(static_cast<unsigned char>(name[0])) || name[0] == '_')) return false;
  return std::all_of(name.begin(), name.end(),
                     [](char c) { return std::isalnum(static_cast<unsigned char>(c)) || c == '_'; });
}

void checkIdentifiers(std::string_view a, std::string_view b, const std::source_location& where) {
  if (!isIdentifier(a) || !isIdentifier(b)) DB::throwEngineError(DB::err::kInvalidParameter, where);
}

void checkRange(std::int64_t offset, std::size_t length, std::int64_t size, const std::source_location& where) {
  if (offset < 0 || offset > size || static_cast<std::uint64_t>(size - offset) < length) {
    DB::throwEngineError(DB::err::kInvalidParameter, where);
  }
}

}  // namespace

BlobStream::BlobStream(Session& session, std::string_view table, std::string_view column, std::int64_t rowid,
                       bool writable, const std::source_location& where)
    : db_(session.connection(where)) {
  checkIdentifiers(table, column, where);
  const std::string tableName(table);
  const std::string columnName(column);
  const int rc = sqlite3_blob_open(db_, "main", tableName.c_str(), columnName.c_str(), rowid, writable ? 1 : 0, &blob_);
  if (rc != SQLITE_OK) {
    blob_ = nullptr;  // SQLite may leave a value behind on failure
    // A row that vanished is a record that is not found; the table and the
    // column are the store's own constants, so other SQLITE_ERRORs are
    // faults of the caller.
    if ((rc & 0xff) == SQLITE_ERROR && std::strncmp(sqlite3_errmsg(db_), "no such rowid", 13) == 0) {
      DB::throwEngineError(DB::err::kRecordNotFound, where);
    }
    throwSqlite(db_, rc, where);
  }
}

BlobStream::~BlobStream() {
  if (blob_ != nullptr) sqlite3_blob_close(blob_);
}

std::int64_t BlobStream::size() const noexcept { return sqlite3_blob_bytes(blob_); }

void BlobStream::read(std::int64_t offset, std::span<std::byte> out, const std::source_location& where) {
  checkRange(offset, out.size(), size(), where);
  std::size_t done = 0;
  while (done < out.size()) {
    const auto n = std::min(out.size() - done, kBlobChunkBytes);
    const int rc = sqlite3_blob_read(blob_, out.data() + done, static_cast<int>(n), static_cast<int>(offset + done));
    if (rc != SQLITE_OK) throwSqlite(db_, rc, where);
    done += n;
  }
}

void BlobStream::write(std::int64_t offset, std::span<const std::byte> in, const std::source_location& where) {
  checkRange(offset, in.size(), size(), where);
  std::size_t done = 0;
  while (done < in.size()) {
    const auto n = std::min(in.size() - done, kBlobChunkBytes);
    const int rc = sqlite3_blob_write(blob_, in.data() + done, static_cast<int>(n), static_cast<int>(offset + done));
    if (rc != SQLITE_OK) throwSqlite(db_, rc, where);
    done += n;
  }
}

std::optional<std::int64_t> findRowid(Session& session, std::string_view table, std::string_view keyColumn,
                                      std::string_view key, const std::source_location& where) {
  checkIdentifiers(table, keyColumn, where);
  const std::string sql =
      "SELECT rowid FROM \"" + std::string(table) + "\" WHERE \"" + std::string(keyColumn) + "\" = ?";
  auto stmt = session.prepare(sql, where);
  stmt.bindBlob(1, key, where);
  if (!stmt.step(where)) return std::nullopt;
  return stmt.columnInt64(0);
}

void writeBlob(Session& session, std::string_view table, std::string_view column, std::int64_t rowid,
               std::span<const std::byte> data, const std::source_location& where) {
  BlobStream stream(session, table, column, rowid, true, where);
  if (stream.size() != static_cast<std::int64_t>(data.size())) DB::throwEngineError(DB::err::kInvalidParameter, where);
  stream.write(0, data, where);
}

void readBlob(Session& session, std::string_view table, std::string_view column, std::int64_t rowid,
              std::span<std::byte> out, const std::source_location& where) {
  BlobStream stream(session, table, column, rowid, false, where);
  if (stream.size() != static_cast<std::int64_t>(out.size())) DB::throwEngineError(DB::err::kInvalidParameter, where);
  stream.read(0, out, where);
}

std::int64_t blobSize(Session& session, std::string_view table, std::string_view column, std::int64_t rowid,
                      const std::source_location& where) {
  return BlobStream(session, table, column, rowid, false, where).size();
}

}  // namespace engine
