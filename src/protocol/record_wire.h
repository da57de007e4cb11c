#pragma once
// Wire encodings of the values that command payloads share: JSON values and
// pack records. docs/protocol.md describes them byte for byte.
//
// Readers throw wire::DecodeError on malformed input (and json::Exc for JSON
// text that does not parse); they never read past the payload and never
// allocate more than the payload can hold. Thread safety: none needed; the
// functions touch only their arguments.

#include <cstdint>
#include <string>
#include <vector>

#include "framework/json.h"
#include "framework/wire.h"
#include "protocol/pack_info.h"

namespace Ipc::wirefmt {

// Optional JSON value: u8 present (0 or 1), then, when present, its compact
// text as a string. An empty json::Value is "not present".
void writeJson(wire::Writer& out, const json::Value& v);
json::Value readJson(wire::Reader& in);

// Use entry: i32 state, str host, str user, u32 process, i64 time.
void writeUse(wire::Writer& out, const UseInfo& u);
UseInfo readUse(wire::Reader& in);

// Bits of the presence byte of a pack record, one per optional field, in
// the order in which present fields follow.
enum PackField : std::uint8_t {
  kFolder = 1u << 0,
  kStatus = 1u << 1,
  kName = 1u << 2,
  kOwner = 1u << 3,
  kCreated = 1u << 4,
  kModified = 1u << 5,
  kDocCount = 1u << 6,
};
inline constexpr std::uint8_t kKnownPackFields = 0x7F;

// Pack record: str id, u8 presence bits, the present fields in bit order,
// u32 use count, the use entries.
void writePackInfo(wire::Writer& out, const PackInfo& p);
PackInfo readPackInfo(wire::Reader& in);

// Optional pack record: u8 present, then the record when present.
void writeOptPackInfo(wire::Writer& out, const PackInfoPtr& p);
PackInfoPtr readOptPackInfo(wire::Reader& in);

// List of pack records: u32 count, then the records.
void writePackInfos(wire::Writer& out, const PackInfos& list);
PackInfosPtr readPackInfos(wire::Reader& in);

}  // namespace Ipc::wirefmt
