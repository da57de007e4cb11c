#pragma once
// engine::Statement: one use of a prepared SQL statement of a session.
//
//   auto s = session.prepare("SELECT blob FROM info WHERE id = ?");
//   s.bindBlob(1, key);
//   if (s.step()) use(s.columnBytes(0));
//
// Session::prepare hands out the session's cached statement for the SQL
// text; the handle resets it and clears its bindings when it goes, so no
// statement keeps a read snapshot open after its use. A second handle on the
// same SQL text while the first lives gets a statement of its own.
//
// Ownership: a handle belongs to the scope that prepared it and must not
// outlive its session. Move-only.
// Thread safety: the thread that uses the session.
// Failures: DB::DBExc with the translated code and the caller's file and
// line (each member takes the call site as a defaulted argument).
// Bound texts and blobs are copied, so the caller's bytes may go at once.
// Keys are bound as blobs: the tables declare BLOB keys, and a text bound to
// them would be refused.

#include <sqlite3.h>

#include <cstddef>
#include <cstdint>
#include <source_location>
#include <span>
#include <string>
#include <string_view>

namespace engine {

class Statement {
 public:
  Statement(Statement&& other) noexcept;
  Statement& operator=(Statement&&) = delete;
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;
  ~Statement();

  // Parameters are numbered from 1.
  Statement& bindBlob(int index, std::string_view bytes,
                      const std::source_location& where = std::source_location::current());
  Statement& bindBlob(int index, std::span<const std::byte> bytes,
                      const std::source_location& where = std::source_location::current());
  Statement& bindText(int index, std::string_view text,
                      const std::source_location& where = std::source_location::current());
  Statement& bindInt64(int index, std::int64_t value,
                       const std::source_location& where = std::source_location::current());
  Statement& bindNull(int index, const std::source_location& where = std::source_location::current());
  // A blob of that many zero bytes, to be filled through BlobStream.
  Statement& bindZeroBlob(int index, std::int64_t size,
                          const std::source_location& where = std::source_location::current());

  // Runs to the next row: true when a row is there, false at the end.
  bool step(const std::source_location& where = std::source_location::current());
  // Runs to the end, ignoring rows (for INSERT, UPDATE, DELETE).
  void run(const std::source_location& where = std::source_location::current());
  // Back to the start with the same bindings.
  void reset() noexcept;

  // Columns of the current row, numbered from 0.
  bool columnIsNull(int column) const noexcept;
  std::int64_t columnInt64(int column) const noexcept;
  std::string columnText(int column) const;
  // The bytes of a blob or text column; valid until the next step or reset.
  std::string_view columnBytes(int column) const noexcept;
  std::int64_t columnSize(int column) const noexcept;

 private:
  friend class Session;
  // inUse: the cache slot to free again, or null for a statement that the
  // handle owns and finalises.
  Statement(sqlite3* db, sqlite3_stmt* stmt, bool* inUse) noexcept;
  void check(int rc, const std::source_location& where) const;

  sqlite3* db_;
  sqlite3_stmt* stmt_;
  bool* inUse_;
};

}  // namespace engine
