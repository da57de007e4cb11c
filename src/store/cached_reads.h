#pragma once
// What the store keeps in the pool's ReadCache (engine/read_cache.h), and
// the guard with which every write of a key drops it.
//
//   kCachedCfgParts    key of "meta" -> the compact JSON text that a read of
//                      the configuration part answers ("" for no part)
//   kCachedPackRecords id of "info" -> the stored record with its whole use
//                      list (none for no record); the use-list time limit is
//                      applied on every read, hit or miss, so a hit answers
//                      exactly what a miss would at that moment
//
// Keys of "meta" are shared by configuration parts and pack contents, so a
// write of either table drops the key's entries of both kinds.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "engine/read_cache.h"
#include "protocol/pack_info.h"

namespace DB {

inline constexpr CacheKind<std::string> kCachedCfgParts{0};
inline constexpr CacheKind<std::optional<Ipc::PackInfo>> kCachedPackRecords{1};

// The memory a cached record takes, roughly: its strings and use entries.
std::uint64_t cachedBytes(const std::optional<Ipc::PackInfo>& record) noexcept;

// Drops the cached reads of key when the scope of its write ends, whether
// the write committed, failed or threw: a failed commit may still have
// reached the file, and dropping is always safe. Declared right before the
// write, so that the drop comes after it and before the answer.
class InvalidateOnExit {
 public:
  InvalidateOnExit(ReadCache& cache, std::string_view db, std::string_view key) noexcept
      : cache_(cache), db_(db), key_(key) {}
  ~InvalidateOnExit() { cache_.invalidate(db_, key_); }
  InvalidateOnExit(const InvalidateOnExit&) = delete;
  InvalidateOnExit& operator=(const InvalidateOnExit&) = delete;

 private:
  ReadCache& cache_;
  const std::string_view db_;
  const std::string_view key_;
};

}  // namespace DB
