#pragma once
// DB::ReadCache: what the frequent point reads of the databases returned
// (configuration parts, pack records), kept in this process so that a read
// of a key that nothing wrote since does not reach the engine.
//
// One cache serves every database of a pool (DBInstances owns it): one byte
// budget for all, least recently used entries evicted first. An entry is a
// shared immutable value; a hit hands out a share of it, never a copy made
// under the lock. Values larger than kMaxEntryBytes (or the whole budget)
// are not kept, so that one large part cannot flush everything else.
// A budget of 0 turns the cache off: every call then returns at once.
//
// Freshness. A read never returns a value older than the last write of its
// key that was acknowledged before the read began, whichever connection
// wrote it. Writers call invalidate(db, key) after their commit and before
// they answer (also when the commit failed: its outcome may be unknown,
// and dropping an entry is always safe). A reader that missed holds the
// Ticket its find() gave and inserts what it read only through it.
//
// The race this closes: a reader misses, reads the old value from an
// engine snapshot taken before a writer's commit, and is about to insert
// it when the writer commits and invalidates. Without more, the old value
// would land in the cache after the invalidation and be served until the
// next write. Therefore every key maps to a generation (a counter in one of
// kStripes stripes, chosen by a hash of database and key; keys that share a
// stripe only cost each other an insertion), and invalidate() bumps it in
// the same critical section in which it erases the entries. find() records
// the generation in its ticket under that mutex, before the caller starts
// its engine read; insert() takes the value only if the generation is
// still the recorded one. The argument, all steps ordered by the one mutex:
//   - A reader R takes its ticket at t1, reads, inserts at t3. A writer W
//     commits at c and invalidates at t2 > c.
//   - If t2 < t1, R's engine read began after W's commit had completed, so
//     R read W's value or a newer one: nothing stale.
//   - If t1 < t2 < t3, the generation moved between R's ticket and its
//     insert: the insert is refused.
//   - If t3 < t2, the entry R inserted is erased at t2, before W answers.
// Hence once W has answered, no entry of the key holds a value older than
// W's, and none can be added later. A hit at time t was inserted with a
// ticket taken after the last invalidation before t, so it was read from a
// state that contains every write acknowledged before t.
// dropDatabase() (a restore, a closed instance) works the same way with a
// second counter that every ticket records.
//
// Not covered: writes that do not go through this process (another process
// opening the database file). The server owns its databases; an operator's
// tools must not write them while it runs.
//
// Thread safety: every member may be called from any thread; one mutex,
// held for map lookups, list splices and shared-pointer copies only.
// Values that leave the cache are released after it.

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "framework/thread_annotations.h"

namespace DB {

// The type of value that a kind of entry holds: find and insert of a kind
// take and give only that type. Each kind's index is declared once, by the
// layer that caches it (store/read_cache_kinds.h).
template <class T>
struct CacheKind {
  std::uint8_t index;
};

class ReadCache {
 public:
  static constexpr std::size_t kKinds = 2;
  // Entries larger than this (value, key and bookkeeping) are not kept.
  static constexpr std::uint64_t kMaxEntryBytes = 64 * 1024;
  // What an entry costs beside its value and key: list node, map node,
  // shares; an estimate.
  static constexpr std::uint64_t kEntryOverhead = 160;
  static constexpr std::size_t kStripes = 4096;

  struct Stats {
    std::uint64_t hits = 0;
    std::uint64_t misses = 0;
    std::uint64_t insertions = 0;
    std::uint64_t evictions = 0;      // entries dropped for room
    std::uint64_t invalidations = 0;  // entries erased by writes and drops
    std::uint64_t refused = 0;        // insertions refused: a write came between
    std::uint64_t bytes = 0;
    std::uint64_t entries = 0;
    std::uint64_t capacity = 0;
  };

  // What a find that missed hands on to insert: the generations it saw.
  class Ticket {
   public:
    Ticket() = default;

   private:
    friend class ReadCache;
    bool valid_ = false;
    std::size_t stripe_ = 0;
    std::uint64_t generation_ = 0;
    std::uint64_t drops_ = 0;
  };

  explicit ReadCache(std::uint64_t capacityBytes);
  ~ReadCache();
  ReadCache(const ReadCache&) = delete;
  ReadCache& operator=(const ReadCache&) = delete;

  bool enabled() const noexcept { return capacity_ != 0; }
  std::uint64_t capacity() const noexcept { return capacity_; }

  // The cached value of key in db, or null; on a miss ticket is set for
  // the insert of what the caller then reads.
  template <class T>
  std::shared_ptr<const T> find(CacheKind<T> kind, std::string_view db, std::string_view key, Ticket& ticket) {
    return std::static_pointer_cast<const T>(findAny(kind.index, db, key, ticket));
  }

  // Keeps value (bytes: its size in memory) unless a write of the key or a
  // drop of the database came after the ticket was taken, or it is too
  // large. Never throws: a value that cannot be kept is simply not kept.
  template <class T>
  void insert(CacheKind<T> kind, const Ticket& ticket, std::string_view db, std::string_view key,
              std::shared_ptr<const T> value, std::uint64_t bytes) noexcept {
    insertAny(kind.index, ticket, db, key, std::move(value), bytes);
  }

  // A write of key in db ended (committed, failed or unknown): its entries
  // of every kind go, and readers that started before cannot insert.
  void invalidate(std::string_view db, std::string_view key) noexcept EXCLUDES(mutex_);

  // Every entry of db goes (its file is replaced, or its instance closes),
  // and readers that started before cannot insert.
  void dropDatabase(std::string_view db) noexcept EXCLUDES(mutex_);

  Stats stats() const EXCLUDES(mutex_);

  // For tests: hook runs in every insert of a valid ticket, after the
  // caller's engine read and before the generations are compared (to hold
  // a reader there while a writer commits). Set before the cache is used.
  void setInsertHook(std::function<void()> hook) { insertHook_ = std::move(hook); }

 private:
  struct TextHash {
    using is_transparent = void;
    std::size_t operator()(std::string_view s) const noexcept { return std::hash<std::string_view>{}(s); }
  };
  struct Database;
  struct Node {
    Database* owner;
    std::uint8_t kind;
    std::string key;
    std::shared_ptr<const void> value;
    std::uint64_t bytes;
  };
  using Lru = std::list<Node>;  // most recently used first
  using KeyMap = std::unordered_map<std::string, Lru::iterator, TextHash, std::equal_to<>>;
  struct Database {
    std::string name;
    std::array<KeyMap, kKinds> kinds;
    std::size_t entries = 0;
  };
  using DatabaseMap = std::unordered_map<std::string, std::unique_ptr<Database>, TextHash, std::equal_to<>>;

  std::shared_ptr<const void> findAny(std::uint8_t kind, std::string_view db, std::string_view key, Ticket& ticket)
      EXCLUDES(mutex_);
  void insertAny(std::uint8_t kind, const Ticket& ticket, std::string_view db, std::string_view key,
                 std::shared_ptr<const void> value, std::uint64_t bytes) noexcept EXCLUDES(mutex_);
  static std::size_t stripeOf(std::string_view db, std::string_view key) noexcept;
  // Takes the node out of the maps and moves it to doomed, which the
  // caller releases after the lock.
  void unlink(Lru::iterator node, Lru& doomed) REQUIRES(mutex_);

  const std::uint64_t capacity_;
  const std::uint64_t maxEntry_;
  mutable sys::Mutex mutex_;
  Lru lru_ GUARDED_BY(mutex_);
  DatabaseMap databases_ GUARDED_BY(mutex_);
  std::vector<std::uint64_t> generations_ GUARDED_BY(mutex_);
  std::uint64_t drops_ GUARDED_BY(mutex_) = 0;
  Stats stats_ GUARDED_BY(mutex_);
  std::function<void()> insertHook_;
};

}  // namespace DB
