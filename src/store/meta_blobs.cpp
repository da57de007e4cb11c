// Named values in table "meta": configuration parts and pack contents.

#include <optional>
#include <span>
#include <string>

#include "engine/blob_io.h"
#include "engine/db_exc.h"
#include "engine/db_instances.h"
#include "engine/engine_errors.h"
#include "framework/json.h"
#include "framework/log.h"
#include "store/cached_reads.h"
#include "store/db_local.h"
#include "store/schema.h"

namespace DB {
namespace {

// The least byte string above every string that begins with prefix: the
// prefix without its trailing 0xFF bytes, its last byte then incremented.
// None when nothing is left (every key from the prefix on qualifies).
std::optional<std::string> successor(std::string prefix) {
  while (!prefix.empty() && static_cast<unsigned char>(prefix.back()) == 0xFF) prefix.pop_back();
  if (prefix.empty()) return std::nullopt;
  prefix.back() = static_cast<char>(static_cast<unsigned char>(prefix.back()) + 1);
  return prefix;
}

std::span<std::byte> bytesOf(MemBuffer& buffer) {
  return {reinterpret_cast<std::byte*>(buffer.data()), static_cast<std::size_t>(buffer.size())};
}

}  // namespace

MemBuffer DBLocal::retrieveColumn(const engine::Statement& row, int column) {
  return MemBuffer::copyOf(row.columnBytes(column));
}

MemBuffer DBLocal::readMeta(std::string_view key) {
  auto& s = session();
  auto row = s.prepare(schema::sql::selectMetaValue());
  row.bindBlob(1, key);
  if (!row.step()) return {};
  const std::int64_t size = row.columnInt64(1);
  if (size <= 0) return {};
  if (size <= kInlineValueBytes) return retrieveColumn(row, 2);
  // The live statement keeps its snapshot while the value is streamed, so
  // the length read above is the length of the bytes read below.
  MemBuffer value(static_cast<std::uint64_t>(size));
  engine::readBlob(s, schema::kMetaTable, schema::kBlobColumn, row.columnInt64(0), bytesOf(value));
  return value;
}

void DBLocal::putMeta(std::string_view key, const void* data, std::uint64_t length) {
  auto& s = session();
  const std::string_view value(static_cast<const char*>(data), static_cast<std::size_t>(length));
  if (length <= static_cast<std::uint64_t>(kInlineValueBytes)) {
    auto put = s.prepare(schema::sql::kUpsertMeta);
    put.bindBlob(1, key).bindBlob(2, value);
    put.run();
    return;
  }
  // Room for the value first (a value beyond the engine's length limit
  // fails here with kColumnTooBig), then its bytes, piece by piece.
  std::int64_t rowid = 0;
  {
    auto put = s.prepare(schema::sql::kUpsertMetaReturningRowid);
    put.bindBlob(1, key).bindZeroBlob(2, static_cast<std::int64_t>(length));
    if (!put.step()) throwEngineError(err::kInternalError);
    rowid = put.columnInt64(0);
    put.run();
  }
  engine::writeBlob(s, schema::kMetaTable, schema::kBlobColumn, rowid,
                    std::span(reinterpret_cast<const std::byte*>(value.data()), value.size()));
}

bool DBLocal::deleteMeta(std::string_view key) {
  auto& s = session();
  auto del = s.prepare(schema::sql::kDeleteMeta);
  del.bindBlob(1, key);
  del.run();
  return s.changes() > 0;
}

MemBuffer DBLocal::loadMetaBlob(const std::string& key) {
  MemBuffer value = readMeta(key);
  if (g_LogVerbose) {
    Log::Lock entry(Log::Debug);
    if (value.empty()) {
      entry.logStreamLine() << "DB:loadMetaBlob S:" << sessionId() << " No metadata for key " << key;
    } else {
      entry.logStreamLine() << "DB:loadMetaBlob S:" << sessionId() << " Returning metadata for key " << key
                            << " size: " << value.size();
    }
  }
  return value;
}

DBLocal::CfgText DBLocal::cfgPartText(const std::string& key) {
  session();  // a closed store refuses, hit or not
  ReadCache& cache = pool_->readCache();
  ReadCache::Ticket ticket;
  if (CfgText hit = cache.find(kCachedCfgParts, name_, key, ticket)) {
    if (g_LogVerbose) {
      Log::Lock(Log::Debug).logStreamLine()
          << "DB:cfgPartText S:" << sessionId() << " Cached part for key " << key << " size: " << hit->size();
    }
    return hit;
  }
  const MemBuffer stored = loadMetaBlob(key);
  // Keys are shared with pack contents: bytes that are not a JSON object
  // throw here (json::Exc), and nothing is kept.
  auto text = std::make_shared<const std::string>(
      stored.empty() ? std::string()
                     : json::strToObject(reinterpret_cast<const char*>(stored.data()), stored.size()).dump());
  cache.insert(kCachedCfgParts, ticket, name_, key, text, text->size());
  return text;
}

void DBLocal::saveMetaBlob(const void* data, std::uint64_t length, const std::string& key) {
  const InvalidateOnExit written(pool_->readCache(), name_, key);
  write(length, [&] { putMeta(key, data, length); });
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << "DB:saveMetaBlob S:" << sessionId() << " Stored metadata for key " << key << " size: " << length;
  }
}

bool DBLocal::removeMetaBlob(const std::string& key) {
  const InvalidateOnExit written(pool_->readCache(), name_, key);
  const bool deleted = write(key.size(), [&] { return deleteMeta(key); });
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DB:removeMetaBlob S:" << sessionId() << ' '
                                          << (deleted ? "Deleted metadata for " : "No metadata found for ") << key;
  }
  return deleted;
}

std::vector<std::string> DBLocal::metaBlobsWithPrefix(const std::string& prefix) {
  auto& s = session();
  std::vector<std::string> keys;
  // A range on the primary key, so the listing reads only the keys it
  // returns. Keys are blobs, compared as bytes: "%", "_" and NUL in a
  // prefix are plain bytes.
  const auto upper = successor(prefix);
  auto list = s.prepare(upper ? schema::sql::kMetaKeysInRange : schema::sql::kMetaKeysFrom);
  list.bindBlob(1, prefix);
  if (upper) list.bindBlob(2, *upper);
  while (list.step()) keys.emplace_back(list.columnBytes(0));
  if (g_LogVerbose) {
    Log::Lock entry(Log::Debug);
    if (keys.empty()) {
      entry.logStreamLine() << "DB:metaBlobsWithPrefix S:" << s.id() << " No metadata for prefix " << prefix;
    } else {
      entry.logStreamLine() << "DB:metaBlobsWithPrefix S:" << s.id() << " Found " << keys.size()
                            << " metadata ids for prefix " << prefix;
    }
  }
  return keys;
}

}  // namespace DB
