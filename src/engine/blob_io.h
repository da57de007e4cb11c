#pragma once
// Reading and writing long values piece by piece, so that memory stays flat
// whatever their size (binding a 1 GB value would cost SQLite a copy of it).
//
// Incremental blob I/O works on tables with a rowid only, so tables that
// hold long values are rowid tables. To write a value of n bytes: insert or
// update the row with a zero blob of n bytes (Statement::bindZeroBlob), find
// its rowid, then write the bytes through writeBlob or a BlobStream, all in
// the same write transaction. A value cannot be longer than SQLite's length
// limit (1,000,000,000 bytes with Debian's build; kColumnTooBig otherwise).
//
// Table and column names are code constants of the store; they are checked
// to be plain identifiers and are never client input.
//
// Thread safety: the thread that uses the session.
// Failures: DB::DBExc with the translated code and the caller's site; a row
// that does not exist is kRecordNotFound.

#include <sqlite3.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <source_location>
#include <span>
#include <string>
#include <string_view>

namespace engine {

class Session;

// Bytes moved per call of SQLite's blob functions.
inline constexpr std::size_t kBlobChunkBytes = 4 * 1024 * 1024;

// An open long value of one row. Its size is fixed: writing changes bytes,
// never the length.
class BlobStream {
 public:
  BlobStream(Session& session, std::string_view table, std::string_view column, std::int64_t rowid, bool writable,
             const std::source_location& where = std::source_location::current());
  ~BlobStream();
  BlobStream(const BlobStream&) = delete;
  BlobStream& operator=(const BlobStream&) = delete;

  std::int64_t size() const noexcept;
  // Reads out.size() bytes from offset; the range must lie inside the value
  // (kInvalidParameter otherwise).
  void read(std::int64_t offset, std::span<std::byte> out,
            const std::source_location& where = std::source_location::current());
  void write(std::int64_t offset, std::span<const std::byte> in,
             const std::source_location& where = std::source_location::current());

 private:
  sqlite3* db_;
  sqlite3_blob* blob_ = nullptr;
};

// The rowid of the row whose keyColumn equals key (bound as a blob).
std::optional<std::int64_t> findRowid(Session& session, std::string_view table, std::string_view keyColumn,
                                      std::string_view key,
                                      const std::source_location& where = std::source_location::current());

// Writes data over the whole value (its length must equal data.size()), in
// chunks of kBlobChunkBytes.
void writeBlob(Session& session, std::string_view table, std::string_view column, std::int64_t rowid,
               std::span<const std::byte> data, const std::source_location& where = std::source_location::current());

// Reads the whole value into out (out.size() must equal its length), in
// chunks of kBlobChunkBytes.
void readBlob(Session& session, std::string_view table, std::string_view column, std::int64_t rowid,
              std::span<std::byte> out, const std::source_location& where = std::source_location::current());

// The length of the value.
std::int64_t blobSize(Session& session, std::string_view table, std::string_view column, std::int64_t rowid,
                      const std::source_location& where = std::source_location::current());

}  // namespace engine
