#pragma once
// Internal to the maintenance layer: the byte layout of the ZIP records the
// archive writer and reader use, little-endian helpers and MS-DOS time
// stamps. Not a public interface.
//
// Thread safety: pure functions, callable from any thread.

#include <chrono>
#include <cstdint>
#include <cstring>
#include <string>

#include "framework/env.h"

namespace maint::zip {

inline constexpr std::uint32_t kLocalHeaderSig = 0x04034b50;
inline constexpr std::uint32_t kCentralHeaderSig = 0x02014b50;
inline constexpr std::uint32_t kEndSig = 0x06054b50;
inline constexpr std::uint32_t kEnd64Sig = 0x06064b50;
inline constexpr std::uint32_t kEnd64LocatorSig = 0x07064b50;
inline constexpr std::uint16_t kZip64ExtraId = 0x0001;
inline constexpr std::uint16_t kVersion = 45;  // ZIP64; host 0 (MS-DOS names with '\')
inline constexpr std::uint16_t kMethodStored = 0;
inline constexpr std::uint16_t kMethodDeflate = 8;
inline constexpr std::size_t kLocalHeaderSize = 30;
inline constexpr std::size_t kCentralHeaderSize = 46;
inline constexpr std::size_t kEndSize = 22;
inline constexpr std::size_t kEnd64Size = 56;
inline constexpr std::size_t kEnd64LocatorSize = 20;

// Result codes in the error texts, as the ZIP library of the original tools
// numbered them, so that texts read the same whichever side wrote them.
inline constexpr int kErrno = -1;
inline constexpr int kBadZipFile = -103;
inline constexpr int kInternalError = -104;
inline constexpr int kCrcError = -105;

inline void put16(std::string& out, std::uint16_t v) {
  out.push_back(static_cast<char>(v & 0xff));
  out.push_back(static_cast<char>(v >> 8));
}
inline void put32(std::string& out, std::uint32_t v) {
  put16(out, static_cast<std::uint16_t>(v & 0xffff));
  put16(out, static_cast<std::uint16_t>(v >> 16));
}
inline void put64(std::string& out, std::uint64_t v) {
  put32(out, static_cast<std::uint32_t>(v & 0xffffffffu));
  put32(out, static_cast<std::uint32_t>(v >> 32));
}
inline std::uint16_t get16(const unsigned char* p) { return static_cast<std::uint16_t>(p[0] | (p[1] << 8)); }
inline std::uint32_t get32(const unsigned char* p) {
  return static_cast<std::uint32_t>(get16(p)) | (static_cast<std::uint32_t>(get16(p + 2)) << 16);
}
inline std::uint64_t get64(const unsigned char* p) {
  return static_cast<std::uint64_t>(get32(p)) | (static_cast<std::uint64_t>(get32(p + 4)) << 32);
}

// The time as local time packed as MS-DOS date (high 16 bits) and time (low
// 16 bits), two-second resolution; clamped to the format's years 1980-2107.
std::uint32_t toDosDateTime(sys::WallClock::time_point when);
// The reverse, as local time; the daylight-saving rule in force at that date
// decides the offset, so a time packed in summer comes back unchanged.
sys::WallClock::time_point fromDosDateTime(std::uint32_t dosDateTime);

}  // namespace maint::zip
