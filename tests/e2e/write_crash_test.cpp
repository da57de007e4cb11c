// Writes cut short at random moments. Each round lets writers run on the
// real server over several databases (configuration parts, data files,
// pack saves, and databases created on the way), kills the server with
// SIGKILL after a random delay (every fourth round also the next start,
// while it recovers and sweeps), starts it again on the same database root
// and checks that
//   - every acknowledged write reads back whole: the value is the
//     acknowledged one, or the writer's one later write whose answer never
//     came (that write may or may not have happened, but never in part);
//   - every database file passes SQLite's integrity check;
//   - once the start-up sweep has logged its end, no temporary file of a
//     data-file write is left anywhere below the root.
//
// Each writer owns its keys, so the only value a key may hold besides its
// last acknowledged one is the writer's write in flight at the kill.
//
// CVDB_CRASH_ROUNDS sets the number of rounds (20 by default);
// CVDB_CRASH_SEED replays the random choices of an earlier run, whose seed
// the test prints first; with CVDB_CRASH_KEEP_GOING=1 a failing round does
// not end the run, so that a long run counts every failure.
// tests/soak/write-crash-soak.sh runs hundreds of rounds.

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <iostream>
#include <map>
#include <optional>
#include <random>
#include <thread>

#include "e2e_support.h"
#include "settings/names.h"
#include "support/raw_db.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using namespace e2e;
using Clock = std::chrono::steady_clock;
using Ms = std::chrono::milliseconds;
using testing_support::RawDb;
using testing_support::ServerOptions;
using testing_support::TempDir;

constexpr int kWriters = 4;
const char* const kHomes[] = {"load\\alpha", "load\\beta", "load\\gamma"};
// Both lines the start-up sweep ends with contain this.
constexpr const char* kSweepEnded = "data-file writes";

// The content of write number seq: its number first, then bytes that
// follow from it, so that a read tells which write it is and whether it is
// whole. Sizes from a few bytes to a few hundred KiB.
std::string contentOf(std::uint64_t seq, std::size_t maxBytes) {
  const std::string head = "seq " + std::to_string(seq) + "\n";
  const std::size_t size = std::mt19937_64(seq)() % maxBytes;
  return head + randomBytes(size, seq * 7919);
}
// The write number a content starts with; none when it does not.
std::optional<std::uint64_t> seqOf(std::string_view content) {
  if (!content.starts_with("seq ")) return std::nullopt;
  const auto end = content.find('\n');
  if (end == std::string_view::npos) return std::nullopt;
  try {
    return std::stoull(std::string(content.substr(4, end - 4)));
  } catch (const std::exception&) {
    return std::nullopt;
  }
}

json::Object partOf(std::uint64_t seq) {
  return json::strToObject(R"({"seq":)" + std::to_string(seq) + R"(,"pad":")" + std::string(seq % 200, 'x') + "\"}");
}

// What a key may hold: its last acknowledged write and the write whose
// answer never came.
struct Slot {
  std::optional<std::uint64_t> acked;
  std::optional<std::uint64_t> pending;
};

enum class Kind { Cfg, Data, Pack, NewDb };

struct Key {
  Kind kind;
  std::string db;    // the database it lives in (for NewDb, the new one)
  std::string name;  // cfg key, "id/file", pack id
  Slot slot;
};

// One writer: its own client, its own keys in its home database, and the
// databases it creates.
struct Writer {
  int index = 0;
  std::string home;
  std::vector<Key> keys;  // the new databases are added as they are tried
  std::uint64_t seq = 0;  // its writes are numbered index, index + kWriters, ...
  int created = 0;
  std::uint64_t acks = 0;
  std::string failure;  // a write that failed before the kill
};

class WriteCrash : public ::testing::Test {
 protected:
  void SetUp() override {
    rounds_ = static_cast<int>(envNumber("CVDB_CRASH_ROUNDS").value_or(20));
    seed_ = envNumber("CVDB_CRASH_SEED").value_or(std::random_device{}());
    std::cout << "[ write crash ] " << rounds_ << " rounds, seed " << seed_ << " (CVDB_CRASH_SEED=" << seed_
              << " replays the random choices)" << std::endl;
    RecordProperty("seed", std::to_string(seed_));
    rng_.seed(seed_);
    for (int w = 0; w < kWriters; ++w) {
      Writer& wr = writers_[w];
      wr.index = w;
      wr.seq = static_cast<std::uint64_t>(w);
      wr.home = kHomes[w % std::size(kHomes)];
      const std::string tag = "w" + std::to_string(w);
      for (int j = 0; j < 4; ++j) wr.keys.push_back({Kind::Cfg, wr.home, tag + "-part" + std::to_string(j), {}});
      for (int j = 0; j < 4; ++j) {
        wr.keys.push_back(
            {Kind::Data, wr.home, tag + "-doc" + std::to_string(j / 2) + "/page" + std::to_string(j % 2), {}});
      }
      for (int j = 0; j < 3; ++j) wr.keys.push_back({Kind::Pack, wr.home, tag + "P" + std::to_string(j), {}});
    }
    fs::create_directories(root());
    const auto began = Clock::now();
    server_ = start();
    startup_ = std::chrono::duration_cast<Ms>(Clock::now() - began);
    auto c = clientOf(*server_);
    for (const char* home : kHomes) ASSERT_TRUE(c->connect(home)) << home;
  }

  fs::path root() const { return dir_ / "db"; }
  ServerOptions options() const {
    ServerOptions o;
    o.configJson = R"({"ServerPort": 0, "DBRoot": ")" + root().string() + R"(/"})";
    return o;
  }
  std::unique_ptr<ServerProcess> start() { return std::make_unique<ServerProcess>(kServer, options()); }

  // One write of the writer, chosen at random; its key's slot says whether
  // it was acknowledged.
  static void writeOne(cvdb::Client& c, Writer& w, std::mt19937_64& gen) {
    const auto pick = gen() % 16;
    w.seq += kWriters;
    const std::uint64_t seq = w.seq;
    if (pick == 15) {
      // A new database, acknowledged with its first part.
      const std::string name = "load\\new-" + std::to_string(w.index) + "-" + std::to_string(w.created++);
      w.keys.push_back({Kind::NewDb, name, "born", {std::nullopt, seq}});
      Key& k = w.keys.back();
      if (!c.connect(name)) throw std::runtime_error("cannot create " + name);
      c.setCfg("born", partOf(seq));
      k.slot = {seq, std::nullopt};
      ++w.acks;
      if (!c.connect(w.home)) throw std::runtime_error("cannot reconnect to " + w.home);
      return;
    }
    const Kind kind = pick < 6 ? Kind::Cfg : pick < 11 ? Kind::Data : Kind::Pack;
    std::vector<Key*> ofKind;
    for (auto& k : w.keys) {
      if (k.kind == kind) ofKind.push_back(&k);
    }
    Key& k = *ofKind[gen() % ofKind.size()];
    k.slot.pending = seq;
    switch (kind) {
      case Kind::Cfg:
        c.setCfg(k.name, partOf(seq));
        break;
      case Kind::Data: {
        const auto slash = k.name.find('/');
        c.setData(k.name.substr(0, slash), k.name.substr(slash + 1), bytes(contentOf(seq, 384 << 10)));
        break;
      }
      case Kind::Pack:
        c.savePack(complete(k.name, "inbox", 1, "seq " + std::to_string(seq)), bytes(contentOf(seq, 64 << 10)));
        break;
      case Kind::NewDb:
        break;
    }
    k.slot = {seq, std::nullopt};
    ++w.acks;
  }

  // Runs the writers for delay, then kills the server; each writer ends at
  // its first failure, which must come from the kill.
  void runWriters(Ms delay) {
    std::atomic<bool> killed{false};
    std::vector<std::thread> threads;
    for (auto& w : writers_) {
      threads.emplace_back([this, &w, &killed, gen = std::mt19937_64(rng_())]() mutable {
        try {
          auto c = clientOf(*server_, w.home);
          for (;;) writeOne(*c, w, gen);
        } catch (const std::exception& e) {
          if (!killed) w.failure = e.what();
        }
      });
    }
    std::this_thread::sleep_for(delay);  // the kill's random moment
    killed = true;
    EXPECT_EQ(server_->stop(SIGKILL), 128 + SIGKILL);
    for (auto& t : threads) t.join();
  }

  // The write number the key holds now through the client; none when it
  // holds nothing. A value that is no whole write of this key fails.
  std::optional<std::uint64_t> readKey(cvdb::Client& c, const Key& k) {
    switch (k.kind) {
      case Kind::Cfg:
      case Kind::NewDb: {
        const json::Value v = c.getCfg(k.name);
        if (v.empty() || !v.isObject()) return std::nullopt;
        const auto seq = static_cast<std::uint64_t>(json::Object(v).get("seq").asInteger());
        EXPECT_EQ(v.dump(), partOf(seq).dump()) << k.name;
        return seq;
      }
      case Kind::Data: {
        const auto slash = k.name.find('/');
        const auto content = c.getData(k.name.substr(0, slash), k.name.substr(slash + 1));
        if (content.empty()) return std::nullopt;
        const auto seq = seqOf(content.view());
        if (!seq || content.view() != contentOf(*seq, 384 << 10)) {
          ADD_FAILURE() << k.db << " " << k.name << ": " << content.size() << " bytes that are no whole write";
          return std::nullopt;
        }
        return seq;
      }
      case Kind::Pack: {
        const auto fetched = c.getPack(k.name);
        if (!fetched.info) return std::nullopt;
        const auto seq = seqOf(fetched.content.view());
        if (!seq || fetched.content.view() != contentOf(*seq, 64 << 10) ||
            fetched.info->name != "seq " + std::to_string(*seq)) {
          ADD_FAILURE() << k.db << " " << k.name << ": a pack that is no whole save (named \"" << fetched.info->name
                        << "\")";
          return std::nullopt;
        }
        return seq;
      }
    }
    return std::nullopt;
  }

  // Every key of every writer against what it may hold; afterwards what it
  // holds is its acknowledged value.
  void checkWrites() {
    auto c = clientOf(*server_);
    for (auto& w : writers_) {
      for (auto& k : w.keys) {
        SCOPED_TRACE(k.db + " " + k.name);
        std::optional<std::uint64_t> now;
        const auto bound = c->connect(k.db, 1);
        if (!bound && k.kind != Kind::NewDb) ADD_FAILURE() << bound.error;
        if (bound) now = readKey(*c, k);
        const bool fine = now == k.slot.acked || (now && now == k.slot.pending);
        if (!fine) {
          ++lost_;
          ADD_FAILURE() << "holds " << (now ? "write " + std::to_string(*now) : std::string("nothing"))
                        << ", acknowledged " << (k.slot.acked ? std::to_string(*k.slot.acked) : std::string("none"))
                        << ", in flight " << (k.slot.pending ? std::to_string(*k.slot.pending) : std::string("none"));
        }
        if (k.slot.pending && now == k.slot.pending) ++inFlightLanded_;
        if (now) k.slot.acked = now;
        k.slot.pending.reset();
      }
    }
  }

  // Files below the root whose name marks them as temporary: data-file
  // writes (.cvtmp.) and database creations (.creating).
  std::vector<std::string> temporaryFiles(std::string_view marker) const {
    std::vector<std::string> out;
    for (const auto& e : fs::recursive_directory_iterator(root())) {
      const std::string name = e.path().filename().string();
      if (name.find(marker) != std::string::npos) out.push_back(fs::relative(e.path(), root()).string());
    }
    return out;
  }

  void checkIntegrity() {
    for (const auto& e : fs::recursive_directory_iterator(root())) {
      if (e.path().filename() != "cvdb.edb") continue;
      ++files_;
      try {
        RawDb raw(e.path());
        const auto verdict = raw.value("PRAGMA integrity_check");
        if (verdict != "ok") {
          ++integrityFailures_;
          ADD_FAILURE() << e.path() << ": " << verdict.value_or("(no answer)");
        }
      } catch (const std::exception& ex) {
        ++integrityFailures_;
        ADD_FAILURE() << e.path() << ": " << ex.what();
      }
    }
  }

  void round(int n) {
    const Ms delay{std::uniform_int_distribution<std::int64_t>(0, 1000)(rng_)};
    const bool killStart = rng_() % 4 == 0;
    const Ms startDelay{std::uniform_int_distribution<std::int64_t>(0, startup_.count())(rng_)};
    std::string what = "kill " + std::to_string(delay.count()) + " ms into the writes";
    if (killStart) what += ", the next start killed after " + std::to_string(startDelay.count()) + " ms";
    SCOPED_TRACE("round " + std::to_string(n) + " of seed " + std::to_string(seed_) + ": " + what);

    const auto acksBefore = acks();
    runWriters(delay);
    for (auto& w : writers_) {
      EXPECT_EQ(w.failure, "") << "writer " << w.index << " failed before the kill";
      w.failure.clear();
    }
    const auto leftBehind = temporaryFiles(DB::kDataTempPrefix).size();
    if (killStart) {
      ServerOptions o = options();
      o.waitUntilListening = false;
      ServerProcess starting(kServer, o);
      std::this_thread::sleep_for(startDelay);  // the kill's random moment
      starting.stop(SIGKILL);
      EXPECT_EQ(starting.countLogLines("Critical"), 0u);
    }
    server_ = start();
    ASSERT_TRUE(server_->waitForLogLine(kSweepEnded, std::chrono::seconds(60)));
    EXPECT_EQ(server_->countLogLines("Critical"), 0u);
    const auto temps = temporaryFiles(DB::kDataTempPrefix);
    tempsLeft_ += temps.size();
    EXPECT_EQ(temps, std::vector<std::string>{}) << "after the start-up sweep";
    creatingLeft_ = temporaryFiles(".creating").size();
    checkIntegrity();
    checkWrites();
    std::cout << "[ write crash ] round " << n << ": " << what << ": " << acks() - acksBefore
              << " writes acknowledged, " << leftBehind << " temporary file(s) left by the kill" << std::endl;
  }

  std::uint64_t acks() const {
    std::uint64_t n = 0;
    for (const auto& w : writers_) n += w.acks;
    return n;
  }

  void summary() const {
    std::cout << "[ write crash ] seed " << seed_ << ", " << rounds_ << " rounds: " << acks()
              << " writes acknowledged, " << lost_ << " lost, " << inFlightLanded_ << " unanswered writes found whole, "
              << integrityFailures_ << " integrity failures in " << files_ << " database checks, " << tempsLeft_
              << " temporary files left after the sweep, " << creatingLeft_
              << " creation leftovers (.creating) at the end" << std::endl;
  }

  TempDir dir_;
  std::unique_ptr<ServerProcess> server_;
  Writer writers_[kWriters];
  int rounds_ = 0;
  std::uint64_t seed_ = 0;
  std::mt19937_64 rng_;
  Ms startup_{0};
  std::uint64_t lost_ = 0;
  std::uint64_t inFlightLanded_ = 0;
  std::uint64_t integrityFailures_ = 0;
  std::uint64_t files_ = 0;
  std::uint64_t tempsLeft_ = 0;
  std::size_t creatingLeft_ = 0;
};

TEST_F(WriteCrash, EveryAcknowledgedWriteSurvivesAKillAtAnyMoment) {
  for (int n = 1; n <= rounds_ && !HasFatalFailure(); ++n) {
    round(n);
    if (HasFailure() && !envNumber("CVDB_CRASH_KEEP_GOING")) break;
  }
  summary();
}

}  // namespace
