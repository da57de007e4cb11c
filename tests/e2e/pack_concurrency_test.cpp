// Several client programs on the same pack at once, over loopback: the
// upload lock has one winner, the edit register lists exactly the open
// editors, concurrent writers lose no update, and readers never see a
// record and a content of two different saves. Each test prints how long
// it ran and how many transactions the server had to retry.

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <iostream>
#include <latch>
#include <mutex>
#include <set>
#include <thread>

#include "e2e_support.h"
#include "support/raw_db.h"

namespace {

using namespace e2e;
using Ipc::PackInfo;
using Ipc::UseInfo;
using testing_support::ServerOptions;
using Clock = std::chrono::steady_clock;

constexpr const char* kLocked = "Attept to lock for upload a pack which is already locked from another host.";
constexpr const char* kRetry = "Transaction::retry";

// Verbose, so that every retry of a transaction shows in the log.
ServerOptions verbose() {
  ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "ExtraLog": true})";
  return o;
}

PackInfo complete(const std::string& id, std::int32_t status, const std::string& name) {
  return e2e::complete(id, "race", status, name);
}

// Lines written before a later line of the server are in its output once
// that later line is: a fresh read that logs a known line marks the point.
void settleLog(ServerProcess& server, const std::string& db, const std::string& marker) {
  auto c = clientOf(server, db);
  c->packInfo(marker);
  ASSERT_TRUE(server.waitForLogLine("Can not find info for " + marker));
}

void report(const char* what, Clock::duration took, std::size_t retries) {
  const auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(took).count();
  std::cout << "[ measure  ] " << what << ": " << ms << " ms, " << retries << " transaction retries" << std::endl;
  ::testing::Test::RecordProperty(std::string(what) + " ms", static_cast<int>(ms));
  ::testing::Test::RecordProperty(std::string(what) + " retries", static_cast<int>(retries));
}

TEST(PackConcurrency, ExactlyOneHostWinsTheUploadLockAndTheRefusedLeaveNoTrace) {
  ServerProcess server(kServer, verbose());
  constexpr int kRacers = 16;
  constexpr int kRounds = 5;
  Clock::duration racing{};
  for (int round = 0; round < kRounds; ++round) {
    const std::string id = "race-" + std::to_string(round);
    std::vector<std::unique_ptr<cvdb::Client>> clients;
    for (int i = 0; i < kRacers; ++i) clients.push_back(clientOf(server, "Race"));
    // Each racer would create the pack, with fields and content of its
    // own, and take its lock in the same request.
    std::vector<int> won(kRacers, -1);
    std::latch start(kRacers + 1);
    std::vector<std::thread> racers;
    for (int i = 0; i < kRacers; ++i) {
      racers.emplace_back([&, i] {
        const std::string host = "host-" + std::to_string(i);
        PackInfo request = complete(id, i, "by " + host);
        request.uses.append(UseInfo(UseInfo::LockForUpload, host, "u", 100 + i));
        const SharedMemBuffer content = bytes("content of " + host);
        start.arrive_and_wait();
        try {
          clients[i]->savePack(request, content);
          won[i] = 1;
        } catch (const cvdb::ConnectionEnded& e) {
          won[i] = e.reason() == kTerminating ? 0 : -1;
        }
      });
    }
    const auto began = Clock::now();
    start.arrive_and_wait();
    for (auto& t : racers) t.join();
    racing += Clock::now() - began;

    ASSERT_EQ(std::count(won.begin(), won.end(), -1), 0) << "a racer ended for another reason";
    ASSERT_EQ(std::count(won.begin(), won.end(), 1), 1);
    const int w = static_cast<int>(std::find(won.begin(), won.end(), 1) - won.begin());
    const std::string winner = "host-" + std::to_string(w);
    const auto seen = clientOf(server, "Race")->getPack(id);
    ASSERT_NE(seen.info, nullptr);
    EXPECT_EQ(*seen.info, [&] {
      PackInfo expected = complete(id, w, "by " + winner);
      expected.uses = seen.info->uses;
      return expected;
    }());
    EXPECT_EQ(seen.content.view(), "content of " + winner);
    ASSERT_EQ(seen.info->uses.size(), 1u);
    EXPECT_EQ(seen.info->uses[0].host, winner);
    EXPECT_EQ(seen.info->uses[0].state, UseInfo::LockForUpload);
  }
  settleLog(server, "Race", "marker");
  EXPECT_EQ(server.countLogLines(std::string("Dispatching command SavePack failed with ") + kLocked),
            static_cast<std::size_t>(kRounds * (kRacers - 1)));
  report("upload lock race, 5 rounds of 16 hosts", racing, server.countLogLines(kRetry));
}

// The content that a save with this name stores: long enough to be
// streamed, and tied to the name so that a reader can tell whether record
// and content come from the same save.
std::string contentFor(const std::string& name) {
  std::string s = name + '|';
  while (s.size() < 80 * 1024) s += name;
  return s;
}

TEST(PackConcurrency, ConcurrentSavesUpdatesAndClosesLoseNothingAndReadersSeeWholeSaves) {
  ServerProcess server(kServer, verbose());
  constexpr int kWriters = 8;
  constexpr int kRounds = 30;
  clientOf(server, "Busy")->savePack(complete("P", 0, "start"), bytes(contentFor("start")));

  // Every write also opens the pack for a distinct (host, process): a lost
  // update would lose an entry of the list, which every write reads,
  // changes and writes back.
  std::mutex m;
  std::vector<std::size_t> updateSizes;
  std::atomic<int> writing{kWriters};
  std::atomic<int> reads{0}, torn{0};
  std::latch start(kWriters + 2 + 1);
  std::vector<std::thread> threads;
  for (int w = 0; w < kWriters; ++w) {
    threads.emplace_back([&, w] {
      auto c = clientOf(server, "Busy");
      start.arrive_and_wait();
      for (int r = 0; r < kRounds; ++r) {
        PackInfo p("P");
        p.setStatus(w * 1000 + r);
        p.uses.append(UseInfo(UseInfo::OpenForEdit, "w-" + std::to_string(w), "u", static_cast<std::uint32_t>(r)));
        if (r % 2 == 0) {
          p.name = std::to_string(w) + ":" + std::to_string(r);
          c->savePack(p, bytes(contentFor(p.name)));
        } else {
          const auto answer = c->updatePackInfo(p);
          std::lock_guard lock(m);
          updateSizes.push_back(answer->uses.size());
        }
      }
      --writing;
    });
  }
  for (int reader = 0; reader < 2; ++reader) {
    threads.emplace_back([&] {
      auto c = clientOf(server, "Busy");
      start.arrive_and_wait();
      while (writing > 0) {
        const auto seen = c->getPack("P");
        ++reads;
        if (!seen.info || seen.content.view() != contentFor(seen.info->name)) ++torn;
      }
    });
  }
  const auto began = Clock::now();
  start.arrive_and_wait();
  for (auto& t : threads) t.join();
  const auto took = Clock::now() - began;

  EXPECT_EQ(torn.load(), 0) << "of " << reads.load() << " reads";
  const auto final = clientOf(server, "Busy")->getPack("P");
  ASSERT_NE(final.info, nullptr);
  std::set<std::pair<std::string, std::uint32_t>> entries;
  for (const UseInfo& u : final.info->uses) entries.emplace(u.host, u.process);
  EXPECT_EQ(final.info->uses.size(), static_cast<std::size_t>(kWriters * kRounds));
  EXPECT_EQ(entries.size(), static_cast<std::size_t>(kWriters * kRounds));
  // Each update saw every write before it: no two saw the same list size.
  std::sort(updateSizes.begin(), updateSizes.end());
  EXPECT_EQ(std::adjacent_find(updateSizes.begin(), updateSizes.end()), updateSizes.end());
  // The last write of some writer is the state that stayed.
  EXPECT_EQ(final.info->status() % 1000, kRounds - 1);
  EXPECT_EQ(final.content.view(), contentFor(final.info->name));

  // Every writer closes its entries again, all at once, through fetches:
  // each answer lacks its own entry, and the list sizes are N-1 to 0, each
  // once.
  std::vector<std::size_t> closeSizes;
  threads.clear();
  for (int w = 0; w < kWriters; ++w) {
    threads.emplace_back([&, w] {
      auto c = clientOf(server, "Busy");
      for (std::uint32_t r = 0; r < kRounds; ++r) {
        const auto answer = c->getPack("P", UseInfo(UseInfo::CloseEdit, "w-" + std::to_string(w), "u", r)).info;
        std::lock_guard lock(m);
        closeSizes.push_back(answer->uses.size());
      }
    });
  }
  for (auto& t : threads) t.join();
  std::sort(closeSizes.begin(), closeSizes.end());
  for (std::size_t i = 0; i < closeSizes.size(); ++i) ASSERT_EQ(closeSizes[i], i);
  // No use key is left in the stored object, and the record is intact.
  const json::Object stored = json::strToObject(*testing_support::RawDb(server.home() / "db" / "busy" / "cvdb.edb")
                                                     .value("SELECT blob FROM info WHERE id = CAST('P' AS BLOB)"));
  EXPECT_FALSE(stored.has("uses")) << stored.dump();
  EXPECT_EQ(stored.get("name"), json::Value::string(final.info->name));

  settleLog(server, "Busy", "marker");
  const std::size_t retries = server.countLogLines(kRetry);
  report("8 writers x 30 saves and updates of one pack, 2 readers, then 240 closes", took, retries);
  std::cout << "[ measure  ] " << reads.load() << " reads of the pack meanwhile" << std::endl;
  // Writers queue on the database's write lock instead of colliding.
  EXPECT_EQ(retries, 0u);
}

}  // namespace
