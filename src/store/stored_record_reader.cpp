#include "store/stored_record_reader.h"

#include "framework/utf8.h"

#include <locale.h>

// The parser's SIMD scans of strings and whitespace; SSE2 is part of every
// x86-64 processor.
#if defined(__SSE2__) && !defined(RAPIDJSON_SSE2)
#define RAPIDJSON_SSE2
#endif
#include <rapidjson/reader.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <string>

namespace Ipc {
namespace {

// jansson refuses values nested deeper than this; the root is level 1.
constexpr unsigned kMaxDepth = 2048;

// What a value is, as far as a record's field is concerned.
enum class Type : std::uint8_t { Absent, Int, Str, Other };

// Where a container sits. Only the first four levels can hold anything the
// record reads: the root object, the use list's object, its entry array,
// one entry. Everything else is skipped (but still checked).
enum class Scope : std::uint8_t { Root, Uses, Entries, Entry, Skipped };

// The key whose value comes next, when it is one the record reads.
enum class Field : std::uint8_t {
  Other,
  Name,
  Owner,
  Created,
  Modified,
  DocCount,
  Uses,
  Entries,
  State,
  Host,
  User,
  Process,
  Time
};

Field classify(Scope scope, std::string_view k) {
  switch (scope) {
    case Scope::Root:
      if (k == "name") return Field::Name;
      if (k == "owner") return Field::Owner;
      if (k == "created") return Field::Created;
      if (k == "modified") return Field::Modified;
      if (k == "docCount") return Field::DocCount;
      if (k == PackInfoPartial::USE_FIELD_NAME) return Field::Uses;
      return Field::Other;
    case Scope::Uses:
      return k == "entries" ? Field::Entries : Field::Other;
    case Scope::Entry:
      if (k == "state") return Field::State;
      if (k == "host") return Field::Host;
      if (k == "user") return Field::User;
      if (k == "process") return Field::Process;
      if (k == "time") return Field::Time;
      return Field::Other;
    case Scope::Entries:
    case Scope::Skipped:
      break;
  }
  return Field::Other;
}

// The C locale, for reading reals the way jansson's strtod does whatever
// the process's locale is.
locale_t cLocale() {
  static const locale_t c = newlocale(LC_ALL_MASK, "C", nullptr);
  return c;
}

// jansson refuses a real that strtod takes to infinity ("real number
// overflow"); underflow to zero is fine.
bool realInRange(const char* s, std::size_t n) {
  const std::string text(s, n);
  errno = 0;
  const double d = cLocale() ? strtod_l(text.c_str(), nullptr, cLocale()) : std::strtod(text.c_str(), nullptr);
  return !((d == HUGE_VAL || d == -HUGE_VAL) && errno == ERANGE);
}

// Well-formed UTF-8 as Unicode defines it (no overlong forms, no
// surrogates, nothing beyond U+10FFFF), and no control character but
// whitespace. jansson refuses a text with anything else anywhere; checking
// it here once, ASCII eight bytes at a time, is much faster than the
// parser's own check, character by character (a quarter of a listing's
// time). It also covers two gaps of the parser: its SIMD string scan lets
// bytes 1A to 1F through, and it reads a NUL as the end of the text.
bool plainUtf8(const unsigned char* p, const unsigned char* end) {
  constexpr std::uint64_t kHigh = 0x8080808080808080ULL;
  constexpr std::uint64_t kSpaces = 0x2020202020202020ULL;
  while (p < end) {
    std::uint64_t w;
    // Words with neither a high bit nor a byte below 0x20 are plain ASCII.
    while (end - p >= 8 && (std::memcpy(&w, p, 8), (((w - kSpaces) & ~w) | w) & kHigh) == 0) p += 8;
    if (p == end) break;
    const unsigned c = *p;
    if (c < 0x80) {
      if (c < 0x20 && c != '\t' && c != '\n' && c != '\r') return false;
      ++p;
      continue;
    }
    const std::size_t n = utf8::sequenceLength(p, end);
    if (n == 0) return false;
    p += n;
  }
  return true;
}

// The parser takes a lone low surrogate escape (\uDC00) and writes its
// three bytes (ED B0 80) into the string, where jansson refuses the text.
// Raw bytes of that form never get this far (plainUtf8 refuses them), so
// the bytes can only come from such an escape.
bool noSurrogates(const char* s, std::size_t n) {
  const char* end = s + n;
  for (const char* p = s; (p = static_cast<const char*>(std::memchr(p, '\xED', static_cast<std::size_t>(end - p))));
       ++p) {
    if (p + 1 < end && static_cast<unsigned char>(p[1]) >= 0xA0) return false;
  }
  return true;
}

// One scalar as the record sees it.
struct Scalar {
  Type type = Type::Other;
  std::int64_t n = 0;
  std::string_view s;
};

// The last value of each key of one use entry; judged when the entry ends,
// because the last of duplicate keys wins.
struct EntryDraft {
  Type state = Type::Absent, host = Type::Absent, user = Type::Absent, process = Type::Absent, time = Type::Absent;
  std::int64_t stateN = 0, processN = 0, timeN = 0;
  std::string hostS, userS;

  void set(Field k, const Scalar& v) {
    switch (k) {
      case Field::State:
        state = v.type;
        stateN = v.n;
        break;
      case Field::Process:
        process = v.type;
        processN = v.n;
        break;
      case Field::Time:
        time = v.type;
        timeN = v.n;
        break;
      case Field::Host:
        host = v.type;
        if (v.type == Type::Str) hostS.assign(v.s);
        break;
      case Field::User:
        user = v.type;
        if (v.type == Type::Str) userS.assign(v.s);
        break;
      default:
        break;
    }
  }
};

// SAX handler that fills a PackInfoPartial. Every callback returns false to
// refuse the text; the parser then stops.
class RecordHandler {
 public:
  RecordHandler(PackInfoPartial& out, std::int64_t oldest) : out_(out), oldest_(oldest) {
    out_.name = PackInfoPartial::STR_INVALID;
    out_.owner = PackInfoPartial::STR_INVALID;
    out_.created = PackInfoPartial::TIME_INVALID;
    out_.modified = PackInfoPartial::TIME_INVALID;
    out_.docCount = PackInfoPartial::LONG_INVALID;
    out_.uses = UseInfos();
  }

  bool Null() { return scalar({}); }
  bool Bool(bool) { return scalar({}); }
  bool RawNumber(const char* s, rapidjson::SizeType n, bool) {
    const char* end = s + n;
    Scalar v;
    if (std::find_if(s, end, [](char c) { return c == '.' || c == 'e' || c == 'E'; }) != end) {
      if (!realInRange(s, n)) return false;
    } else {
      // jansson's integers are long long; beyond them it refuses the text.
      const auto [p, ec] = std::from_chars(s, end, v.n);
      if (ec != std::errc() || p != end) return false;
      v.type = Type::Int;
    }
    return scalar(v);
  }
  bool String(const char* s, rapidjson::SizeType n, bool) {
    if (!noSurrogates(s, n)) return false;
    return scalar({Type::Str, 0, std::string_view(s, n)});
  }
  bool Key(const char* s, rapidjson::SizeType n, bool) {
    // jansson refuses a NUL in a key even where it allows one in a string.
    if (std::memchr(s, 0, n) || !noSurrogates(s, n)) return false;
    key_ = classify(scope(depth_), std::string_view(s, n));
    return true;
  }
  bool StartObject() { return open(true); }
  bool StartArray() { return open(false); }
  bool EndObject(rapidjson::SizeType) { return close(); }
  bool EndArray(rapidjson::SizeType) { return close(); }
  // Numbers all come through RawNumber (kParseNumbersAsStringsFlag).
  bool Int(int) { return false; }
  bool Uint(unsigned) { return false; }
  bool Int64(std::int64_t) { return false; }
  bool Uint64(std::uint64_t) { return false; }
  bool Double(double) { return false; }

 private:
  Scope scope(unsigned level) const { return level < scopes_.size() ? scopes_[level] : Scope::Skipped; }

  // A value at depth_ + 1 under key_ (or an element, in an array).
  bool scalar(const Scalar& v) {
    if (depth_ + 1 > kMaxDepth) return false;
    if (depth_ == 0) return false;  // not an object
    assign(v);
    return true;
  }

  // Stores a value where the record has a place for it; containers come
  // here as Type::Other unless they are the use list's own.
  void assign(const Scalar& v) {
    switch (scope(depth_)) {
      case Scope::Root:
        switch (key_) {
          case Field::Name:
            setString(out_.name, v);
            break;
          case Field::Owner:
            setString(out_.owner, v);
            break;
          case Field::Created:
            out_.created = v.type == Type::Int ? v.n : PackInfoPartial::TIME_INVALID;
            break;
          case Field::Modified:
            out_.modified = v.type == Type::Int ? v.n : PackInfoPartial::TIME_INVALID;
            break;
          case Field::DocCount:
            out_.docCount = v.type == Type::Int && v.n > std::numeric_limits<std::int32_t>::min() &&
                                    v.n <= std::numeric_limits<std::int32_t>::max()
                                ? static_cast<std::int32_t>(v.n)
                                : PackInfoPartial::LONG_INVALID;
            break;
          case Field::Uses:
            out_.uses = UseInfos();
            break;  // not an object: no list
          default:
            break;
        }
        break;
      case Scope::Uses:
        if (key_ == Field::Entries) out_.uses = UseInfos();  // not an array: no list
        break;
      case Scope::Entry:
        draft_.set(key_, v);
        break;
      case Scope::Entries:  // an element that is not an object: dropped
      case Scope::Skipped:
        break;
    }
  }

  static void setString(std::string& field, const Scalar& v) {
    if (v.type == Type::Str) {
      field.assign(v.s);
    } else {
      field = PackInfoPartial::STR_INVALID;
    }
  }

  bool open(bool object) {
    const unsigned level = depth_ + 1;
    if (level > kMaxDepth) return false;
    Scope next = Scope::Skipped;
    const Scope parent = scope(depth_);
    if (depth_ == 0) {
      if (!object) return false;  // jansson reads an array, which is no record
      next = Scope::Root;
    } else if (parent == Scope::Root && key_ == Field::Uses && object) {
      next = Scope::Uses;
      out_.uses = UseInfos();
    } else if (parent == Scope::Uses && key_ == Field::Entries && !object) {
      next = Scope::Entries;
      out_.uses = UseInfos();
    } else if (parent == Scope::Entries && object) {
      next = Scope::Entry;
      draft_ = EntryDraft();
    } else {
      assign({});
    }
    if (level < scopes_.size()) scopes_[level] = next;
    depth_ = level;
    return true;
  }

  bool close() {
    if (scope(depth_) == Scope::Entry) finishEntry();
    --depth_;
    return true;
  }

  // The same checks as a use entry read from a jansson tree.
  void finishEntry() {
    const EntryDraft& d = draft_;
    if (d.state != Type::Int || d.host != Type::Str || d.time != Type::Int) return;
    if (d.stateN < std::numeric_limits<std::int32_t>::min() || d.stateN > std::numeric_limits<std::int32_t>::max()) {
      return;
    }
    std::int64_t process = 0;
    if (d.process == Type::Int) {
      process = d.processN;
      if (process < 0 || process > std::numeric_limits<std::uint32_t>::max()) return;
    }
    if (d.timeN < oldest_) return;
    out_.uses.append(UseInfo(static_cast<UseInfo::State>(d.stateN), std::move(draft_.hostS),
                             d.user == Type::Str ? std::move(draft_.userS) : std::string(),
                             static_cast<std::uint32_t>(process), d.timeN));
  }

  PackInfoPartial& out_;
  const std::int64_t oldest_;
  unsigned depth_ = 0;
  std::array<Scope, 5> scopes_{};
  Field key_ = Field::Other;
  EntryDraft draft_;
};

// What each thread keeps between records: the text's copy that the parser
// decodes in place, and the parser with its state stack.
struct ParserState {
  std::string text;
  rapidjson::Reader reader;
};

// The SIMD scans load 16 aligned bytes at a time, and may load past the
// terminating NUL; the padding keeps those loads inside the buffer.
constexpr std::size_t kPadding = 16;
// A text longer than this is not kept for the next record.
constexpr std::size_t kKeptCapacity = std::size_t{1} << 20;

}  // namespace

bool tryReadStoredPackInfo(std::string_view text, std::uint64_t useLimit, std::int64_t now, PackInfoPartial& out) {
  // A NUL byte is among what plainUtf8 refuses; jansson has its own ways
  // with one, and decides.
  const auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
  if (text.empty() || !plainUtf8(bytes, bytes + text.size())) return false;

  thread_local ParserState state;
  std::string& buffer = state.text;
  buffer.assign(text);
  buffer.append(kPadding, '\0');
  RecordHandler handler(out, oldestUseKept(useLimit, now));
  rapidjson::InsituStringStream in(buffer.data());
  // In place: strings are decoded where they stand, never copied to the
  // parser's stack. Iterative: nesting costs the parser's heap stack, not
  // the thread's. Numbers as text: jansson's integer range and overflow
  // rules apply to the digits themselves.
  constexpr unsigned kFlags =
      rapidjson::kParseInsituFlag | rapidjson::kParseIterativeFlag | rapidjson::kParseNumbersAsStringsFlag;
  const bool ok = !state.reader.Parse<kFlags>(in, handler).IsError();
  if (buffer.capacity() > kKeptCapacity) std::string().swap(buffer);
  return ok;
}

void readStoredPackInfo(std::string_view text, std::uint64_t useLimit, std::int64_t now, PackInfoPartial& out) {
  if (tryReadStoredPackInfo(text, useLimit, now, out)) return;
  // jansson decides what the streaming reader refused: it throws with its
  // own message, or reads one of the few texts the reader leaves to it.
  out = PackInfoPartial(json::strToObject(text), useLimit, now);
}

}  // namespace Ipc
