// Restores cut short at random moments. Each round starts a restore on the
// real server (of one database, or of a folder of archives with --all),
// kills the server with SIGKILL after a random delay (every fourth round
// also the next start, while it recovers), starts it again on the same
// database root, and checks that every database holds exactly what it held
// before the restore or exactly what its archive holds (read back through
// the client and from its data folder), that a restore that answered
// success has committed, that its database file passes SQLite's integrity
// check, and that nothing of the restore is left behind. A few rounds stop
// the server with SIGTERM instead: it must end cleanly, with the same
// guarantees.
//
// CVDB_CRASH_ROUNDS sets the number of rounds (20 killed, 4 stopped by
// default); CVDB_CRASH_SEED replays the random moments of an earlier run,
// whose seed each test prints first. tests/soak/restore-crash-soak.sh runs
// 200 rounds.

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <iostream>
#include <map>
#include <mutex>
#include <optional>
#include <random>
#include <set>
#include <thread>

#include "e2e_support.h"
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

// Everything one database holds, as text: configuration parts, pack
// records and contents, data files read through the client, and the files
// of its data folder on disk. Two states are the same database content
// exactly when their maps are equal.
using State = std::map<std::string, std::string>;

std::string digest(std::string_view bytes) {
  return std::to_string(bytes.size()) + ":" + std::to_string(std::hash<std::string_view>{}(bytes));
}

// Text that compresses about four to one.
std::string textBytes(std::size_t n, std::uint64_t seed) {
  static const char* const words[] = {"invoice ", "page ", "total ", "scanned ", "line\n", "42 ", "customer "};
  std::mt19937_64 gen(seed);
  std::string out;
  while (out.size() < n) out += words[gen() % std::size(words)];
  out.resize(n);
  return out;
}

// How much a database holds; the content itself follows from the numbers.
struct Shape {
  int parts;              // configuration parts "layout-NN"
  int packs;              // packs "PNN", each with a content of packBytes
  std::size_t packBytes;  //
  int docs;               // data ids "doc-NN", each with three files
  std::size_t pageBytes;  // the largest "page.tif"
};

// The data files a database of this shape may hold in either state.
std::vector<std::pair<std::string, std::string>> dataNames(const Shape& s) {
  std::vector<std::pair<std::string, std::string>> out;
  for (int i = 0; i < s.docs + 4; ++i) {
    const std::string id = "doc-" + std::to_string(i);
    for (const char* file : {"page.tif", "text.txt", "thumb.png"}) out.emplace_back(id, file);
  }
  return out;
}

Ipc::PackInfo packRecord(const std::string& id, std::int32_t status, const std::string& name) {
  return complete(id, status % 2 ? "inbox" : "done", status, name);
}

// State A: every part, pack and data file of the shape; salt tells
// databases apart.
void writeA(cvdb::Client& c, const Shape& s, std::uint64_t salt) {
  for (int i = 0; i < s.parts; ++i) {
    c.setCfg("layout-" + std::to_string(i),
             json::strToObject(R"({"state":"A","n":)" + std::to_string(i) + R"(,"pages":[1,2,3]})"));
  }
  for (int i = 0; i < s.packs; ++i) {
    const std::string id = "P" + std::to_string(i);
    c.savePack(packRecord(id, i % 3, "pack " + id), bytes(randomBytes(s.packBytes, salt + 100 + i)));
  }
  for (int i = 0; i < s.docs; ++i) {
    const std::string id = "doc-" + std::to_string(i);
    const std::size_t page = s.pageBytes / 6 + (s.pageBytes * 5 / 6) * static_cast<std::size_t>(i % 4) / 3;
    c.setData(id, "page.tif", bytes(randomBytes(page, salt + 200 + i)));
    c.setData(id, "text.txt", bytes(textBytes(page / 3 + 1000, salt + 300 + i)));
    c.setData(id, "thumb.png", bytes(randomBytes(4096, salt + 400 + i)));
  }
}

// State B: A with every kind of change: parts changed, removed and added,
// packs changed, erased and added, data files rewritten and added.
void changeToB(cvdb::Client& c, const Shape& s, std::uint64_t salt) {
  for (int i = 0; i < s.parts; i += 3) {
    c.setCfg("layout-" + std::to_string(i), json::strToObject(R"({"state":"B","n":)" + std::to_string(i) + "}"));
  }
  for (int i = 1; i < s.parts; i += 4) c.deleteCfg("layout-" + std::to_string(i));
  for (int i = 0; i < 3; ++i) c.setCfg("extra-" + std::to_string(i), json::strToObject(R"({"state":"B"})"));
  for (int i = 0; i < s.packs; i += 3) {
    const std::string id = "P" + std::to_string(i);
    c.savePack(packRecord(id, 7, "changed " + id), bytes(randomBytes(s.packBytes / 2, salt + 500 + i)));
  }
  for (int i = 1; i < s.packs; i += 4) c.erasePack("P" + std::to_string(i));
  for (int i = 0; i < 2; ++i) {
    const std::string id = "Q" + std::to_string(i);
    c.savePack(packRecord(id, 1, "new " + id), bytes(randomBytes(s.packBytes, salt + 600 + i)));
  }
  for (int i = 0; i < s.docs; i += 2) {
    c.setData("doc-" + std::to_string(i), "page.tif", bytes(randomBytes(s.pageBytes / 2, salt + 700 + i)));
  }
  for (int i = s.docs; i < s.docs + 4; ++i) {
    c.setData("doc-" + std::to_string(i), "page.tif", bytes(randomBytes(s.pageBytes / 4, salt + 800 + i)));
  }
}

State readState(cvdb::Client& c, const Shape& s, const fs::path& folder) {
  State st;
  std::string ids;
  for (const auto& id : c.cfgIds("")) ids += id + " ";
  st["ids"] = ids;
  for (const char* prefix : {"layout-", "extra-"}) {
    for (const auto& id : c.cfgIds(prefix)) st["cfg " + id] = c.getCfg(id).dump();
  }
  for (const auto& p : c.packInfos()) {
    const auto fetched = c.getPack(p.id());
    st["pack " + p.id()] = p.folder() + "|" + std::to_string(p.status()) + "|" + p.name + "|" + p.owner + "|" +
                           std::to_string(p.created) + "|" + std::to_string(p.modified) + "|" +
                           std::to_string(p.docCount) + "|" + digest(fetched.content.view());
  }
  for (const auto& [id, file] : dataNames(s)) {
    const auto content = c.getData(id, file);
    st["data " + id + "/" + file] = content.empty() ? "absent" : digest(content.view());
  }
  std::error_code ec;
  for (auto it = fs::recursive_directory_iterator(folder / "d", ec); it != fs::recursive_directory_iterator(); ++it) {
    const std::string rel = fs::relative(it->path(), folder).string();
    st["disk " + rel] = it->is_directory() ? "<folder>" : digest(testing_support::readFile(it->path()));
  }
  return st;
}

// The first few entries in which two states differ.
std::string differences(const State& got, const State& want) {
  std::set<std::string> keys;
  for (const auto& [k, v] : got) keys.insert(k);
  for (const auto& [k, v] : want) keys.insert(k);
  std::string out;
  int shown = 0;
  for (const auto& k : keys) {
    const auto g = got.find(k);
    const auto w = want.find(k);
    const std::string gv = g == got.end() ? "(none)" : g->second;
    const std::string wv = w == want.end() ? "(none)" : w->second;
    if (gv == wv) continue;
    if (++shown > 6) {
      out += "  ...\n";
      break;
    }
    out += "  " + k + ": has " + gv + ", expected " + wv + "\n";
  }
  return out;
}

struct Database {
  std::string name;
  std::string backupFile;  // the archive's name in each state's backup folder
  Shape shape;
  bool restoredByAll;  // an archive of it lies in the state folders
  State states[2];     // A and B
  int current = 1;     // the state it holds between rounds
};

// What the restore thread saw.
struct Attempt {
  std::mutex mutex;
  std::condition_variable changed;
  std::optional<Clock::time_point> placing;  // "Metadata restore started..." arrived
  bool finished = false;
  bool succeeded = false;
  std::string error;  // how the restore failed, other than by the connection ending
  std::string ended;  // how the connection ended
};

// Three databases: the main one, which every round restores, with some MB
// of data files and packs (unpacking and placing them takes long enough
// for kills to land inside); a second one that restores of the folder
// (--all) restore with it; and one that no restore names.
class RestoreCrash : public ::testing::Test {
 protected:
  RestoreCrash()
      : dbs_{
            {"crash\\main", "crash_main.cvbak", {20, 24, 96 << 10, 16, 384 << 10}, true, {}},
            {"crash\\second", "crash_second.cvbak", {6, 4, 32 << 10, 4, 64 << 10}, true, {}},
            {"bystander", "bystander.cvbak", {4, 2, 8 << 10, 2, 16 << 10}, false, {}},
        } {}

  // Reads the round count and the seed, builds both states of every
  // database with their archives (the main database ends in state B), and
  // times one clean restore of each kind.
  void prepare(int defaultRounds) {
    rounds_ = static_cast<int>(envNumber("CVDB_CRASH_ROUNDS").value_or(defaultRounds));
    seed_ = envNumber("CVDB_CRASH_SEED").value_or(std::random_device{}());
    std::cout << "[ restore crash ] " << rounds_ << " rounds, seed " << seed_ << " (CVDB_CRASH_SEED=" << seed_
              << " replays the kill moments)" << std::endl;
    RecordProperty("seed", std::to_string(seed_));
    rng_.seed(seed_);

    const auto began = Clock::now();
    server_ = start();
    startup_ = std::chrono::duration_cast<Ms>(Clock::now() - began);
    auto c = clientOf(*server_);
    for (std::size_t i = 0; i < dbs_.size(); ++i) {
      Database& d = dbs_[i];
      ASSERT_TRUE(c->connect(d.name));
      writeA(*c, d.shape, i * 1000);
      d.states[0] = readState(*c, d.shape, folderOf(d));
      if (d.restoredByAll) c->backup("A/", false);
      // The archive of the main database alone, for the single restores.
      if (i == 0) c->backup("single/", false);
      changeToB(*c, d.shape, i * 1000);
      d.states[1] = readState(*c, d.shape, folderOf(d));
      if (d.restoredByAll) c->backup("B/", false);
      ASSERT_NE(d.states[0], d.states[1]);
    }
    c.reset();
    // The single restores go to state A with the main database's own
    // archive, back to B with a copy of B's.
    fs::create_directories(root() / "db.backup" / "singleB");
    fs::copy_file(root() / "db.backup" / "B" / main().backupFile, root() / "db.backup" / "singleB" / main().backupFile);

    // Calibration: one clean restore of each kind, timed as a whole and
    // from the moment the archive's database file starts to be placed.
    for (const bool all : {false, true}) {
      auto restorer = clientOf(*server_, main().name);
      const int to = all ? 1 : 0;
      Attempt a;
      const auto from = Clock::now();
      launch(*restorer, all, to, a).join();
      ASSERT_TRUE(a.succeeded) << a.error;
      ASSERT_TRUE(a.placing.has_value());
      timing_[all].total = std::chrono::duration_cast<Ms>(Clock::now() - from);
      timing_[all].tail = std::chrono::duration_cast<Ms>(Clock::now() - *a.placing);
      for (auto& d : dbs_) {
        if (all ? d.restoredByAll : &d == &main()) d.current = to;
        const State now = read(*restorer, d);
        ASSERT_EQ(now, d.states[d.current]) << d.name << "\n" << differences(now, d.states[d.current]);
      }
    }
    std::cout << "[ restore crash ] the server starts in " << startup_.count()
              << " ms; a clean restore of one database takes " << timing_[0].total.count() << " ms ("
              << timing_[0].tail.count() << " ms from placing its database file), of the folder "
              << timing_[1].total.count() << " ms (" << timing_[1].tail.count() << " ms)" << std::endl;
  }

  // One round: a restore of the main database (or of the folder) towards
  // its other state, interrupted by signal after a random delay; with
  // stopRecovery, the next start is killed too, at a random moment of its
  // first milliseconds, where the recovery runs. Then the server starts
  // again and every database is checked.
  void round(int n, int signal, bool stopRecovery) {
    const int to = 1 - main().current;
    const bool all = rng_() % 2 == 0;
    // Half the delays count from the moment the database file starts to
    // be placed: the part of the restore that changes the database.
    const bool tail = rng_() % 2 == 0;
    const Ms span = tail ? timing_[all].tail : timing_[all].total;
    const Ms delay{std::uniform_int_distribution<std::int64_t>(0, span.count() * 6 / 5)(rng_)};
    const Ms recoveryDelay{std::uniform_int_distribution<std::int64_t>(0, startup_.count())(rng_)};
    std::string what = std::string(all ? "restore --all" : "restore") + " towards state " + "AB"[to] + ", " +
                       (signal == SIGKILL ? "kill " : "SIGTERM ") + std::to_string(delay.count()) + " ms after " +
                       (tail ? "placing began" : "the request");
    if (stopRecovery) what += ", the next start killed after " + std::to_string(recoveryDelay.count()) + " ms";
    SCOPED_TRACE("round " + std::to_string(n) + " of seed " + std::to_string(seed_) + ": " + what);

    Attempt a;
    auto restorer = clientOf(*server_, main().name);
    const auto began = Clock::now();
    std::thread restoring = launch(*restorer, all, to, a);
    {
      std::unique_lock lock(a.mutex);
      if (tail) a.changed.wait_for(lock, std::chrono::minutes(2), [&] { return a.placing || a.finished; });
      const auto from = tail && a.placing ? *a.placing : began;
      a.changed.wait_until(lock, from + delay, [&] { return a.finished; });
    }
    if (signal == SIGKILL) {
      EXPECT_EQ(server_->stop(SIGKILL), 128 + SIGKILL);
    } else {
      // A stop waits for the restore, or has it stop before it changes
      // anything, and ends cleanly.
      EXPECT_EQ(server_->stop(signal), 0);
    }
    restoring.join();
    restorer.reset();
    if (signal == SIGKILL || a.error.find("stopping") == std::string::npos) {
      EXPECT_EQ(a.error, "");
    }
    if (!a.succeeded && !a.error.empty()) what += " (the restore answered: " + a.error + ")";
    if (signal != SIGKILL && !a.ended.empty()) what += " (" + a.ended + ")";

    std::size_t rolledBack = 0, finished = 0;
    if (stopRecovery) {
      ServerOptions o = options();
      o.waitUntilListening = false;
      ServerProcess recovering(kServer, o);
      std::this_thread::sleep_for(recoveryDelay);  // the kill's random moment
      recovering.stop(SIGKILL);
      rolledBack += recovering.countLogLines(kRolledBack);
      finished += recovering.countLogLines(kFinished);
      if (rolledBack + finished > 0) what += " (its recovery had finished)";
      EXPECT_EQ(recovering.countLogLines("Critical"), 0u);
    }
    server_ = start();
    rolledBack += server_->countLogLines(kRolledBack);
    finished += server_->countLogLines(kFinished);
    EXPECT_EQ(server_->countLogLines("Critical"), 0u);
    EXPECT_EQ(server_->countLogLines("Restore recovery:"), 0u);  // a held file that could not go back
    EXPECT_EQ(leftovers(), std::vector<std::string>{});

    int changed = 0;
    auto check = clientOf(*server_);
    for (auto& d : dbs_) {
      SCOPED_TRACE(d.name);
      try {
        RawDb raw(folderOf(d) / "cvdb.edb");
        EXPECT_EQ(raw.value("PRAGMA integrity_check"), "ok");
      } catch (const std::exception& e) {
        ADD_FAILURE() << e.what();
      }
      const State now = read(*check, d);
      const bool restoredHere = all ? d.restoredByAll : &d == &main();
      const bool isPrevious = now == d.states[d.current];
      const bool isRestored = restoredHere && now == d.states[to];
      // A restore that answered success has committed every database.
      const bool ok = a.succeeded && restoredHere ? isRestored : isPrevious || isRestored;
      if (!ok) {
        ADD_FAILURE() << "neither the previous state "
                      << "AB"[d.current]
                      << (restoredHere ? std::string(" nor the restored state ") + "AB"[to] : std::string())
                      << (a.succeeded ? " (the restore had answered success)" : "") << "; against the previous:\n"
                      << differences(now, d.states[d.current]) << "against the other:\n"
                      << differences(now, d.states[1 - d.current]);
      }
      if (isRestored && d.current != to) ++changed;
      if (now == d.states[1 - d.current]) d.current = 1 - d.current;
    }
    const std::string outcome = std::string(a.succeeded      ? "answered before the signal"
                                            : rolledBack > 0 ? "rolled back at the start"
                                            : finished > 0   ? "finished at the start"
                                                             : "nothing to recover at the start") +
                                ", " + std::to_string(changed) + " of " + std::to_string(all ? 2 : 1) +
                                " databases changed";
    ++outcomes_[outcome];
    std::cout << "[ restore crash ] round " << n << ": " << what << ": " << outcome << std::endl;
  }

  void summary() const {
    std::cout << "[ restore crash ] seed " << seed_ << ", " << rounds_ << " rounds:";
    for (const auto& [outcome, count] : outcomes_) std::cout << " " << count << " " << outcome << ";";
    std::cout << std::endl;
  }

  Database& main() { return dbs_[0]; }
  fs::path root() const { return dir_ / "db"; }
  fs::path folderOf(const Database& d) const {
    std::string key = d.name;
    std::replace(key.begin(), key.end(), '\\', '/');
    return root() / key;
  }

  ServerOptions options() const {
    ServerOptions o;
    o.configJson = R"({"ServerPort": 0, "DBRoot": ")" + root().string() + R"(/"})";
    return o;
  }
  std::unique_ptr<ServerProcess> start() {
    fs::create_directories(root());
    return std::make_unique<ServerProcess>(kServer, options());
  }

  // Starts a restore towards state `to` on the client's connection (bound
  // to the main database) in a thread of its own.
  std::thread launch(cvdb::Client& c, bool all, int to, Attempt& a) {
    const std::string target =
        all ? std::string(to == 0 ? "A/" : "B/") : std::string(to == 0 ? "single/" : "singleB/") + main().backupFile;
    return std::thread([&c, all, target, &a] {
      try {
        c.restore(target, all, [&a](std::uint32_t, const std::string& text) {
          if (text.starts_with("Metadata restore started")) {
            std::lock_guard lock(a.mutex);
            if (!a.placing) a.placing = Clock::now();
            a.changed.notify_all();
          }
        });
        std::lock_guard lock(a.mutex);
        a.succeeded = true;
      } catch (const cvdb::OperationFailed& e) {
        std::lock_guard lock(a.mutex);
        a.error = e.what();
      } catch (const cvdb::ConnectionEnded& e) {
        // The signal.
        std::lock_guard lock(a.mutex);
        a.ended = e.what();
      } catch (const std::exception& e) {
        std::lock_guard lock(a.mutex);
        a.error = e.what();
      }
      std::lock_guard lock(a.mutex);
      a.finished = true;
      a.changed.notify_all();
    });
  }

  // The database's content now, read through a client of the server.
  State read(cvdb::Client& c, const Database& d) {
    EXPECT_TRUE(c.connect(d.name, 1)) << d.name;
    return readState(c, d.shape, folderOf(d));
  }

  // What a restore may leave that the database itself is not: files beside
  // the database file and its write-ahead log, other folders beside the
  // data folder, working folders below db.temp.
  std::vector<std::string> leftovers() {
    std::vector<std::string> out;
    for (const auto& d : dbs_) {
      if (!fs::is_directory(folderOf(d))) {
        out.push_back("(missing) " + folderOf(d).string());
        continue;
      }
      for (const auto& e : fs::directory_iterator(folderOf(d))) {
        const std::string name = e.path().filename().string();
        const bool known =
            e.is_directory() ? name == "d" : name == "cvdb.edb" || name == "cvdb.edb-wal" || name == "cvdb.edb-shm";
        if (!known) out.push_back(e.path().string());
      }
    }
    if (fs::exists(root() / "db.temp")) {
      for (const auto& e : fs::directory_iterator(root() / "db.temp")) out.push_back(e.path().string());
    }
    return out;
  }

  static constexpr const char* kRolledBack = "was interrupted; its previous files were put back";
  static constexpr const char* kFinished = "had completed before the server stopped";

  TempDir dir_;
  std::vector<Database> dbs_;
  std::unique_ptr<ServerProcess> server_;
  int rounds_ = 0;
  std::uint64_t seed_ = 0;
  std::mt19937_64 rng_;
  Ms startup_{0};
  struct {
    Ms total{0};
    Ms tail{0};                          // from "Metadata restore started..." to the end
  } timing_[2];                          // one database, the folder
  std::map<std::string, int> outcomes_;  // how the signals landed
};

TEST_F(RestoreCrash, EveryDatabaseIsItsPreviousOrItsRestoredStateAfterAKillAtAnyMoment) {
  ASSERT_NO_FATAL_FAILURE(prepare(20));
  for (int n = 1; n <= rounds_ && !HasFailure(); ++n) {
    // Every fourth round the recovery itself is cut short.
    round(n, SIGKILL, rng_() % 4 == 0);
  }
  summary();
}

TEST_F(RestoreCrash, AStopDuringARestoreEndsCleanlyWithThePreviousOrTheRestoredState) {
  ASSERT_NO_FATAL_FAILURE(prepare(4));
  for (int n = 1; n <= rounds_ && !HasFailure(); ++n) round(n, SIGTERM, false);
  summary();
}

}  // namespace
