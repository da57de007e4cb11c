// Load generator: C connections, each on its own thread with its own
// client, send one command back to back for a fixed time; reports the
// throughput and the latency percentiles.
//
//   load_gen --port 45678 --connections 50 --seconds 10 --command ping
//   load_gen --command setcfg --size 100 --connections 50 --databases 16
//
// A command is one line in kWorkloads: its name, whether it needs a
// database, what it does once per connection before the clock starts, and
// the operation that is timed.

#include <CLI/CLI.hpp>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "client/client.h"

namespace {

using Clock = std::chrono::steady_clock;

// What the commands send, built once from --size: configuration parts
// whose JSON text is that long, and data-file contents of that length. A
// writer alternates between the two of a kind, so that every write changes
// the stored bytes (SQLite skips writing a row whose bytes stay the same,
// and the commit then has nothing to sync).
struct Payload {
  json::Object cfg[2];
  SharedMemBuffer data[2];
};

Payload makePayload(std::size_t size) {
  Payload p;
  for (int i = 0; i < 2; ++i) {
    const char fill = i == 0 ? 'x' : 'y';
    // {"v":"xxx"} is 8 bytes around the string.
    p.cfg[i] = json::strToObject("{\"v\":\"" + std::string(size > 8 ? size - 8 : 0, fill) + "\"}");
    p.data[i] = SharedMemBuffer(MemBuffer::copyOf(std::string(size, fill)));
  }
  return p;
}

// Each connection works on a key of its own, so that writers meet only in
// the database's write lock, not on one row. n counts the connection's
// operations.
using Step = std::function<void(cvdb::Client&, const Payload&, const std::string& key, std::uint64_t n)>;
struct Workload {
  const char* name;
  bool needsDb;
  std::size_t defaultSize;
  Step prepare;
  Step op;
};

const std::vector<Workload> kWorkloads = {
    {"ping", false, 0, {}, [](cvdb::Client& c, const Payload&, const std::string&, std::uint64_t) { c.ping(); }},
    {"dbs", false, 0, {}, [](cvdb::Client& c, const Payload&, const std::string&, std::uint64_t) { c.dbNames(); }},
    {"getcfg", true, 100,
     [](cvdb::Client& c, const Payload& p, const std::string& key, std::uint64_t) { c.setCfg(key, p.cfg[0]); },
     [](cvdb::Client& c, const Payload&, const std::string& key, std::uint64_t) { c.getCfg(key); }},
    {"setcfg", true, 100, {},
     [](cvdb::Client& c, const Payload& p, const std::string& key, std::uint64_t n) { c.setCfg(key, p.cfg[n % 2]); }},
    {"getdata", true, 4096,
     [](cvdb::Client& c, const Payload& p, const std::string& key, std::uint64_t) { c.setData(key, "file", p.data[0]); },
     [](cvdb::Client& c, const Payload&, const std::string& key, std::uint64_t) { c.getData(key, "file"); }},
    {"setdata", true, 4096, {},
     [](cvdb::Client& c, const Payload& p, const std::string& key, std::uint64_t n) {
       c.setData(key, "file", p.data[n % 2]);
     }},
};

struct Result {
  std::vector<std::uint32_t> latenciesNs;
  std::uint64_t errors = 0;
  std::string firstError;
};

double percentile(const std::vector<std::uint32_t>& sorted, double p) {
  if (sorted.empty()) return 0;
  const auto i = static_cast<std::size_t>(p / 100.0 * static_cast<double>(sorted.size() - 1) + 0.5);
  return sorted[std::min(i, sorted.size() - 1)] / 1000.0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Load generator for cvdbserver"};
  cvdb::ClientOptions options;
  unsigned connections = 1;
  double seconds = 5;
  std::string command = "ping";
  std::string db = "loadgen";
  unsigned databases = 1;
  std::size_t size = 0;
  bool json = false;
  std::vector<std::string> names;
  for (const auto& w : kWorkloads) names.emplace_back(w.name);
  app.add_option("--host", options.host)->capture_default_str();
  app.add_option("--port", options.port)->capture_default_str();
  app.add_option("-c,--connections", connections, "Parallel connections")->capture_default_str();
  app.add_option("-t,--seconds", seconds, "How long to run")->capture_default_str();
  app.add_option("--command", command, "What to send")->check(CLI::IsMember(names))->capture_default_str();
  app.add_option("--db", db, "Database of the commands that need one")->capture_default_str();
  app.add_option("--databases", databases,
                 "Spread the connections over this many databases (--db with -0, -1, ... appended)")
      ->capture_default_str();
  app.add_option("--size", size, "Bytes of a configuration part's JSON text or of a data file (0: the command's default)")
      ->capture_default_str();
  app.add_flag("--json", json, "One JSON object as the result");
  CLI11_PARSE(app, argc, argv);
  if (connections == 0) connections = 1;
  if (databases == 0) databases = 1;

  const Workload& work = *std::find_if(kWorkloads.begin(), kWorkloads.end(),
                                       [&](const Workload& w) { return command == w.name; });
  if (size == 0) size = work.defaultSize;
  const Payload payload = makePayload(size);

  std::vector<Result> results(connections);
  std::atomic<unsigned> ready{0};
  std::atomic<bool> go{false};
  std::atomic<bool> setupFailed{false};
  Clock::time_point deadline;
  std::mutex deadlineMutex;
  std::vector<std::thread> threads;
  for (unsigned i = 0; i < connections; ++i) {
    threads.emplace_back([&, i] {
      Result& r = results[i];
      std::unique_ptr<cvdb::Client> client;
      const std::string dbName = databases == 1 ? db : db + "-" + std::to_string(i % databases);
      const std::string key = "bench-" + std::to_string(i);
      try {
        client = std::make_unique<cvdb::Client>(options);
        if (work.needsDb && !client->connect(dbName)) throw std::runtime_error("cannot connect to database " + dbName);
        if (work.prepare) work.prepare(*client, payload, key, 0);
      } catch (const std::exception& e) {
        r.firstError = e.what();
        setupFailed = true;
      }
      ++ready;
      while (!go) std::this_thread::yield();
      if (!client || setupFailed) return;
      Clock::time_point end;
      {
        std::lock_guard lock(deadlineMutex);
        end = deadline;
      }
      r.latenciesNs.reserve(1 << 16);
      for (std::uint64_t n = 0;; ++n) {
        const auto start = Clock::now();
        if (start >= end) break;
        try {
          work.op(*client, payload, key, n);
        } catch (const std::exception& e) {
          if (r.errors++ == 0) r.firstError = e.what();
          if (!client->isOpen()) break;
          continue;
        }
        const auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - start).count();
        r.latenciesNs.push_back(static_cast<std::uint32_t>(std::min<std::int64_t>(ns, UINT32_MAX)));
      }
    });
  }
  while (ready < connections) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  const auto begin = Clock::now();
  {
    std::lock_guard lock(deadlineMutex);
    deadline = begin + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
  }
  go = true;
  for (auto& t : threads) t.join();
  const double elapsed = std::chrono::duration<double>(Clock::now() - begin).count();

  std::vector<std::uint32_t> all;
  std::uint64_t errors = 0;
  std::string firstError;
  for (auto& r : results) {
    all.insert(all.end(), r.latenciesNs.begin(), r.latenciesNs.end());
    errors += r.errors;
    if (firstError.empty()) firstError = r.firstError;
  }
  if (setupFailed) {
    std::fprintf(stderr, "load_gen: setup failed: %s\n", firstError.c_str());
    return 1;
  }
  std::sort(all.begin(), all.end());
  const double opsPerSec = static_cast<double>(all.size()) / elapsed;
  if (json) {
    std::printf(
        "{\"command\":\"%s\",\"connections\":%u,\"databases\":%u,\"size\":%zu,\"seconds\":%.3f,\"ops\":%zu,"
        "\"ops_per_sec\":%.1f,\"p50_us\":%.1f,\"p99_us\":%.1f,\"errors\":%llu}\n",
        work.name, connections, databases, size, elapsed, all.size(), opsPerSec, percentile(all, 50), percentile(all, 99),
        static_cast<unsigned long long>(errors));
  } else {
    std::printf("%s: %u connection(s), %.2f s, %zu ops, %.0f ops/s, p50 %.1f us, p99 %.1f us", work.name,
                connections, elapsed, all.size(), opsPerSec, percentile(all, 50), percentile(all, 99));
    if (errors) std::printf(", %llu error(s), first: %s", static_cast<unsigned long long>(errors), firstError.c_str());
    std::printf("\n");
  }
  return errors ? 1 : 0;
}
