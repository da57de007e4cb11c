#include "framework/json.h"

#include <gtest/gtest.h>

namespace {

// The type names appear in the texts of type errors, which reach the log.
TEST(Json, WrongTypeTextsNameBothTypes) {
  const std::vector<std::pair<json::Value, const char*>> values = {{json::Value(), "empty"},
                                                                   {json::Object(), "object"},
                                                                   {json::strToValue("[1]"), "array"},
                                                                   {json::Value::string("x"), "string"},
                                                                   {json::Value::integer(1), "integer"},
                                                                   {json::Value::real(1.5), "float"},
                                                                   {json::Value::boolean(false), "boolean"},
                                                                   {json::Value::null(), "null"}};
  for (const auto& [value, name] : values) {
    EXPECT_STREQ(value.typeName(), name);
    if (value.isString()) continue;
    try {
      value.asString();
      ADD_FAILURE() << name << " read as a string";
    } catch (const json::Exc& e) {
      EXPECT_EQ(std::string(e.what()), std::string("JSON error: Wrong type: ") + name + ". Expected type: string");
    }
  }
  try {
    json::Object().set("bad", json::Value());
    FAIL();
  } catch (const json::Exc& e) {
    EXPECT_STREQ(e.what(), "JSON error: object element can not be set. Key: bad. New value type: empty");
  }
}

TEST(Json, ParsesExactlyTheGivenBytesAndKeepsEmbeddedNul) {
  const char text[] = "{\"a\":1}garbage";
  EXPECT_EQ(json::strToObject(text, 7).get("a").asInteger(), 1);
  EXPECT_THROW(json::strToObject(text, sizeof text - 1), json::Exc);
  EXPECT_THROW(json::strToObject("[1,2]"), json::Exc);  // not an object
  EXPECT_THROW(json::strToObject(""), json::Exc);
  EXPECT_EQ(json::Value::string(std::string("a\0b", 3)).asString(), std::string("a\0b", 3));
  EXPECT_THROW(json::Value::string("\xff"), json::Exc);
}

// Exactly the well-formed UTF-8 that a JSON string may hold.
TEST(Json, Utf8CheckRefusesEveryIllFormedSequence) {
  for (const char* good : {"", "plain", "caf\xC3\xA9", "\xE2\x82\xAC", "\xED\x9F\xBF", "\xEE\x80\x80",
                           "\xF0\x90\x80\x80", "\xF4\x8F\xBF\xBF"}) {
    EXPECT_TRUE(json::isUtf8(good)) << good;
  }
  for (const char* bad : {"\x80", "\xC0\x80", "\xC1\xBF", "\xE0\x9F\xBF", "\xED\xA0\x80", "\xF4\x90\x80\x80",
                          "\xF5\x80\x80\x80", "\xFF", "\xC3", "\xE2\x82", "\xC3\x28", "ok\xF0\x9F\x93"}) {
    EXPECT_FALSE(json::isUtf8(bad)) << bad;
  }
  EXPECT_TRUE(json::isUtf8(std::string_view("a\0b", 3)));
}

}  // namespace
