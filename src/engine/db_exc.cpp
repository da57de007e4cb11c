#include "engine/db_exc.h"

#include <string_view>

#include "engine/engine_errors.h"

namespace DB {
namespace {

std::string engineText(std::int32_t code, const std::string& file, std::uint32_t line) {
  // The one code an operator must act on at once is named in words.
  const char* const what = code == err::kDiskFull ? " (disk full)" : "";
  return "DB Engine error " + std::to_string(code) + what + ", file \"" + file + "\", line " + std::to_string(line);
}

// Build paths are long and differ between machines; the base name is enough
// to find the call site.
std::string baseName(std::string_view path) {
  const auto slash = path.find_last_of('/');
  return std::string(slash == std::string_view::npos ? path : path.substr(slash + 1));
}

}  // namespace

DBExc::DBExc(std::int32_t code, const std::string& file, std::uint32_t line)
    : std::runtime_error(engineText(code, file, line)), code_(code) {}

DBExc::DBExc(std::int32_t code, const std::source_location& where)
    : DBExc(code, baseName(where.file_name()), where.line()) {}

DBExc::DBExc(std::int32_t code, const std::string& text) : std::runtime_error(text), code_(code) {}

DBExc::DBExc(const std::string& text) : std::runtime_error(text), code_(kTextCode) {}

DBExc::DBExc(const char* text) : std::runtime_error(text), code_(kTextCode) {}

void throwEngineError(std::int32_t code, const std::source_location& where) { throw DBExc(code, where); }

}  // namespace DB
