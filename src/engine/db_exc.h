#pragma once
// DB::DBExc: the one exception type of engine failures and of the store's
// own refusals. It carries an engine error code (engine_errors.h), or
// kTextCode when it was made from a text, and a readable message.
//
// Thrown by value, caught by reference; copying keeps text and code.

#include <cstdint>
#include <source_location>
#include <stdexcept>
#include <string>

namespace DB {

class DBExc : public std::runtime_error {
 public:
  // The code of an exception made from a text.
  static constexpr std::int32_t kTextCode = -99998;

  // "DB Engine error <code>, file \"<file>\", line <line>": the call site
  // of the engine call that failed.
  DBExc(std::int32_t code, const std::string& file, std::uint32_t line);
  // The same from a source location; the file is given by its base name.
  DBExc(std::int32_t code, const std::source_location& where);
  // The text unchanged, with the code (a failure that its thrower can
  // explain better than a call site does).
  DBExc(std::int32_t code, const std::string& text);
  // The text unchanged, code kTextCode.
  explicit DBExc(const std::string& text);
  explicit DBExc(const char* text);

  std::int32_t code() const noexcept { return code_; }

 private:
  std::int32_t code_;
};

// Throws DBExc with the code and the caller's file and line.
[[noreturn]] void throwEngineError(std::int32_t code,
                                   const std::source_location& where = std::source_location::current());

}  // namespace DB
