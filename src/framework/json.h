#pragma once
// JSON values over jansson.
//
// A json::Value holds one reference to a jansson value, or nothing at all
// (an "empty" value, which is not the JSON null). Copies share the value;
// the reference is released by the destructor. json::Object is a Value that
// always holds an object.
//
// Failures: type errors throw json::Exc with the text
//   "JSON error: Wrong type: <type>. Expected type: <expected>"
// where the type names are "object", "array", "string", "integer", "float",
// "boolean", "null", "unknown", and "empty" for no value. Parse errors throw
// json::Exc with jansson's message and position. Allocation failures throw
// std::bad_alloc.
// Thread safety: jansson's reference counts are atomic, so values may be
// shared between threads for reading; changing a value that another thread
// reads is not safe.

#include <cstdint>
#include <iosfwd>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

typedef struct json_t json_t;

namespace json {

class Exc : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

class Value {
 public:
  Value() noexcept = default;
  // Takes over the caller's reference (jansson's "new reference").
  static Value steal(json_t* v) noexcept;
  // Adds a reference of its own (jansson's "borrowed reference").
  static Value borrow(json_t* v) noexcept;

  static Value string(std::string_view text);
  static Value integer(std::int64_t n);
  static Value real(double d);
  static Value boolean(bool b);
  static Value null();

  Value(const Value& other) noexcept;
  Value(Value&& other) noexcept;
  Value& operator=(const Value& other) noexcept;
  Value& operator=(Value&& other) noexcept;
  ~Value();

  bool empty() const noexcept { return v_ == nullptr; }
  json_t* get() const noexcept { return v_; }

  const char* typeName() const noexcept;
  bool isObject() const noexcept;
  bool isArray() const noexcept;
  bool isString() const noexcept;
  bool isInteger() const noexcept;
  bool isTrue() const noexcept;  // exactly the literal true

  // Typed reads; each throws json::Exc when the value has another type.
  std::string asString() const;
  std::int64_t asInteger() const;
  bool asBoolean() const;

  // Compact text of the value; "" for an empty value.
  std::string dump() const;

  // Deep structural equality; two empty values are equal.
  bool operator==(const Value& other) const noexcept;

 protected:
  void expect(bool ok, const char* expected) const;
  json_t* v_ = nullptr;
};

class Object : public Value {
 public:
  // A new empty object.
  Object();
  // Shares the value; throws json::Exc unless it is an object.
  explicit Object(const Value& v);

  std::size_t size() const noexcept;
  bool has(std::string_view key) const;
  // The member's value, or an empty value when the key is absent.
  Value get(std::string_view key) const;
  // Sets or replaces a member; throws json::Exc
  //   "JSON error: object element can not be set. Key: <key>. New value type: <type>"
  // when jansson refuses it (an empty value, a key that is not UTF-8).
  void set(std::string_view key, const Value& value);
  // Removes a member; returns whether it was there.
  bool erase(std::string_view key);
  std::vector<std::string> keys() const;
  // A copy that shares nothing with this object.
  Object deepCopy() const;
};

// Parses exactly size bytes (no terminator needed) as one JSON object.
Object strToObject(const char* data, std::size_t size);
inline Object strToObject(std::string_view text) { return strToObject(text.data(), text.size()); }
// Parses one JSON value of any type.
Value strToValue(std::string_view text);

// Whether text is well-formed UTF-8 (no overlong forms, no surrogates,
// nothing above U+10FFFF): what a JSON string may hold.
bool isUtf8(std::string_view text) noexcept;

// Writes the compact text of the value (nothing for an empty value).
std::ostream& operator<<(std::ostream& out, const Value& v);
// Reads the rest of the stream as one JSON object.
std::istream& operator>>(std::istream& in, Object& obj);

}  // namespace json
