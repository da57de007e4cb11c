#include "engine/read_cache.h"

#include <algorithm>
#include <utility>

namespace DB {

ReadCache::ReadCache(std::uint64_t capacityBytes)
    : capacity_(capacityBytes),
      maxEntry_(std::min(kMaxEntryBytes, capacityBytes)),
      generations_(capacityBytes == 0 ? 0 : kStripes, 0) {
  stats_.capacity = capacityBytes;
}

ReadCache::~ReadCache() = default;

std::size_t ReadCache::stripeOf(std::string_view db, std::string_view key) noexcept {
  const std::size_t h = std::hash<std::string_view>{}(key) ^ (std::hash<std::string_view>{}(db)*0x9E3779B97F4A7C15ull);
  return h % kStripes;
}

std::shared_ptr<const void> ReadCache::findAny(std::uint8_t kind, std::string_view db, std::string_view key,
                                               Ticket& ticket) {
  ticket = Ticket();
  if (!enabled() || kind >= kKinds) return nullptr;
  const std::size_t stripe = stripeOf(db, key);
  sys::MutexLock lock(mutex_);
  if (const auto d = databases_.find(db); d != databases_.end()) {
    const KeyMap& keys = d->second->kinds[kind];
    if (const auto found = keys.find(key); found != keys.end()) {
      lru_.splice(lru_.begin(), lru_, found->second);
      ++stats_.hits;
      return found->second->value;
    }
  }
  ++stats_.misses;
  ticket.valid_ = true;
  ticket.stripe_ = stripe;
  ticket.generation_ = generations_[stripe];
  ticket.drops_ = drops_;
  return nullptr;
}

void ReadCache::insertAny(std::uint8_t kind, const Ticket& ticket, std::string_view db, std::string_view key,
                          std::shared_ptr<const void> value, std::uint64_t bytes) noexcept {
  if (!ticket.valid_ || kind >= kKinds) return;
  const std::uint64_t cost = bytes + key.size() * 2 + kEntryOverhead;
  if (cost > maxEntry_) return;
  if (insertHook_) insertHook_();
  Lru doomed;  // evicted entries, released after the lock
  try {
    sys::MutexLock lock(mutex_);
    if (generations_[ticket.stripe_] != ticket.generation_ || drops_ != ticket.drops_) {
      ++stats_.refused;
      return;
    }
    auto d = databases_.find(db);
    if (d == databases_.end()) {
      auto fresh = std::make_unique<Database>();
      fresh->name.assign(db);
      d = databases_.emplace(fresh->name, std::move(fresh)).first;
    }
    Database& database = *d->second;
    KeyMap& keys = database.kinds[kind];
    if (const auto found = keys.find(key); found != keys.end()) {
      // Another reader of the same state was first: both values are as
      // fresh, the one there stays.
      lru_.splice(lru_.begin(), lru_, found->second);
      return;
    }
    Lru fresh;
    fresh.push_back(Node{&database, kind, std::string(key), std::move(value), cost});
    keys.emplace(fresh.front().key, fresh.begin());  // on a throw, fresh takes the node along
    lru_.splice(lru_.begin(), fresh);
    ++database.entries;
    stats_.bytes += cost;
    ++stats_.insertions;
    while (stats_.bytes > capacity_) {
      unlink(std::prev(lru_.end()), doomed);
      ++stats_.evictions;
    }
  } catch (...) {
    // Out of memory for the bookkeeping (a database record made for the
    // entry stays, empty, until the database is dropped): the value is
    // simply not kept.
  }
}

void ReadCache::unlink(Lru::iterator node, Lru& doomed) {
  Database* owner = node->owner;
  owner->kinds[node->kind].erase(node->key);
  stats_.bytes -= node->bytes;
  doomed.splice(doomed.end(), lru_, node);
  if (--owner->entries == 0) {
    const auto d = databases_.find(owner->name);
    if (d != databases_.end()) databases_.erase(d);
  }
}

void ReadCache::invalidate(std::string_view db, std::string_view key) noexcept {
  if (!enabled()) return;
  const std::size_t stripe = stripeOf(db, key);
  Lru doomed;  // released after the lock
  sys::MutexLock lock(mutex_);
  ++generations_[stripe];
  const auto d = databases_.find(db);
  if (d == databases_.end()) return;
  Database& database = *d->second;
  for (KeyMap& keys : database.kinds) {
    const auto found = keys.find(key);
    if (found == keys.end()) continue;
    // The last entry takes its database record along: look no further.
    const bool last = database.entries == 1;
    ++stats_.invalidations;
    unlink(found->second, doomed);
    if (last) break;
  }
}

void ReadCache::dropDatabase(std::string_view db) noexcept {
  if (!enabled()) return;
  Lru doomed;  // released after the lock, with the record
  std::unique_ptr<Database> gone;
  sys::MutexLock lock(mutex_);
  ++drops_;
  const auto d = databases_.find(db);
  if (d == databases_.end()) return;
  gone = std::move(d->second);
  databases_.erase(d);
  for (KeyMap& keys : gone->kinds) {
    for (auto& entry : keys) {
      stats_.bytes -= entry.second->bytes;
      ++stats_.invalidations;
      doomed.splice(doomed.end(), lru_, entry.second);
    }
  }
}

ReadCache::Stats ReadCache::stats() const {
  sys::MutexLock lock(mutex_);
  Stats out = stats_;
  out.entries = lru_.size();
  return out;
}

}  // namespace DB
