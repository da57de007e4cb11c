#include "framework/json.h"

#include "framework/utf8.h"

#include <jansson.h>

#include <cstdlib>
#include <istream>
#include <iterator>
#include <memory>
#include <ostream>

namespace json {
namespace {

struct FreeText {
  void operator()(char* p) const noexcept { std::free(p); }
};

json_t* checked(json_t* v) {
  if (!v) throw std::bad_alloc();
  return v;
}

}  // namespace

Value Value::steal(json_t* v) noexcept {
  Value r;
  r.v_ = v;
  return r;
}

Value Value::borrow(json_t* v) noexcept { return steal(json_incref(v)); }

Value Value::string(std::string_view text) {
  json_t* v = json_stringn(text.data(), text.size());
  if (!v) throw Exc("JSON error: string is not valid UTF-8");
  return steal(v);
}

Value Value::integer(std::int64_t n) { return steal(checked(json_integer(n))); }
Value Value::real(double d) {
  json_t* v = json_real(d);
  if (!v) throw Exc("JSON error: number is not finite");
  return steal(v);
}
Value Value::boolean(bool b) { return steal(checked(json_boolean(b))); }
Value Value::null() { return steal(json_null()); }

Value::Value(const Value& other) noexcept : v_(json_incref(other.v_)) {}
Value::Value(Value&& other) noexcept : v_(other.v_) { other.v_ = nullptr; }

Value& Value::operator=(const Value& other) noexcept {
  if (this != &other) {
    json_t* old = v_;
    v_ = json_incref(other.v_);
    json_decref(old);
  }
  return *this;
}

Value& Value::operator=(Value&& other) noexcept {
  if (this != &other) {
    json_decref(v_);
    v_ = other.v_;
    other.v_ = nullptr;
  }
  return *this;
}

Value::~Value() { json_decref(v_); }

const char* Value::typeName() const noexcept {
  if (!v_) return "empty";
  switch (json_typeof(v_)) {
    case JSON_OBJECT:
      return "object";
    case JSON_ARRAY:
      return "array";
    case JSON_STRING:
      return "string";
    case JSON_INTEGER:
      return "integer";
    case JSON_REAL:
      return "float";
    case JSON_TRUE:
    case JSON_FALSE:
      return "boolean";
    case JSON_NULL:
      return "null";
  }
  return "unknown";
}

bool Value::isObject() const noexcept { return v_ && json_is_object(v_); }
bool Value::isArray() const noexcept { return v_ && json_is_array(v_); }
bool Value::isString() const noexcept { return v_ && json_is_string(v_); }
bool Value::isInteger() const noexcept { return v_ && json_is_integer(v_); }
bool Value::isTrue() const noexcept { return v_ && json_is_true(v_); }

void Value::expect(bool ok, const char* expected) const {
  if (!ok) {
    throw Exc(std::string("JSON error: Wrong type: ") + typeName() + ". Expected type: " + expected);
  }
}

std::string Value::asString() const {
  expect(isString(), "string");
  return std::string(json_string_value(v_), json_string_length(v_));
}

std::int64_t Value::asInteger() const {
  expect(isInteger(), "integer");
  return static_cast<std::int64_t>(json_integer_value(v_));
}

bool Value::asBoolean() const {
  expect(v_ && json_is_boolean(v_), "boolean");
  return json_is_true(v_);
}

std::string Value::dump() const {
  if (!v_) return {};
  std::unique_ptr<char, FreeText> text(json_dumps(v_, JSON_COMPACT | JSON_ENCODE_ANY));
  if (!text) throw std::bad_alloc();
  return std::string(text.get());
}

bool Value::operator==(const Value& other) const noexcept {
  if (!v_ || !other.v_) return v_ == other.v_;
  return json_equal(v_, other.v_) != 0;
}

Object::Object() { v_ = checked(json_object()); }

Object::Object(const Value& v) : Value(v) { expect(isObject(), "object"); }

std::size_t Object::size() const noexcept { return json_object_size(v_); }

bool Object::has(std::string_view key) const { return json_object_getn(v_, key.data(), key.size()) != nullptr; }

Value Object::get(std::string_view key) const {
  json_t* m = json_object_getn(v_, key.data(), key.size());
  return m ? Value::borrow(m) : Value();
}

void Object::set(std::string_view key, const Value& value) {
  if (value.empty() || json_object_setn(v_, key.data(), key.size(), value.get()) != 0) {
    throw Exc("JSON error: object element can not be set. Key: " + std::string(key) +
              ". New value type: " + value.typeName());
  }
}

bool Object::erase(std::string_view key) { return json_object_deln(v_, key.data(), key.size()) == 0; }

std::vector<std::string> Object::keys() const {
  std::vector<std::string> out;
  const char* key;
  size_t len;
  json_t* value;
  json_object_keylen_foreach(v_, key, len, value) {
    (void)value;
    out.emplace_back(key, len);
  }
  return out;
}

Object Object::deepCopy() const { return Object(Value::steal(checked(json_deep_copy(v_)))); }

namespace {

Value parse(const char* data, std::size_t size, std::size_t flags) {
  json_error_t error;
  // An empty view may have no address, which the parser refuses as a wrong
  // argument; it is the empty text, with the parser's own message for it.
  json_t* v = json_loadb(data ? data : "", size, flags | JSON_ALLOW_NUL, &error);
  if (!v) {
    throw Exc("JSON error: " + std::string(error.text) + " at line " + std::to_string(error.line) + ", column " +
              std::to_string(error.column));
  }
  return Value::steal(v);
}

}  // namespace

Object strToObject(const char* data, std::size_t size) { return Object(parse(data, size, 0)); }

Value strToValue(std::string_view text) { return parse(text.data(), text.size(), JSON_DECODE_ANY); }

std::ostream& operator<<(std::ostream& out, const Value& v) { return out << v.dump(); }

std::istream& operator>>(std::istream& in, Object& obj) {
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  obj = strToObject(text.data(), text.size());
  return in;
}

bool isUtf8(std::string_view text) noexcept {
  const auto* p = reinterpret_cast<const unsigned char*>(text.data());
  const auto* end = p + text.size();
  while (p < end) {
    if (*p < 0x80) {
      ++p;
      continue;
    }
    const std::size_t n = utf8::sequenceLength(p, end);
    if (n == 0) return false;
    p += n;
  }
  return true;
}

}  // namespace json
