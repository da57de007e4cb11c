// Reads of configuration parts and pack records through the real server,
// whose read cache must never answer a value older than the last write
// acknowledged to any client before the read was sent: writers and
// readers at once on the same keys, and a read after a restore.

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <latch>
#include <string>
#include <thread>
#include <vector>

#include "e2e_support.h"

namespace {

using namespace e2e;

constexpr int kKeysPerWriter = 2;
constexpr int kWritesPerWriter = 150;

std::string keyOf(int writer, int i) { return "w" + std::to_string(writer) + "-" + std::to_string(i); }

// The sequence number a part or a record carries; 0 for none.
std::int64_t seqOfPart(const json::Value& v) { return v.isObject() ? json::Object(v).get("seq").asInteger() : 0; }
std::int64_t seqOfRecord(const Ipc::PackInfoPtr& p) { return p ? p->docCount : 0; }

// Each writer owns its keys (so that acknowledged numbers only grow) and
// writes sequence numbers to them in turn: writers 0 and 1 parts, 2 and 3
// pack records. Each reader, before it sends a read, notes the last number
// acknowledged for the key; the answer must carry at least that number.
TEST(CachedReadsE2E, NoReadAnswersOlderThanTheLastAcknowledgedWrite) {
  ServerProcess server(kServer);
  constexpr int kWriters = 4;
  constexpr int kReaders = 6;
  std::array<std::array<std::atomic<std::int64_t>, kKeysPerWriter>, kWriters> acked{};
  std::atomic<int> writing{kWriters};
  std::atomic<int> stale{0};
  std::atomic<std::uint64_t> reads{0};
  std::latch start(kWriters + kReaders);

  std::vector<std::thread> threads;
  for (int w = 0; w < kWriters; ++w) {
    threads.emplace_back([&, w] {
      auto c = clientOf(server, "Cached");
      start.arrive_and_wait();
      for (std::int64_t seq = 1; seq <= kWritesPerWriter; ++seq) {
        const int i = static_cast<int>(seq % kKeysPerWriter);
        if (w < 2) {
          json::Object part;
          part.set("seq", json::Value::integer(seq));
          c->setCfg(keyOf(w, i), part);
        } else {
          Ipc::PackInfo record = complete(keyOf(w, i), "f", 1, "n");
          record.docCount = static_cast<std::int32_t>(seq);
          c->updatePackInfo(record);
        }
        acked[w][i].store(seq);
      }
      --writing;
    });
  }
  for (int r = 0; r < kReaders; ++r) {
    threads.emplace_back([&, r] {
      auto c = clientOf(server, "Cached");
      start.arrive_and_wait();
      for (int n = r; writing.load() > 0; ++n) {
        const int w = n % kWriters;
        const int i = (n / kWriters) % kKeysPerWriter;
        const std::int64_t floor = acked[w][i].load();
        const std::int64_t got = w < 2 ? seqOfPart(c->getCfg(keyOf(w, i))) : seqOfRecord(c->packInfo(keyOf(w, i)));
        if (got < floor) {
          ++stale;
          ADD_FAILURE() << keyOf(w, i) << ": read " << got << " after " << floor << " was acknowledged";
        }
        ++reads;
      }
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(stale.load(), 0);
  EXPECT_GT(reads.load(), 0u);
  // And the last write of each key is what a read now answers.
  auto c = clientOf(server, "Cached");
  for (int w = 0; w < kWriters; ++w) {
    for (int i = 0; i < kKeysPerWriter; ++i) {
      const std::int64_t got = w < 2 ? seqOfPart(c->getCfg(keyOf(w, i))) : seqOfRecord(c->packInfo(keyOf(w, i)));
      EXPECT_EQ(got, acked[w][i].load()) << keyOf(w, i);
    }
  }
}

TEST(CachedReadsE2E, AReadAfterARestoreAnswersTheRestoredValue) {
  ServerProcess server(kServer);
  auto c = clientOf(server, "Restored");
  json::Object part;
  part.set("v", json::Value::string("backed up"));
  c->setCfg("layout", part);
  c->updatePackInfo(complete("P1", "f", 1, "backed up"));
  c->backup("", false);
  part.set("v", json::Value::string("later"));
  c->setCfg("layout", part);
  c->updatePackInfo(complete("P1", "f", 1, "later"));
  // Read twice: the second answer comes from the cache.
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(json::Object(c->getCfg("layout")).get("v").asString(), "later");
    EXPECT_EQ(c->packInfo("P1")->name, "later");
  }
  c->restore("", false);
  EXPECT_EQ(json::Object(c->getCfg("layout")).get("v").asString(), "backed up");
  EXPECT_EQ(c->packInfo("P1")->name, "backed up");
}

}  // namespace
