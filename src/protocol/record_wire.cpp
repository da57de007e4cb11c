#include "protocol/record_wire.h"

#include <algorithm>
#include <limits>

namespace Ipc::wirefmt {
namespace {

// Smallest encodings, used to refuse counts the payload cannot hold before
// anything is reserved.
constexpr std::uint64_t kMinUseSize = 4 + 4 + 4 + 4 + 8;
constexpr std::uint64_t kMinPackSize = 4 + 1 + 4;

// A present string that equals the absent marker would silently turn into
// an absent field; it is refused as malformed instead.
std::string presentString(wire::Reader& in, const char* what) {
  std::string s = in.str();
  if (s == PackInfoPartial::STR_INVALID)
    throw wire::DecodeError(std::string(what) + " holds the reserved absent marker");
  return s;
}

// Texts that the server keeps inside a JSON record must be UTF-8; anything
// else is refused as malformed, naming the field, before a command runs.
std::string utf8(std::string s, const char* what) {
  if (!json::isUtf8(s)) throw wire::DecodeError(std::string(what) + " is not valid UTF-8");
  return s;
}

std::int32_t presentLong(wire::Reader& in, const char* what) {
  const std::int32_t v = in.i32();
  if (v == PackInfoPartial::LONG_INVALID)
    throw wire::DecodeError(std::string(what) + " holds the reserved absent marker");
  return v;
}

std::int64_t presentTime(wire::Reader& in, const char* what) {
  const std::int64_t v = in.i64();
  if (v == PackInfoPartial::TIME_INVALID)
    throw wire::DecodeError(std::string(what) + " holds the reserved absent marker");
  return v;
}

// The bytes writePackInfo writes for p.
std::size_t encodedSize(const PackInfo& p) {
  std::size_t n = 4 + p.id().size() + 1 + 4;
  if (p.folderValid()) n += 4 + p.folder().size();
  if (p.statusValid()) n += 4;
  if (p.name != PackInfoPartial::STR_INVALID) n += 4 + p.name.size();
  if (p.owner != PackInfoPartial::STR_INVALID) n += 4 + p.owner.size();
  if (p.created != PackInfoPartial::TIME_INVALID) n += 8;
  if (p.modified != PackInfoPartial::TIME_INVALID) n += 8;
  if (p.docCount != PackInfoPartial::LONG_INVALID) n += 4;
  for (const UseInfo& u : p.uses) n += kMinUseSize + u.host.size() + u.user.size();
  return n;
}

}  // namespace

void writeJson(wire::Writer& out, const json::Value& v) {
  out.boolean(!v.empty());
  if (!v.empty()) out.str(v.dump());
}

json::Value readJson(wire::Reader& in) {
  if (!in.boolean()) return {};
  return json::strToValue(in.strView());
}

void writeUse(wire::Writer& out, const UseInfo& u) {
  out.i32(u.state);
  out.str(u.host);
  out.str(u.user);
  out.u32(u.process);
  out.i64(u.time);
}

UseInfo readUse(wire::Reader& in) {
  UseInfo u;
  u.state = static_cast<UseInfo::State>(in.i32());
  u.host = utf8(in.str(), "use entry host");
  u.user = utf8(in.str(), "use entry user");
  u.process = in.u32();
  u.time = in.i64();
  return u;
}

void writePackInfo(wire::Writer& out, const PackInfo& p) {
  std::uint8_t bits = 0;
  if (p.folderValid()) bits |= kFolder;
  if (p.statusValid()) bits |= kStatus;
  if (p.name != PackInfoPartial::STR_INVALID) bits |= kName;
  if (p.owner != PackInfoPartial::STR_INVALID) bits |= kOwner;
  if (p.created != PackInfoPartial::TIME_INVALID) bits |= kCreated;
  if (p.modified != PackInfoPartial::TIME_INVALID) bits |= kModified;
  if (p.docCount != PackInfoPartial::LONG_INVALID) bits |= kDocCount;

  out.str(p.id());
  out.u8(bits);
  if (bits & kFolder) out.str(p.folder());
  if (bits & kStatus) out.i32(p.status());
  if (bits & kName) out.str(p.name);
  if (bits & kOwner) out.str(p.owner);
  if (bits & kCreated) out.i64(p.created);
  if (bits & kModified) out.i64(p.modified);
  if (bits & kDocCount) out.i32(p.docCount);
  if (p.uses.size() > std::numeric_limits<std::uint32_t>::max())
    throw std::length_error("use list too long for the wire");
  out.u32(static_cast<std::uint32_t>(p.uses.size()));
  for (const UseInfo& u : p.uses) writeUse(out, u);
}

PackInfo readPackInfo(wire::Reader& in) {
  PackInfo p(in.str());
  const std::uint8_t bits = in.u8();
  if (bits & ~kKnownPackFields) throw wire::DecodeError("pack record has unknown field bits " + std::to_string(bits));
  if (bits & kFolder) p.setFolder(presentString(in, "pack folder"));
  if (bits & kStatus) p.setStatus(presentLong(in, "pack status"));
  if (bits & kName) p.name = utf8(presentString(in, "pack name"), "pack name");
  if (bits & kOwner) p.owner = utf8(presentString(in, "pack owner"), "pack owner");
  if (bits & kCreated) p.created = presentTime(in, "pack creation time");
  if (bits & kModified) p.modified = presentTime(in, "pack modification time");
  if (bits & kDocCount) p.docCount = presentLong(in, "pack document count");
  const std::uint32_t count = in.u32();
  if (static_cast<std::uint64_t>(count) * kMinUseSize > in.left()) {
    throw wire::DecodeError("use list of " + std::to_string(count) + " entries runs past the end of the message");
  }
  for (std::uint32_t i = 0; i < count; ++i) p.uses.append(readUse(in));
  return p;
}

void writeOptPackInfo(wire::Writer& out, const PackInfoPtr& p) {
  out.boolean(p != nullptr);
  if (p) writePackInfo(out, *p);
}

PackInfoPtr readOptPackInfo(wire::Reader& in) {
  if (!in.boolean()) return nullptr;
  return std::make_shared<PackInfo>(readPackInfo(in));
}

void writePackInfos(wire::Writer& out, const PackInfos& list) {
  if (list.size() > std::numeric_limits<std::uint32_t>::max())
    throw std::length_error("pack list too long for the wire");
  // A listing runs to megabytes: sized once, the answer is not copied over
  // and over as it grows.
  std::size_t size = 4;
  for (const PackInfo& p : list) size += encodedSize(p);
  out.buffer().reserve(out.buffer().size() + size);
  out.u32(static_cast<std::uint32_t>(list.size()));
  for (const PackInfo& p : list) writePackInfo(out, p);
}

PackInfosPtr readPackInfos(wire::Reader& in) {
  const std::uint32_t count = in.u32();
  if (static_cast<std::uint64_t>(count) * kMinPackSize > in.left()) {
    throw wire::DecodeError("pack list of " + std::to_string(count) + " records runs past the end of the message");
  }
  auto list = std::make_shared<PackInfos>();
  // The count is the peer's claim: reserve no more than a modest amount
  // up front, so that a small message cannot make us reserve much memory.
  list->reserve(std::min<std::uint32_t>(count, 256));
  for (std::uint32_t i = 0; i < count; ++i) list->push_back(readPackInfo(in));
  return list;
}

}  // namespace Ipc::wirefmt
