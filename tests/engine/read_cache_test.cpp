// The read cache on its own: hits share the kept value, the byte budget
// with least-recently-used eviction and the per-entry cap, a budget of 0,
// and the generations that keep a read which began before a write from
// being kept after it. Readers and writers at once run through the real
// server (tests/e2e/cached_reads_e2e_test.cpp).

#include "engine/read_cache.h"

#include <gtest/gtest.h>

#include <string>

namespace {

using DB::CacheKind;
using DB::ReadCache;

constexpr CacheKind<std::string> kText{0};
constexpr CacheKind<int> kNumber{1};

std::shared_ptr<const std::string> text(std::string s) { return std::make_shared<const std::string>(std::move(s)); }

// A miss followed by the insert of value, as a reader does it.
void fill(ReadCache& cache, const std::string& db, const std::string& key, const std::string& value,
          std::uint64_t bytes = 100) {
  ReadCache::Ticket ticket;
  ASSERT_EQ(cache.find(kText, db, key, ticket), nullptr) << key;
  cache.insert(kText, ticket, db, key, text(value), bytes);
}

std::string cached(ReadCache& cache, const std::string& db, const std::string& key) {
  ReadCache::Ticket ticket;
  const auto hit = cache.find(kText, db, key, ticket);
  return hit ? *hit : "(none)";
}

TEST(ReadCache, KeepsValuesApartByDatabaseKindAndKey) {
  ReadCache cache(1 << 20);
  fill(cache, "a", "k", "a/k");
  fill(cache, "b", "k", "b/k");
  ReadCache::Ticket ticket;
  EXPECT_EQ(cache.find(kNumber, "a", "k", ticket), nullptr);
  cache.insert(kNumber, ticket, "a", "k", std::make_shared<const int>(7), 4);

  EXPECT_EQ(cached(cache, "a", "k"), "a/k");
  EXPECT_EQ(cached(cache, "b", "k"), "b/k");
  EXPECT_EQ(*cache.find(kNumber, "a", "k", ticket), 7);
  // A hit hands out the kept value itself, not a copy.
  EXPECT_EQ(cache.find(kText, "a", "k", ticket).get(), cache.find(kText, "a", "k", ticket).get());

  // A write of the key drops it in every kind, in its database only.
  cache.invalidate("a", "k");
  EXPECT_EQ(cached(cache, "a", "k"), "(none)");
  EXPECT_EQ(cache.find(kNumber, "a", "k", ticket), nullptr);
  EXPECT_EQ(cached(cache, "b", "k"), "b/k");

  const auto s = cache.stats();
  EXPECT_EQ(s.insertions, 3u);
  EXPECT_EQ(s.invalidations, 2u);
  EXPECT_EQ(s.entries, 1u);
  EXPECT_GE(s.hits, 4u);
}

TEST(ReadCache, StaysWithinItsBudgetEvictingTheLeastRecentlyUsed) {
  // Room for four entries of 1000 bytes with their keys and bookkeeping.
  const std::uint64_t entry = 1000 + 2 * 2 + ReadCache::kEntryOverhead;
  ReadCache cache(4 * entry + entry / 2);
  for (const char* key : {"k1", "k2", "k3", "k4"}) fill(cache, "db", key, key, 1000);
  EXPECT_EQ(cached(cache, "db", "k1"), "k1");  // k2 is now the oldest

  fill(cache, "db", "k5", "k5", 1000);
  EXPECT_EQ(cached(cache, "db", "k2"), "(none)");
  for (const char* key : {"k1", "k3", "k4", "k5"}) EXPECT_EQ(cached(cache, "db", key), key);

  // Every database counts against the one budget.
  fill(cache, "other", "k6", "k6", 1000);
  EXPECT_EQ(cached(cache, "db", "k1"), "(none)");
  const auto s = cache.stats();
  EXPECT_EQ(s.evictions, 2u);
  EXPECT_EQ(s.entries, 4u);
  EXPECT_EQ(s.bytes, 4 * entry);
  EXPECT_LE(s.bytes, s.capacity);
}

TEST(ReadCache, ValuesBeyondTheEntryCapAreNotKept) {
  ReadCache cache(64 << 20);
  fill(cache, "db", "small", "s", 10);
  fill(cache, "db", "big", "b", ReadCache::kMaxEntryBytes);
  EXPECT_EQ(cached(cache, "db", "big"), "(none)");
  EXPECT_EQ(cached(cache, "db", "small"), "s");  // and nothing was flushed for it

  // A budget below the cap caps entries at the budget.
  ReadCache tiny(4096);
  fill(tiny, "db", "k", "v", 4096);
  EXPECT_EQ(cached(tiny, "db", "k"), "(none)");
  fill(tiny, "db", "k", "v", 100);
  EXPECT_EQ(cached(tiny, "db", "k"), "v");
}

TEST(ReadCache, ABudgetOfZeroKeepsNothing) {
  ReadCache cache(0);
  EXPECT_FALSE(cache.enabled());
  fill(cache, "db", "k", "v");
  EXPECT_EQ(cached(cache, "db", "k"), "(none)");
  cache.invalidate("db", "k");
  cache.dropDatabase("db");
  const auto s = cache.stats();
  EXPECT_EQ(s.hits + s.misses + s.insertions + s.entries + s.bytes, 0u);
}

TEST(ReadCache, AReadThatBeganBeforeAWriteIsNotKeptAfterIt) {
  ReadCache cache(1 << 20);
  ReadCache::Ticket before;
  ASSERT_EQ(cache.find(kText, "db", "k", before), nullptr);
  // The reader has read "old"; the writer commits "new" and invalidates.
  cache.invalidate("db", "k");
  cache.insert(kText, before, "db", "k", text("old"), 3);
  EXPECT_EQ(cached(cache, "db", "k"), "(none)");
  EXPECT_EQ(cache.stats().refused, 1u);

  // A read that began after the write is kept.
  fill(cache, "db", "k", "new");
  EXPECT_EQ(cached(cache, "db", "k"), "new");

  // A drop of the database refuses reads of it that began before.
  ReadCache::Ticket beforeDrop;
  ASSERT_EQ(cache.find(kText, "db", "other", beforeDrop), nullptr);
  cache.dropDatabase("db");
  EXPECT_EQ(cached(cache, "db", "k"), "(none)");
  cache.insert(kText, beforeDrop, "db", "other", text("old"), 3);
  EXPECT_EQ(cached(cache, "db", "other"), "(none)");
  EXPECT_EQ(cache.stats().bytes, 0u);

  // A ticket of a hit (or of none) keeps nothing.
  ReadCache::Ticket none;
  cache.insert(kText, none, "db", "k", text("x"), 1);
  EXPECT_EQ(cached(cache, "db", "k"), "(none)");
}

}  // namespace
