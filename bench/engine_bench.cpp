// Commit rate of the engine layer against the disk and against SQLite used
// directly, and the cost of many open sessions.
//
//   engine_bench [--seconds S] [--runs N] [--dir PATH]
//
// Every figure is the median of N runs of S seconds; the runs of the
// different measurements are interleaved so that a slow moment of the
// machine does not fall on one measurement only. The databases and the
// fdatasync file live in PATH (default: the system's temporary folder), so
// all figures are of the same disk.
//
// Each commit is a small upsert that changes the stored value (an unchanged
// value writes nothing and would flatter the figure).

#include <fcntl.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "engine/blob_io.h"
#include "engine/connection.h"
#include "engine/db_instances.h"
#include "engine/session.h"
#include "engine/transaction.h"
#include "settings/config.h"
#include "settings/names.h"

namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

constexpr int kKeys = 1000;
constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS kv(k BLOB NOT NULL PRIMARY KEY, v INTEGER NOT NULL) STRICT, WITHOUT ROWID";
constexpr const char* kUpsert = "INSERT INTO kv(k, v) VALUES(?, ?) ON CONFLICT(k) DO UPDATE SET v = excluded.v";

struct Options {
  double seconds = 2.0;
  int runs = 3;
  fs::path dir = fs::temp_directory_path();
};

std::string keyOf(std::uint64_t n) { return "key" + std::to_string(n % kKeys); }

double median(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  return values[values.size() / 2];
}

std::uint64_t residentBytes() {
  std::ifstream statm("/proc/self/statm");
  std::uint64_t size = 0;
  std::uint64_t resident = 0;
  statm >> size >> resident;
  return resident * static_cast<std::uint64_t>(::sysconf(_SC_PAGESIZE));
}

// Commits per second of `threads` threads each running `commit` until the
// time is up.
double rate(int threads, double seconds, const std::function<std::function<void()>(int)>& makeWorker) {
  std::vector<std::function<void()>> workers;
  for (int t = 0; t < threads; ++t) workers.push_back(makeWorker(t));
  std::atomic<bool> stop{false};
  std::atomic<std::uint64_t> commits{0};
  std::vector<std::thread> pool;
  const auto start = Clock::now();
  for (int t = 0; t < threads; ++t) {
    pool.emplace_back([&, t] {
      std::uint64_t n = 0;
      while (!stop.load(std::memory_order_relaxed)) {
        workers[static_cast<std::size_t>(t)]();
        ++n;
      }
      commits += n;
    });
  }
  std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
  stop = true;
  for (auto& t : pool) t.join();
  const double elapsed = std::chrono::duration<double>(Clock::now() - start).count();
  return static_cast<double>(commits.load()) / elapsed;
}

// 4 KiB writes, each followed by fdatasync, cycling through a preallocated
// 4 MiB file as a write-ahead log does once it has grown.
double fdatasyncRate(const Options& o) {
  const fs::path file = o.dir / "fdatasync.bin";
  const int fd = ::open(file.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) throw std::runtime_error("cannot open " + file.string());
  constexpr off_t kSpan = 4 * 1024 * 1024;
  // Written, not just allocated: a first write into an allocated but
  // unwritten extent costs a journal commit of the file system.
  std::vector<char> block(4096, 'x');
  for (off_t at = 0; at < kSpan; at += 4096) {
    if (::pwrite(fd, block.data(), block.size(), at) != static_cast<ssize_t>(block.size())) {
      throw std::runtime_error("cannot preallocate");
    }
  }
  if (::fsync(fd) != 0) throw std::runtime_error("cannot preallocate");
  off_t offset = 0;
  const double r = rate(1, o.seconds, [&](int) {
    return [&] {
      block[0] = static_cast<char>(block[0] + 1);
      if (::pwrite(fd, block.data(), block.size(), offset) != static_cast<ssize_t>(block.size()) ||
          ::fdatasync(fd) != 0) {
        throw std::runtime_error("write failed");
      }
      offset = (offset + 4096) % kSpan;
    };
  });
  ::close(fd);
  fs::remove(file);
  return r;
}

// SQLite without the layer: the same file settings, one connection, BEGIN
// IMMEDIATE / upsert / COMMIT with prepared statements.
class DirectDb {
 public:
  explicit DirectDb(const fs::path& file) {
    fs::create_directories(file.parent_path());
    if (sqlite3_open(file.c_str(), &db_) != SQLITE_OK) throw std::runtime_error("open failed");
    exec("PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL; PRAGMA cache_size=-512;");
    exec(kSchema);
    begin_ = prepare("BEGIN IMMEDIATE");
    upsert_ = prepare(kUpsert);
    commit_ = prepare("COMMIT");
  }
  ~DirectDb() {
    for (auto* s : {begin_, upsert_, commit_}) sqlite3_finalize(s);
    sqlite3_close(db_);
  }
  DirectDb(const DirectDb&) = delete;
  DirectDb& operator=(const DirectDb&) = delete;

  void commitOne() {
    const auto key = keyOf(n_);
    step(begin_);
    sqlite3_bind_blob(upsert_, 1, key.data(), static_cast<int>(key.size()), SQLITE_TRANSIENT);
    sqlite3_bind_int64(upsert_, 2, static_cast<sqlite3_int64>(++n_));
    step(upsert_);
    step(commit_);
  }

 private:
  void exec(const char* sql) {
    if (sqlite3_exec(db_, sql, nullptr, nullptr, nullptr) != SQLITE_OK) throw std::runtime_error(sqlite3_errmsg(db_));
  }
  sqlite3_stmt* prepare(const char* sql) {
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v3(db_, sql, -1, SQLITE_PREPARE_PERSISTENT, &s, nullptr) != SQLITE_OK) {
      throw std::runtime_error(sqlite3_errmsg(db_));
    }
    return s;
  }
  void step(sqlite3_stmt* s) {
    const int rc = sqlite3_step(s);
    sqlite3_reset(s);
    if (rc != SQLITE_DONE) throw std::runtime_error(sqlite3_errstr(rc));
  }

  sqlite3* db_ = nullptr;
  sqlite3_stmt* begin_ = nullptr;
  sqlite3_stmt* upsert_ = nullptr;
  sqlite3_stmt* commit_ = nullptr;
  std::uint64_t n_ = 0;
};

// The pool the layer's measures use (made in main).
std::shared_ptr<DB::DBInstances> g_pool;

// A session of the pool on the database `key`, created with the kv table
// on first use.
std::unique_ptr<engine::Session> layerSession(const std::string& key) {
  auto session = g_pool->newSession(key, [&](engine::Session& s) {
    const fs::path file = g_pool->paths().mainFile(key);
    if (fs::exists(file)) {
      s.attachDatabase(file);
      return;
    }
    s.createDatabase(file);
    DB::Transaction txn(s);
    s.execute(kSchema);
    txn.commit();
  });
  session->openDatabase();
  return session;
}

// Upserts through runInTransaction: `sessions` threads spread over `dbs`
// databases.
double layerRate(const Options& o, int sessions, int dbs) {
  std::vector<std::unique_ptr<engine::Session>> open;
  std::vector<std::string> keys;
  for (int i = 0; i < sessions; ++i) {
    keys.push_back("bench" + std::to_string(i % dbs));
    open.push_back(layerSession(keys.back()));
  }
  std::vector<std::uint64_t> counters(static_cast<std::size_t>(sessions), 0);
  const double r = rate(sessions, o.seconds, [&](int t) {
    return [&, t] {
      auto& session = *open[static_cast<std::size_t>(t)];
      auto& n = counters[static_cast<std::size_t>(t)];
      const auto key = keyOf(n * 31 + static_cast<std::uint64_t>(t));
      ++n;
      DB::runInTransaction(session, [&] {
        session.prepare(kUpsert).bindBlob(1, key).bindInt64(2, static_cast<std::int64_t>(n) * 100 + t).run();
      });
    };
  });
  for (std::size_t i = 0; i < open.size(); ++i) g_pool->endSession(keys[i], std::move(open[i]));
  return r;
}

// The layer's cost against SQLite directly, robust to a disk whose sync
// time drifts: slices of 200 commits alternate between the two on one
// thread, and the median of the per-pair ratios is taken.
double pairedOverhead(const Options& o) {
  DirectDb direct(o.dir / "paired" / "direct.db");
  auto session = layerSession("paired");
  constexpr int kSlice = 200;
  std::uint64_t n = 0;
  const auto layerSlice = [&] {
    const auto start = Clock::now();
    for (int i = 0; i < kSlice; ++i, ++n) {
      const auto key = keyOf(n);
      DB::runInTransaction(*session, [&] {
        session->prepare(kUpsert).bindBlob(1, key).bindInt64(2, static_cast<std::int64_t>(n)).run();
      });
    }
    return std::chrono::duration<double>(Clock::now() - start).count();
  };
  const auto directSlice = [&] {
    const auto start = Clock::now();
    for (int i = 0; i < kSlice; ++i) direct.commitOne();
    return std::chrono::duration<double>(Clock::now() - start).count();
  };
  std::vector<double> ratios;
  const auto end = Clock::now() + std::chrono::duration<double>(o.seconds * o.runs);
  while (Clock::now() < end || ratios.size() < 5) ratios.push_back(layerSlice() / directSlice());
  g_pool->endSession("paired", std::move(session));
  return (median(ratios) - 1.0) * 100.0;
}

// The high-water mark of resident memory, reset to the current use.
std::uint64_t peakResident() {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmHWM:", 0) == 0) return std::stoull(line.substr(6)) * 1024;
  }
  return 0;
}
void resetPeak() { std::ofstream("/proc/self/clear_refs") << "5"; }

// A 256 MiB value written and read through blob I/O: the memory beyond the
// caller's own buffer stays small.
void longValue() {
  constexpr std::size_t kSize = 256 * 1024 * 1024;
  std::vector<std::byte> value(kSize, std::byte{0x5a});
  auto session = layerSession("long");
  session->execute("CREATE TABLE IF NOT EXISTS meta(id BLOB NOT NULL PRIMARY KEY, blob BLOB) STRICT");
  resetPeak();
  const auto base = residentBytes();
  auto start = Clock::now();
  DB::runInTransaction(*session, [&] {
    session->prepare("INSERT INTO meta(id, blob) VALUES(?, ?) ON CONFLICT(id) DO UPDATE SET blob = excluded.blob")
        .bindBlob(1, std::string_view("big"))
        .bindZeroBlob(2, static_cast<std::int64_t>(kSize))
        .run();
    engine::writeBlob(*session, "meta", "blob", *engine::findRowid(*session, "meta", "id", "big"), value);
  });
  const double writeSeconds = std::chrono::duration<double>(Clock::now() - start).count();
  const auto writePeak = peakResident();
  resetPeak();
  start = Clock::now();
  engine::readBlob(*session, "meta", "blob", *engine::findRowid(*session, "meta", "id", "big"), value);
  const double readSeconds = std::chrono::duration<double>(Clock::now() - start).count();
  const auto readPeak = peakResident();
  const auto extra = [&](std::uint64_t peak) {
    return peak > base ? static_cast<double>(peak - base) / 1048576.0 : 0.0;
  };
  std::printf("%-40s %10.2f s, %6.1f MiB beyond the buffer\n", "write a 256 MiB value", writeSeconds, extra(writePeak));
  std::printf("%-40s %10.2f s, %6.1f MiB beyond the buffer\n", "read it back", readSeconds, extra(readPeak));
  g_pool->endSession("long", std::move(session));
}

void openManySessions(const Options& o) {
  constexpr int kSessions = 1000;
  // A table of 8 MiB, so that a full scan could fill any cache.
  {
    auto filler = layerSession("many");
    DB::runInTransaction(*filler, [&] {
      filler->execute("CREATE TABLE IF NOT EXISTS bulk(id INTEGER PRIMARY KEY, data BLOB) STRICT");
      filler->execute("DELETE FROM bulk");
      filler->execute(
          "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < 2048) "
          "INSERT INTO bulk SELECT i, randomblob(4096) FROM n");
    });
    g_pool->endSession("many", std::move(filler));
  }
  const auto before = residentBytes();
  const auto start = Clock::now();
  std::vector<std::unique_ptr<engine::Session>> sessions;
  for (int i = 0; i < kSessions; ++i) sessions.push_back(layerSession("many"));
  const double ms = std::chrono::duration<double, std::milli>(Clock::now() - start).count();
  const auto opened = residentBytes();
  for (auto& s : sessions) {
    auto scan = s->prepare("SELECT sum(length(data)) FROM bulk");
    scan.step();
  }
  const auto scanned = residentBytes();
  std::printf("%-40s %10.0f ms\n", "open 1000 sessions", ms);
  std::printf("%-40s %10.1f MiB\n", "  memory of the open sessions", static_cast<double>(opened - before) / 1048576.0);
  std::printf("%-40s %10.1f MiB\n", "  after a full 8 MiB scan on each",
              static_cast<double>(scanned - before) / 1048576.0);
  for (auto& s : sessions) g_pool->endSession("many", std::move(s));
  (void)o;
}

Options parse(int argc, char** argv) {
  Options o;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string flag = argv[i];
    if (flag == "--seconds") {
      o.seconds = std::atof(argv[i + 1]);
    } else if (flag == "--runs") {
      o.runs = std::max(1, std::atoi(argv[i + 1]));
    } else if (flag == "--dir") {
      o.dir = argv[i + 1];
    } else {
      throw std::runtime_error("unknown option " + flag);
    }
  }
  return o;
}

}  // namespace

int main(int argc, char** argv) try {
  Options o = parse(argc, argv);
  o.dir = o.dir / ("engine-bench-" + std::to_string(::getpid()));
  fs::create_directories(o.dir);

  DB::PoolSettings settings;
  settings.maxClientsPerDB = 2000;
  const std::string root = o.dir.string() + "/db/";
  g_pool = DB::DBInstances::create(settings, DB::Paths(root, root, root + "db.backup/", "cvdb.edb"), sys::Env::posix());

  struct Measure {
    std::string name;
    std::function<double()> run;
    std::vector<double> results;
  };
  std::vector<Measure> measures{
      {"fdatasync of 4 KiB", [&] { return fdatasyncRate(o); }, {}},
      {"SQLite directly, 1 connection",
       [&] {
         DirectDb db(o.dir / "direct" / "direct.db");
         return rate(1, o.seconds, [&](int) { return [&] { db.commitOne(); }; });
       },
       {}},
      {"layer, 1 session", [&] { return layerRate(o, 1, 1); }, {}},
      {"layer, 4 sessions on 1 database", [&] { return layerRate(o, 4, 1); }, {}},
      {"layer, 16 sessions on 1 database", [&] { return layerRate(o, 16, 1); }, {}},
      {"layer, 16 sessions on 16 databases", [&] { return layerRate(o, 16, 16); }, {}},
  };
  for (int run = 0; run < o.runs; ++run) {
    for (auto& m : measures) m.results.push_back(m.run());
  }

  std::printf("engine_bench: %d runs of %.1f s, in %s, %u cores, SQLite %s\n\n", o.runs, o.seconds,
              o.dir.string().c_str(), std::thread::hardware_concurrency(), sqlite3_libversion());
  std::printf("%-40s %12s %14s\n", "commits per second (median)", "rate", "vs fdatasync");
  const double sync = median(measures[0].results);
  for (const auto& m : measures) {
    const double r = median(m.results);
    std::printf("%-40s %12.0f %14.2f\n", m.name.c_str(), r, r / sync);
  }
  const double direct = median(measures[1].results);
  const double layer = median(measures[2].results);
  std::printf("%-40s %11.1f%%\n", "layer overhead, from the medians", (direct - layer) / direct * 100.0);
  std::printf("%-40s %11.1f%%\n", "layer overhead, paired slices", pairedOverhead(o));
  std::printf("%-40s %12.2f\n\n", "16 databases against 1 session", median(measures[5].results) / layer);

  longValue();
  openManySessions(o);
  g_pool->stop();
  fs::remove_all(o.dir);
  return 0;
} catch (const std::exception& e) {
  std::fprintf(stderr, "engine_bench: %s\n", e.what());
  return 1;
}
