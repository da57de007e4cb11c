// Load generator: C connections, each on its own thread with its own
// client, send one command back to back for a fixed time; reports the
// throughput and the latency percentiles.
//
//   load_gen --port 45678 --connections 50 --seconds 10 --command ping
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

struct Workload {
  const char* name;
  bool needsDb;
  std::function<void(cvdb::Client&)> prepare;
  std::function<void(cvdb::Client&)> op;
};

const std::vector<Workload> kWorkloads = {
    {"ping", false, {}, [](cvdb::Client& c) { c.ping(); }},
    {"dbs", false, {}, [](cvdb::Client& c) { c.dbNames(); }},
    {"getcfg", true, [](cvdb::Client& c) { c.setCfg("bench", json::strToObject(R"({"a":1})")); },
     [](cvdb::Client& c) { c.getCfg("bench"); }},
    {"getdata", true,
     [](cvdb::Client& c) { c.setData("bench", "4k", SharedMemBuffer(MemBuffer::copyOf(std::string(4096, 'x')))); },
     [](cvdb::Client& c) { c.getData("bench", "4k"); }},
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
  bool json = false;
  std::vector<std::string> names;
  for (const auto& w : kWorkloads) names.emplace_back(w.name);
  app.add_option("--host", options.host)->capture_default_str();
  app.add_option("--port", options.port)->capture_default_str();
  app.add_option("-c,--connections", connections, "Parallel connections")->capture_default_str();
  app.add_option("-t,--seconds", seconds, "How long to run")->capture_default_str();
  app.add_option("--command", command, "What to send")->check(CLI::IsMember(names))->capture_default_str();
  app.add_option("--db", db, "Database of the commands that need one")->capture_default_str();
  app.add_flag("--json", json, "One JSON object as the result");
  CLI11_PARSE(app, argc, argv);
  if (connections == 0) connections = 1;

  const Workload& work = *std::find_if(kWorkloads.begin(), kWorkloads.end(),
                                       [&](const Workload& w) { return command == w.name; });

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
      try {
        client = std::make_unique<cvdb::Client>(options);
        if (work.needsDb && !client->connect(db)) throw std::runtime_error("cannot connect to database " + db);
        if (work.prepare) work.prepare(*client);
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
      while (true) {
        const auto start = Clock::now();
        if (start >= end) break;
        try {
          work.op(*client);
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
        "{\"command\":\"%s\",\"connections\":%u,\"seconds\":%.3f,\"ops\":%zu,\"ops_per_sec\":%.1f,"
        "\"p50_us\":%.1f,\"p99_us\":%.1f,\"errors\":%llu}\n",
        work.name, connections, elapsed, all.size(), opsPerSec, percentile(all, 50), percentile(all, 99),
        static_cast<unsigned long long>(errors));
  } else {
    std::printf("%s: %u connection(s), %.2f s, %zu ops, %.0f ops/s, p50 %.1f us, p99 %.1f us", work.name,
                connections, elapsed, all.size(), opsPerSec, percentile(all, 50), percentile(all, 99));
    if (errors) std::printf(", %llu error(s), first: %s", static_cast<unsigned long long>(errors), firstError.c_str());
    std::printf("\n");
  }
  return errors ? 1 : 0;
}
