#pragma once
// DB::StoreExc: a refusal of the store that carries an engine code and a
// text of its own, for failures where both matter: callers in the process
// decide on the code, people read the text. (A DB::DBExc made from a code
// names only the code and the call site; one made from a text has no code.)
//
// Catch it as DB::DBExc; copying keeps code and text and never throws.

#include <cstdint>
#include <source_location>
#include <stdexcept>
#include <string>

#include "engine/db_exc.h"

namespace DB {

class StoreExc final : public DBExc {
 public:
  StoreExc(std::int32_t code, const std::string& text,
           const std::source_location& where = std::source_location::current())
      : DBExc(code, where), text_(text) {}

  const char* what() const noexcept override { return text_.what(); }

 private:
  std::runtime_error text_;
};

}  // namespace DB
