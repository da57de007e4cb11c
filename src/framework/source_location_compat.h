#pragma once
// std::source_location for clang before 15 on libstdc++ 12, whose
// <source_location> is empty there (it needs __builtin_source_location,
// which those compilers lack). The build force-includes this header only for
// such a compiler (cmake/CvdbOptions.cmake); everywhere else the library's
// class is used and this header adds nothing. The members are the
// standard's, filled from the builtins that clang has had long.
//
// Ownership, threads: a value type.
// Failures: none.

#include <cstdint>
#include <source_location>

#if !defined(__cpp_lib_source_location)
namespace std {

struct source_location {
  // The default arguments are evaluated where current() is called, or
  // where the function whose default argument calls it is called.
  static constexpr source_location current(const char* file = __builtin_FILE(),
                                           const char* function = __builtin_FUNCTION(),
                                           uint_least32_t line = __builtin_LINE(),
                                           uint_least32_t column = __builtin_COLUMN()) noexcept {
    source_location where;
    where.file_ = file;
    where.function_ = function;
    where.line_ = line;
    where.column_ = column;
    return where;
  }

  constexpr source_location() noexcept = default;
  constexpr uint_least32_t line() const noexcept { return line_; }
  constexpr uint_least32_t column() const noexcept { return column_; }
  constexpr const char* file_name() const noexcept { return file_; }
  constexpr const char* function_name() const noexcept { return function_; }

 private:
  const char* file_ = "";
  const char* function_ = "";
  uint_least32_t line_ = 0;
  uint_least32_t column_ = 0;
};

}  // namespace std
#endif
