#pragma once
// The read path of stored pack records: the stored JSON text of a record
// straight into PackInfoPartial, without building a JSON tree.
//
// Listings read thousands of records and want only six fields of each;
// building a jansson tree of every record (one allocation per value) was
// most of a listing's time. The reader here streams the text through a SAX
// parser and keeps only what PackInfoPartial holds.
//
// It belongs to the store, not to the wire protocol: it is how rows are
// stored, and clients never read it.
//
// The result is exactly that of PackInfoPartial(json::strToObject(text),
// useLimit, now) for every text, refusals included: values of the wrong type
// read as absent, malformed use entries and entries older than the limit
// are dropped, unknown keys are skipped, the last of duplicate keys wins,
// and whatever jansson refuses (not one JSON object, trailing bytes,
// invalid UTF-8, an integer beyond 64 bits, nesting deeper than jansson's
// limit, ...) is refused. A refused text is handed to jansson, so the
// json::Exc thrown carries jansson's own message, as before.
//
// Writes keep going through jansson (json::Object): they must keep the keys
// this version does not know.
//
// Thread safety: no shared state.
// Failures: json::Exc for a text jansson refuses, std::bad_alloc.

#include <cstdint>
#include <string_view>

#include "protocol/pack_info.h"

namespace Ipc {

// Overwrites every field of out's partial part (name, owner, created,
// modified, docCount, uses) with those of the stored text. On a throw, out
// holds some mix of old and new values.
void readStoredPackInfo(std::string_view text, std::uint64_t useLimit, std::int64_t now, PackInfoPartial& out);

inline PackInfoPartial readStoredPackInfo(std::string_view text, std::uint64_t useLimit, std::int64_t now) {
  PackInfoPartial out;
  readStoredPackInfo(text, useLimit, now, out);
  return out;
}

// The streaming reader alone, without the fallback to jansson: false when
// it refuses the text. It refuses everything jansson refuses, and a few
// texts jansson takes: reals close to the double's range, which the parser
// does not decide the way strtod does, and texts with a raw NUL byte (no
// writer stores one; jansson skips one right after a number or a literal).
// The caller then asks jansson.
// Exposed for the differential tests and the fuzz target.
bool tryReadStoredPackInfo(std::string_view text, std::uint64_t useLimit, std::int64_t now, PackInfoPartial& out);

}  // namespace Ipc
