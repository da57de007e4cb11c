#include "framework/json.h"

#include <gtest/gtest.h>

#include <sstream>

namespace {

TEST(Json, TypeNamesIncludeEmpty) {
  EXPECT_STREQ(json::Value().typeName(), "empty");
  EXPECT_STREQ(json::Object().typeName(), "object");
  EXPECT_STREQ(json::strToValue("[1]").typeName(), "array");
  EXPECT_STREQ(json::Value::string("x").typeName(), "string");
  EXPECT_STREQ(json::Value::integer(1).typeName(), "integer");
  EXPECT_STREQ(json::Value::real(1.5).typeName(), "float");
  EXPECT_STREQ(json::Value::boolean(false).typeName(), "boolean");
  EXPECT_STREQ(json::Value::null().typeName(), "null");
}

TEST(Json, WrongTypeTextNamesBothTypes) {
  try {
    json::Value::string("45678").asInteger();
    FAIL();
  } catch (const json::Exc& e) {
    EXPECT_STREQ(e.what(), "JSON error: Wrong type: string. Expected type: integer");
  }
  try {
    json::Value().asString();
    FAIL();
  } catch (const json::Exc& e) {
    EXPECT_STREQ(e.what(), "JSON error: Wrong type: empty. Expected type: string");
  }
}

TEST(Json, ParsesExactlyTheGivenBytes) {
  const char text[] = "{\"a\":1}garbage";
  json::Object o = json::strToObject(text, 7);
  EXPECT_EQ(o.get("a").asInteger(), 1);
  EXPECT_THROW(json::strToObject(text, sizeof text - 1), json::Exc);
  EXPECT_THROW(json::strToObject("[1,2]"), json::Exc);  // not an object
  EXPECT_THROW(json::strToObject(""), json::Exc);
}

TEST(Json, ObjectMembersAndStreams) {
  json::Object o;
  o.set("name", json::Value::string("pack"));
  o.set("n", json::Value::integer(3));
  EXPECT_TRUE(o.has("name"));
  EXPECT_TRUE(o.get("missing").empty());
  EXPECT_TRUE(o.erase("n"));
  EXPECT_FALSE(o.erase("n"));
  try {
    o.set("bad", json::Value());
    FAIL();
  } catch (const json::Exc& e) {
    EXPECT_STREQ(e.what(), "JSON error: object element can not be set. Key: bad. New value type: empty");
  }

  std::ostringstream out;
  out << o;
  EXPECT_EQ(out.str(), "{\"name\":\"pack\"}");
  std::istringstream in(out.str());
  json::Object back;
  in >> back;
  EXPECT_TRUE(back == o);
}

TEST(Json, CopiesShareAndDeepCopiesDoNot) {
  json::Object a;
  json::Object shared(a);
  json::Object deep = a.deepCopy();
  a.set("k", json::Value::boolean(true));
  EXPECT_TRUE(shared.has("k"));
  EXPECT_FALSE(deep.has("k"));
}

TEST(Json, StringsKeepEmbeddedNulAndRejectInvalidUtf8) {
  json::Value v = json::Value::string(std::string("a\0b", 3));
  EXPECT_EQ(v.asString(), std::string("a\0b", 3));
  EXPECT_THROW(json::Value::string("\xff"), json::Exc);
}

}  // namespace
