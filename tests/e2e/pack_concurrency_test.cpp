// Several client programs on the same pack at once, over loopback: the
// upload lock has one winner, the edit register lists exactly the open
// editors, concurrent writers lose no update, and readers never see a
// record and a content of two different saves. Each test prints how long
// it ran and how many transactions the server had to retry.

#include <gtest/gtest.h>
#include <jansson.h>
#include <sqlite3.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <iostream>
#include <latch>
#include <mutex>
#include <set>
#include <thread>

#include "client/client.h"
#include "support/server_process.h"

namespace {

using namespace std::chrono_literals;
using Ipc::PackInfo;
using Ipc::UseInfo;
using testing_support::ServerOptions;
using testing_support::ServerProcess;
using Clock = std::chrono::steady_clock;

const char* const kServer = CVDB_SERVER_PATH;
const char* const kTool = CVDB_TOOL_PATH;
constexpr const char* kTerminating = "Terminating client connection due to processing error";
constexpr const char* kLocked = "Attept to lock for upload a pack which is already locked from another host.";
constexpr const char* kRetry = "Transaction::retry";

// Verbose, so that every retry of a transaction shows in the log.
ServerOptions verbose() {
  ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "ExtraLog": true})";
  return o;
}

std::unique_ptr<cvdb::Client> connectedTo(const ServerProcess& server, const std::string& db) {
  cvdb::ClientOptions o;
  o.port = server.port();
  o.ioTimeout = 30s;
  auto c = std::make_unique<cvdb::Client>(o);
  EXPECT_TRUE(c->connect(db));
  return c;
}

PackInfo complete(const std::string& id, std::int32_t status, const std::string& name) {
  Ipc::PackInfoPartial p;
  p.name = name;
  p.owner = "anna";
  p.created = 1700000000;
  p.modified = 1700000100;
  p.docCount = 2;
  return PackInfo(id, "race", status, p);
}

SharedMemBuffer bytes(const std::string& text) { return SharedMemBuffer(MemBuffer::copyOf(text)); }

// Lines written before a later line of the server are in its output once
// that later line is: a fresh read that logs a known line marks the point.
void settleLog(ServerProcess& server, const std::string& db, const std::string& marker) {
  auto c = connectedTo(server, db);
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
    for (int i = 0; i < kRacers; ++i) clients.push_back(connectedTo(server, "Race"));
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
    const auto seen = connectedTo(server, "Race")->getPack(id);
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

// The use entries of a record printed by cvdb --json, as (host, process).
using Editors = std::multiset<std::pair<std::string, std::int64_t>>;
Editors editorsIn(const std::string& output) {
  const json::Object record = json::strToObject(output);
  Editors out;
  const json::Value uses = record.get("uses");
  for (std::size_t i = 0; i < json_array_size(uses.get()); ++i) {
    const json::Object e(json::Value::borrow(json_array_get(uses.get(), i)));
    EXPECT_EQ(e.get("state"), json::Value::string("OpenForEdit"));
    out.emplace(e.get("host").asString(), e.get("process").asInteger());
  }
  return out;
}

TEST(PackConcurrency, ProcessesOpeningAndClosingAtOnceAreListedExactly) {
  ServerProcess server(kServer, verbose());
  connectedTo(server, "Edit")->savePack(complete("P", 1, "shared"), bytes("content"));
  constexpr int kEditors = 8;
  const auto editor = [](int i) { return std::make_pair("ws-" + std::to_string(i), std::int64_t{500 + i}); };
  Editors all;
  for (int i = 0; i < kEditors; ++i) all.insert(editor(i));

  // Every editor is a cvdb process of its own; each prints the record as
  // its request left it.
  const auto runAll = [&](const char* flag) {
    std::vector<Editors> answers(kEditors);
    std::vector<std::thread> processes;
    for (int i = 0; i < kEditors; ++i) {
      processes.emplace_back([&, i] {
        const auto r = ServerProcess::run(
            kTool, {"--port", std::to_string(server.port()), "--db", "Edit", "--json", "pack", "get", "P", flag,
                    "--host", editor(i).first, "--process", std::to_string(editor(i).second), "-o", "/dev/null"});
        EXPECT_EQ(r.status, 0) << r.output;
        if (r.status == 0) answers[i] = editorsIn(r.output);
      });
    }
    for (auto& t : processes) t.join();
    return answers;
  };
  const auto began = Clock::now();

  // The requests are applied one after another: each answer holds its own
  // entry and those applied before it, so the sizes are 1 to N, each once.
  const auto opened = runAll("--open-for-edit");
  std::vector<std::size_t> sizes;
  for (int i = 0; i < kEditors; ++i) {
    EXPECT_EQ(opened[i].count(editor(i)), 1u) << i;
    EXPECT_TRUE(std::includes(all.begin(), all.end(), opened[i].begin(), opened[i].end())) << i;
    sizes.push_back(opened[i].size());
  }
  std::sort(sizes.begin(), sizes.end());
  for (int i = 0; i < kEditors; ++i) EXPECT_EQ(sizes[i], static_cast<std::size_t>(i + 1));
  auto c = connectedTo(server, "Edit");
  Editors listed;
  const auto afterOpening = c->packInfo("P");
  for (const UseInfo& u : afterOpening->uses) listed.emplace(u.host, u.process);
  EXPECT_EQ(listed, all);

  // Closing: each answer lacks its own entry, and the sizes are N-1 to 0.
  const auto closed = runAll("--close");
  sizes.clear();
  for (int i = 0; i < kEditors; ++i) {
    EXPECT_EQ(closed[i].count(editor(i)), 0u) << i;
    sizes.push_back(closed[i].size());
  }
  std::sort(sizes.begin(), sizes.end());
  for (int i = 0; i < kEditors; ++i) EXPECT_EQ(sizes[i], static_cast<std::size_t>(i));
  const auto took = Clock::now() - began;
  EXPECT_TRUE(c->packInfo("P")->uses.empty());

  // No use key is left in the stored object.
  sqlite3* raw = nullptr;
  const auto file = server.home() / "db" / "edit" / "cvdb.edb";
  ASSERT_EQ(sqlite3_open_v2(file.c_str(), &raw, SQLITE_OPEN_READONLY, nullptr), SQLITE_OK);
  sqlite3_stmt* s = nullptr;
  ASSERT_EQ(sqlite3_prepare_v2(raw, "SELECT blob FROM info WHERE id = CAST('P' AS BLOB)", -1, &s, nullptr), SQLITE_OK);
  ASSERT_EQ(sqlite3_step(s), SQLITE_ROW);
  const std::string stored(static_cast<const char*>(sqlite3_column_blob(s, 0)),
                           static_cast<std::size_t>(sqlite3_column_bytes(s, 0)));
  sqlite3_finalize(s);
  sqlite3_close(raw);
  EXPECT_FALSE(json::strToObject(stored).has("uses")) << stored;
  EXPECT_EQ(json::strToObject(stored).get("name"), json::Value::string("shared"));

  settleLog(server, "Edit", "marker");
  report("8 editors opening, then closing, as processes", took, server.countLogLines(kRetry));
}

// The content that a save with this name stores: long enough to be
// streamed, and tied to the name so that a reader can tell whether record
// and content come from the same save.
std::string contentFor(const std::string& name) {
  std::string s = name + '|';
  while (s.size() < 80 * 1024) s += name;
  return s;
}

TEST(PackConcurrency, ConcurrentSavesAndUpdatesLoseNothingAndReadersSeeWholeSaves) {
  ServerProcess server(kServer, verbose());
  constexpr int kWriters = 8;
  constexpr int kRounds = 30;
  connectedTo(server, "Busy")->savePack(complete("P", 0, "start"), bytes(contentFor("start")));

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
      auto c = connectedTo(server, "Busy");
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
      auto c = connectedTo(server, "Busy");
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
  const auto final = connectedTo(server, "Busy")->getPack("P");
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

  settleLog(server, "Busy", "marker");
  const std::size_t retries = server.countLogLines(kRetry);
  report("8 writers x 30 saves and updates of one pack, 2 readers", took, retries);
  std::cout << "[ measure  ] " << reads.load() << " reads of the pack meanwhile" << std::endl;
  // Writers queue on the database's write lock instead of colliding.
  EXPECT_EQ(retries, 0u);
}

}  // namespace
