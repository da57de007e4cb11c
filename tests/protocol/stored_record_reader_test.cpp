// The streaming reader of stored pack records against the jansson path it
// replaces: the same record, or the same refusal, for every text.

#include "protocol/stored_record_reader.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <ostream>
#include <random>
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
    o.value = PackInfoPartial(json::strToObject(text), Ipc::kUseLimitSeconds);
    o.ok = true;
  } catch (const json::Exc& e) {
    o.error = e.what();
  }
  return o;
}

Outcome viaReader(const std::string& text) {
  Outcome o;
  try {
    o.value = Ipc::readStoredPackInfo(text, Ipc::kUseLimitSeconds);
    o.ok = true;
  } catch (const json::Exc& e) {
    o.error = e.what();
  }
  return o;
}

// What the comparison saw, so that a generator that stops making useful
// texts fails loudly instead of passing.
struct Tally {
  int accepted = 0, refused = 0, withName = 0, withEntries = 0;
};

// Same record or same message through the public reader; the streaming
// part alone must agree with jansson on acceptance too, unless the text is
// one it may leave to jansson (a raw NUL byte, or mayDefer).
void expectSame(const std::string& text, Tally* tally = nullptr, bool mayDefer = false) {
  SCOPED_TRACE("text: " + testing::PrintToString(text));
  const Outcome want = viaJansson(text);
  const Outcome got = viaReader(text);
  ASSERT_EQ(got.ok, want.ok) << got.error << " / " << want.error;
  EXPECT_EQ(got.error, want.error);
  if (want.ok) {
    EXPECT_EQ(got.value, want.value);
  }

  PackInfoPartial fast;
  const bool fastOk = Ipc::tryReadStoredPackInfo(text, Ipc::kUseLimitSeconds, fast);
  if (fastOk) {
    EXPECT_TRUE(want.ok) << "the streaming reader took a text jansson refuses: " << want.error;
    EXPECT_EQ(fast, want.value);
  } else if (!mayDefer && text.find('\0') == std::string::npos) {
    EXPECT_FALSE(want.ok) << "the streaming reader refused a text jansson takes";
  }
  if (tally) {
    ++(want.ok ? tally->accepted : tally->refused);
    if (want.ok && want.value.name != PackInfoPartial::STR_INVALID) ++tally->withName;
    if (want.ok && !want.value.uses.empty()) ++tally->withEntries;
  }
}

// Seeded generator of stored texts: mostly records of the stored form,
// with wrong types, unknown keys, nested junk, duplicates, boundary
// numbers, escapes, and now and then a fault that makes the text invalid.
class TextGen {
 public:
  explicit TextGen(std::uint64_t seed) : rng_(seed) {}

  std::string text() {
    // A third of the texts carry faults of the generator's own making;
    // the mutations below may break any of them.
    faults_ = chance(33);
    std::string t;
    const int top = pick(100);
    if (top < 2) {
      t = "[" + junk(1) + "]";
    } else if (top < 3) {
      t = junk(3);
    } else {
      t = record();
    }
    t = ws() + t + ws();
    if (chance(3)) t += oneOf({"x", "{}", "}", "\n", " 1", ",", std::string(1, '\0')});
    if (chance(4) && !t.empty()) t[pick(static_cast<int>(t.size()))] = static_cast<char>(pick(256));
    if (chance(2)) t.insert(static_cast<std::size_t>(pick(static_cast<int>(t.size()) + 1)), 1, '\0');
    if (chance(3)) t.resize(static_cast<std::size_t>(pick(static_cast<int>(t.size()) + 1)));
    return t;
  }

  // A record of the stored form with valid fields only.
  std::string validRecord() {
    faults_ = false;
    return record();
  }

 private:
  bool chance(int percent) { return pick(100) < percent; }
  int pick(int n) { return static_cast<int>(rng_() % static_cast<std::uint64_t>(n)); }
  std::string oneOf(const std::vector<std::string>& options) { return options[pick(static_cast<int>(options.size()))]; }
  bool fault(int percent) { return faults_ && chance(percent); }

  std::string ws() {
    if (!chance(15)) return "";
    if (fault(2)) return oneOf({"\f", "\v", "\xC2\xA0"});
    return oneOf({" ", "\t", "\n", "\r\n", "  "});
  }

  std::string object(const std::vector<std::pair<std::string, std::string>>& members) {
    std::string o = "{" + ws();
    for (std::size_t i = 0; i < members.size(); ++i) {
      if (i) o += ws() + "," + ws();
      o += members[i].first + ws() + ":" + ws() + members[i].second;
    }
    return o + ws() + "}";
  }

  std::string hex4(unsigned v) {
    static const char* digits[] = {"0123456789abcdef", "0123456789ABCDEF"};
    const char* d = digits[pick(2)];
    return {'\\', 'u', d[(v >> 12) & 15], d[(v >> 8) & 15], d[(v >> 4) & 15], d[v & 15]};
  }

  static std::string utf8(unsigned cp) {
    std::string s;
    if (cp < 0x80) {
      s += static_cast<char>(cp);
    } else if (cp < 0x800) {
      s += static_cast<char>(0xC0 | (cp >> 6));
      s += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp < 0x10000) {
      s += static_cast<char>(0xE0 | (cp >> 12));
      s += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      s += static_cast<char>(0x80 | (cp & 0x3F));
    } else {
      s += static_cast<char>(0xF0 | (cp >> 18));
      s += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
      s += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      s += static_cast<char>(0x80 | (cp & 0x3F));
    }
    return s;
  }

  // A string token; key strings refuse \u0000, which is why they differ.
  std::string str(bool key = false) {
    std::string s = "\"";
    const int pieces = pick(key ? 3 : 12);
    for (int i = 0; i < pieces; ++i) {
      const int k = pick(100);
      if (k < 45) {
        s += static_cast<char>(0x20 + pick(95));
        if (s.back() == '"' || s.back() == '\\') s.back() = 'q';
      } else if (k < 55) {
        s += oneOf({"\\\"", "\\\\", "\\/", "\\b", "\\f", "\\n", "\\r", "\\t"});
      } else if (k < 65) {
        unsigned cp = static_cast<unsigned>(1 + pick(0xFFFE));
        if (cp >= 0xD800 && cp <= 0xDFFF) cp = 0xE000;
        s += hex4(cp);
      } else if (k < 72) {
        s += hex4(0xD800 + static_cast<unsigned>(pick(0x400))) + hex4(0xDC00 + static_cast<unsigned>(pick(0x400)));
      } else if (k < 90) {
        static const unsigned starts[] = {0x80, 0x800, 0xE000, 0x10000};
        static const unsigned spans[] = {0x780, 0xD000, 0x2000, 0x100000};
        const int w = pick(4);
        s += utf8(starts[w] + static_cast<unsigned>(pick(static_cast<int>(spans[w]))));
      } else if (k < 92) {
        s += "\\u0000";
      } else if (fault(10)) {
        s += oneOf({hex4(0xD800) + "x", hex4(0xDBFF) + hex4(0x41), hex4(0xDC00), hex4(0xDFFF) + hex4(0xDC00),
                    "\x80", "\xC0\x80", "\xED\xA0\x80", "\xF5\x80\x80\x80", "\xE2\x82", "\xF4\x90\x80\x80",
                    "\x01", "\x1F", "\\x", "\\u12", "\\U0041"});
      }
    }
    return s + "\"";
  }

  std::string integer() {
    const int k = pick(100);
    if (k < 40) return std::to_string(static_cast<std::int64_t>(rng_()) >> pick(64));
    if (k < 60) return std::to_string(pick(2000) - 1000);
    if (fault(10)) return oneOf({"01", "-", "+1", "1.", ".5", "1e", "0x10", "--1", "1-"});
    if (fault(30)) {  // beyond long long
      return oneOf({"9223372036854775808", "-9223372036854775809", "18446744073709551615",
                    "123456789012345678901234567890", std::string(400, '9')});
    }
    return oneOf({"0", "-0", "2147483647", "2147483648", "-2147483648", "-2147483647", "-2147483649",
                  "4294967295", "4294967296", "9223372036854775807", "-9223372036854775808"});
  }

  std::string real() {
    if (fault(30)) return oneOf({"1e309", "-1e309", "1.8e308", "10e308", "9" + std::string(400, '9') + ".5"});
    return oneOf({"1.5", "-0.0", "1e5", "1E-5", "2.5e+3", "0.1e309", "1e-400", "1e308", "123.456e-7", "7.0"});
  }

  std::string junk(int depth) {
    const int k = pick(depth > 3 ? 7 : 9);
    switch (k) {
      case 0: case 1: return integer();
      case 2: return real();
      case 3: case 4: return str();
      case 5: return oneOf({"true", "false", "null"});
      case 6: return fault(5) ? oneOf({"tru", "nul", "True", "NaN", "Infinity", "'x'"}) : "null";
      case 7: {
        std::string a = "[" + ws();
        for (int i = pick(4); i > 0; --i) a += junk(depth + 1) + (i > 1 ? "," : "");
        return a + ws() + "]";
      }
      default: {
        std::vector<std::pair<std::string, std::string>> m;
        for (int i = pick(4); i > 0; --i) m.emplace_back(str(true), junk(depth + 1));
        return object(m);
      }
    }
  }

  std::string time() {
    const int k = pick(10);
    if (k < 6) return std::to_string(kNow - pick(static_cast<int>(2 * kLimit)));
    if (k < 8) return std::to_string(kNow - kLimit - pick(2));
    return integer();
  }

  // A key of the record: mostly plain, sometimes spelt with escapes.
  std::string key(const std::string& name) {
    if (!chance(5)) return "\"" + name + "\"";
    std::string k = "\"";
    for (char c : name) k += chance(30) ? hex4(static_cast<unsigned char>(c)) : std::string(1, c);
    return k + "\"";
  }

  std::string entry() {
    if (chance(8)) return junk(3);
    std::vector<std::pair<std::string, std::string>> m;
    auto add = [&](const std::string& k, std::string v) {
      if (chance(10)) return;                  // absent
      if (chance(10)) v = junk(4);             // wrong type, mostly
      m.emplace_back(key(k), v);
      if (chance(4)) m.emplace_back(key(k), junk(4));  // a duplicate wins
    };
    add("state", oneOf({"0", "2", "100", "101", integer()}));
    add("host", str());
    add("user", str());
    add("process", chance(70) ? std::to_string(pick(70000)) : integer());
    add("time", time());
    if (chance(10)) m.emplace_back(str(true), junk(4));
    std::shuffle(m.begin(), m.end(), rng_);
    return object(m);
  }

  std::string uses() {
    if (chance(5)) return junk(2);
    std::vector<std::pair<std::string, std::string>> m;
    std::string list = "[" + ws();
    for (int i = pick(6); i > 0; --i) list += entry() + (i > 1 ? "," : "");
    list += ws() + "]";
    m.emplace_back(key("entries"), chance(95) ? list : junk(3));
    if (chance(10)) m.emplace_back(str(true), junk(3));
    if (chance(5)) m.emplace_back(key("entries"), chance(50) ? "[]" : junk(3));
    std::shuffle(m.begin(), m.end(), rng_);
    return object(m);
  }

  std::string record() {
    std::vector<std::pair<std::string, std::string>> m;
    auto add = [&](const std::string& k, const std::string& v) {
      if (chance(5)) return;
      m.emplace_back(key(k), chance(8) ? junk(2) : v);
      if (chance(3)) m.emplace_back(key(k), chance(50) ? v : junk(2));
    };
    add("name", str());
    add("owner", str());
    add("created", time());
    add("modified", time());
    add("docCount", chance(80) ? std::to_string(pick(5000)) : integer());
    add("uses", uses());
    for (int i = pick(3); i > 0; --i) {
      m.emplace_back(chance(50) ? str(true) : key(oneOf({"Name", "names", "", "entries", "state"})), junk(1));
    }
    std::shuffle(m.begin(), m.end(), rng_);
    return object(m);
  }

  std::mt19937_64 rng_;
  bool faults_ = false;
};

class StoredRecordReader : public testing::Test {
 protected:
  Ipc::FixedUseClock clock_{kNow};
};

TEST_F(StoredRecordReader, MatchesJanssonOnGeneratedTexts) {
  constexpr std::uint64_t kSeed = 20240611;
  TextGen gen(kSeed);
  Tally tally;
  for (int i = 0; i < 20000 && !HasFatalFailure(); ++i) expectSame(gen.text(), &tally);
  // The generator must keep making both kinds, and records worth reading.
  EXPECT_GT(tally.accepted, 10000);
  EXPECT_GT(tally.refused, 4000);
  EXPECT_GT(tally.withName, 8000);
  EXPECT_GT(tally.withEntries, 2500);
}

TEST_F(StoredRecordReader, MatchesJanssonOnEveryTruncationAndByte) {
  TextGen gen(7);
  for (int r = 0; r < 4 && !HasFatalFailure(); ++r) {
    const std::string text = gen.validRecord();
    for (std::size_t cut = 0; cut <= text.size(); ++cut) expectSame(text.substr(0, cut));
    // Each byte replaced by a quote, a backslash, a high byte and a NUL.
    for (std::size_t i = 0; i < text.size(); ++i) {
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
  for (const std::string& text : {
           // The last duplicate wins, also when it has the wrong type.
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
  for (const char* real : {"1.7976931348623157e308", "1.7976931348623158e308", "1.7976931348623159e308", "0e400",
                           "-0.0e999", "1e-99999", "179769313486231570000000000000000000000000000000000000000000000"
                                                   "0000000000000000000000000000000000000000000000000000000000000000"
                                                   "0000000000000000000000000000000000000000000000000000000000000000"
                                                   "0000000000000000000000000000000000000000000000000000000000000000"
                                                   "0000000000000000000000000000000000000000000000000000.0"}) {
    expectSame(std::string(R"({"name":"n","x":)") + real + "}", nullptr, true);
  }
}

TEST_F(StoredRecordReader, ReadsIntoARecordInPlace) {
  Ipc::PackInfo info("P1", "f/", 3, PackInfoPartial());
  info.name = "old";
  info.uses.append(Ipc::UseInfo(Ipc::UseInfo::OpenForEdit, "h", "u", 1, kNow));
  Ipc::readStoredPackInfo(R"({"owner":"o","docCount":4})", Ipc::kUseLimitSeconds, info);
  EXPECT_EQ(info.id(), "P1");
  EXPECT_EQ(info.folder(), "f/");
  EXPECT_EQ(info.status(), 3);
  EXPECT_EQ(info.name, PackInfoPartial::STR_INVALID);
  EXPECT_EQ(info.owner, "o");
  EXPECT_EQ(info.docCount, 4);
  EXPECT_TRUE(info.uses.empty());
}

}  // namespace
