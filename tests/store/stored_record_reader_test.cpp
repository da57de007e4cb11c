// The streaming reader of stored pack records against the jansson path it
// replaces: the same record, or the same refusal, for every text.

#include "store/stored_record_reader.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <ostream>
#include <string>
#include <vector>

namespace Ipc {
// Readable failures: the fields, not the object's bytes.
void PrintTo(const PackInfoPartial& p, std::ostream* os) {
  *os << "{name=" << testing::PrintToString(p.name) << " owner=" << testing::PrintToString(p.owner)
      << " created=" << p.created << " modified=" << p.modified << " docCount=" << p.docCount << " uses=[";
  for (const UseInfo& u : p.uses) {
    *os << "(" << u.state << "," << testing::PrintToString(u.host) << "," << testing::PrintToString(u.user) << ","
        << u.process << "," << u.time << ")";
  }
  *os << "]}";
}
}  // namespace Ipc

namespace {

using Ipc::PackInfoPartial;

constexpr std::int64_t kNow = 1'700'000'000;
constexpr std::int64_t kLimit = static_cast<std::int64_t>(Ipc::kUseLimitSeconds);

struct Outcome {
  bool ok = false;
  PackInfoPartial value;
  std::string error;
};

Outcome viaJansson(const std::string& text) {
  Outcome o;
  try {
    o.value = PackInfoPartial(json::strToObject(text), Ipc::kUseLimitSeconds, kNow);
    o.ok = true;
  } catch (const json::Exc& e) {
    o.error = e.what();
  }
  return o;
}

Outcome viaReader(const std::string& text) {
  Outcome o;
  try {
    o.value = Ipc::readStoredPackInfo(text, Ipc::kUseLimitSeconds, kNow);
    o.ok = true;
  } catch (const json::Exc& e) {
    o.error = e.what();
  }
  return o;
}

// Same record or same message through the public reader; the streaming
// part alone must agree with jansson on acceptance too, unless the text is
// one it may leave to jansson (a raw NUL byte, or mayDefer).
void expectSame(const std::string& text, bool mayDefer = false) {
  SCOPED_TRACE("text: " + testing::PrintToString(text));
  const Outcome want = viaJansson(text);
  const Outcome got = viaReader(text);
  ASSERT_EQ(got.ok, want.ok) << got.error << " / " << want.error;
  EXPECT_EQ(got.error, want.error);
  if (want.ok) {
    EXPECT_EQ(got.value, want.value);
  }

  PackInfoPartial fast;
  const bool fastOk = Ipc::tryReadStoredPackInfo(text, Ipc::kUseLimitSeconds, kNow, fast);
  if (fastOk) {
    EXPECT_TRUE(want.ok) << "the streaming reader took a text jansson refuses: " << want.error;
    EXPECT_EQ(fast, want.value);
  } else if (!mayDefer && text.find('\0') == std::string::npos) {
    EXPECT_FALSE(want.ok) << "the streaming reader refused a text jansson takes";
  }
}

class StoredRecordReader : public testing::Test {
 protected:
};

// Valid records of the stored form, each exercising a different part of
// the grammar: escapes and raw UTF-8 in strings, entries at and beyond the
// age limit, unknown keys with nested values, duplicates, keys spelt with
// escapes, boundary integers, reals and white space.
std::vector<std::string> validRecords() {
  const std::string now = std::to_string(kNow);
  const std::string old = std::to_string(kNow - kLimit - 1);
  return {
      R"({"name":"P \"1\" \\ \/ \b\f\n\r\t","owner":"\u00e9\u4E2D\ud83d\ude00","created":-9223372036854775808,)"
      R"("modified":9223372036854775807,"docCount":2147483647,"uses":{"entries":[{"state":0,"host":"h","user":"u",)"
      R"("process":4294967295,"time":)" +
          now + R"(},{"state":2,"host":"x","time":)" + old + "}]}}",
      " {\n\t\"n\\u0061me\" : \"caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80\" ,\r\n\"extra\":[1,-0,1.5e3,true,false,null,"
      "{\"a\":[[]],\"\":{}}],\"docCount\":-2147483648,\"docCount\":3, \"uses\" : {\"other\":1,\"entries\":["
      "{\"time\":" +
          now + ",\"host\":\"a\\u0000b\",\"state\":101,\"state\":100,\"user\":\"\",\"process\":0}]}} ",
      R"({"created":5,"modified":-1,"owner":"","uses":{"entries":[]},"name":"x","unknown":"\u0041","name":"y"})",
  };
}

TEST_F(StoredRecordReader, MatchesJanssonOnEveryTruncationAndByte) {
  for (const std::string& text : validRecords()) {
    ASSERT_TRUE(viaJansson(text).ok) << text;  // a sweep of refusals alone would prove little
    for (std::size_t cut = 0; cut <= text.size(); ++cut) expectSame(text.substr(0, cut));
    // Each byte replaced by a quote, a backslash, a high byte and a NUL.
    for (std::size_t i = 0; i < text.size() && !HasFatalFailure(); ++i) {
      for (char c : {'"', '\\', '\xFF', '\0'}) {
        std::string t = text;
        t[i] = c;
        expectSame(t);
      }
    }
  }
}

TEST_F(StoredRecordReader, CasesThatTellTheParsersApart) {
  const std::string now = std::to_string(kNow);
  for (const std::string& text :
       {// The last duplicate wins, also when it has the wrong type.
        std::string(R"({"name":"a","name":"b","docCount":1,"docCount":"x"})"),
        std::string(R"({"uses":{"entries":[{"state":0,"host":"h","time":)" + now + R"(}]},"uses":7})"),
        std::string(R"({"uses":{"entries":[{"state":0,"host":"h","time":)" + now + R"(,"host":1}]}})"),
        // Keys spelt with escapes are the same keys.
        std::string(R"({"n\u0061me":"x","\u006fwner":"y"})"),
        // NUL is allowed in a string but not in a key.
        std::string(R"({"name":"a\u0000b"})"), std::string(R"({"na\u0000me":"a"})"),
        // Surrogates: a pair is one character; a lone one is refused.
        std::string(R"({"name":"\ud83d\ude00"})"), std::string(R"({"name":"\udc00"})"),
        std::string(R"({"x":"\ud800\u0041"})"), std::string("{\"name\":\"\xed\xa0\x80\"}"),
        // Raw control characters in a string; jansson skips a NUL after a number.
        std::string("{\"name\":\"0123456789abcdef0123456789\x1c\"}"), std::string("{\"docCount\":4\0}", 15),
        // Integers beyond 64 bits are refused; reals are not integers.
        std::string(R"({"x":9223372036854775808})"), std::string(R"({"created":-9223372036854775808})"),
        std::string(R"({"created":5.0,"modified":1e3})"), std::string(R"({"x":1.8e308})"),
        // The limits of docCount, state and process.
        std::string(R"({"docCount":-2147483648})"), std::string(R"({"docCount":2147483647})"),
        std::string(R"({"uses":{"entries":[{"state":2147483648,"host":"h","time":)" + now + "}]}}"),
        std::string(R"({"uses":{"entries":[{"state":0,"host":"h","process":4294967295,"time":)" + now + "}]}}"),
        std::string(R"({"uses":{"entries":[{"state":0,"host":"h","process":-1,"time":)" + now + "}]}}"),
        // Entries at the age limit and one second past it.
        std::string(R"({"uses":{"entries":[{"state":0,"host":"a","time":)" + std::to_string(kNow - kLimit) +
                    R"(},{"state":0,"host":"b","time":)" + std::to_string(kNow - kLimit - 1) + "}]}}"),
        // Not one object.
        std::string("[]"), std::string("\"x\""), std::string("{} {}"), std::string("{}x"), std::string(""),
        std::string(" \n{}\t"), std::string("{}\0", 3), std::string("\xEF\xBB\xBF{}")}) {
    expectSame(text);
  }
}

TEST_F(StoredRecordReader, NestingLimitIsJanssons) {
  for (int depth : {2045, 2046, 2047, 2048}) {
    const std::string open(static_cast<std::size_t>(depth), '[');
    const std::string close(static_cast<std::size_t>(depth), ']');
    expectSame("{\"x\":" + open + close + "}");
    expectSame("{\"x\":" + open + "1" + close + "}");
    expectSame("{\"x\":" + open + "{}" + close + "}");
  }
}

TEST_F(StoredRecordReader, RealsAtTheEdgeOfTheDoubleRangeMayBeLeftToJansson) {
  for (const char* real :
       {"1.7976931348623157e308", "1.7976931348623158e308", "1.7976931348623159e308", "0e400", "-0.0e999", "1e-99999",
        "179769313486231570000000000000000000000000000000000000000000000"
        "0000000000000000000000000000000000000000000000000000000000000000"
        "0000000000000000000000000000000000000000000000000000000000000000"
        "0000000000000000000000000000000000000000000000000000000000000000"
        "0000000000000000000000000000000000000000000000000000.0"}) {
    expectSame(std::string(R"({"name":"n","x":)") + real + "}", true);
  }
}

TEST_F(StoredRecordReader, ReadsIntoARecordInPlace) {
  Ipc::PackInfo info("P1", "f/", 3, PackInfoPartial());
  info.name = "old";
  info.uses.append(Ipc::UseInfo(Ipc::UseInfo::OpenForEdit, "h", "u", 1, kNow));
  Ipc::readStoredPackInfo(R"({"owner":"o","docCount":4})", Ipc::kUseLimitSeconds, kNow, info);
  EXPECT_EQ(info.id(), "P1");
  EXPECT_EQ(info.folder(), "f/");
  EXPECT_EQ(info.status(), 3);
  EXPECT_EQ(info.name, PackInfoPartial::STR_INVALID);
  EXPECT_EQ(info.owner, "o");
  EXPECT_EQ(info.docCount, 4);
  EXPECT_TRUE(info.uses.empty());
}

}  // namespace
