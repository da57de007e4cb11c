// Load generator: C connections send one command back to back for a fixed
// time, each with one request in flight; reports the throughput and the
// latency percentiles.
//
//   load_gen --port 45678 --connections 50 --seconds 10 --command getcfg
//   load_gen --command savepack --connections 50 --databases 16
//   load_gen --redis --port 6379 --command savepack    (the Redis counterpart)
//
// By default every connection runs in one event loop (--loop-threads), as
// redis-benchmark runs its clients, so the generator costs the server
// little CPU. --mode client runs each connection on a thread of its own
// through the client library instead: what a client program sees, at the
// price of one thread per connection competing for the cores.
//
//   load_gen --mode client --tls --ca ca.pem --command ping      (over TLS)
//   load_gen --mode client --tls --ca ca.pem --reconnect          (handshakes)
//
// TLS runs in client mode only. --reconnect opens a new connection for
// every request (ping only), so that the figures are those of connecting
// (and, with TLS, of the handshake).

#include <CLI/CLI.hpp>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "client/client.h"
#include "load_loop.h"
#include "load_workloads.h"
#include "protocol/commands.h"

namespace {

using loadgen::Clock;
using loadgen::Stream;
using loadgen::Wire;

struct Settings {
  cvdb::ClientOptions client;
  unsigned connections = 1;
  double seconds = 5;
  std::string command = "ping";
  std::string db = "loadgen";
  unsigned databases = 1;
  std::string mode = "loop";
  unsigned loopThreads = 1;
  bool redis = false;
  bool json = false;
  bool reconnect = false;
  loadgen::Params params;

  std::string dbName(unsigned connection) const {
    return databases == 1 ? db : db + "-" + std::to_string(connection % databases);
  }
};

std::string frameBytes(const Ipc::CmdI& cmd) {
  const wire::OutFrame f = cmd.requestFrame();
  return f.head + std::string(f.tail.view());
}

std::string frameText(std::string_view frame) {
  try {
    wire::Reader in(frame.data() + wire::kHeaderSize, frame.size() - wire::kHeaderSize);
    return in.str();
  } catch (const std::exception&) {
    return "(unreadable text)";
  }
}

// Checks a frame as the answer to cmd and reads it into cmd.
std::string checkFrame(std::string_view frame, Ipc::CmdI& cmd) {
  const auto tag = static_cast<std::uint8_t>(frame[4]);
  const auto kind = static_cast<wire::FrameKind>(frame[5]);
  if (kind == wire::FrameKind::Bye) return "the server ended the connection: " + frameText(frame);
  if (kind == wire::FrameKind::Refused) return "refused: " + frameText(frame);
  if (kind != wire::FrameKind::Answer || tag != cmd.tag()) {
    return "unexpected frame of tag " + std::to_string(tag) + " and kind " + std::to_string(static_cast<int>(kind));
  }
  try {
    wire::Reader in(frame.data() + wire::kHeaderSize, frame.size() - wire::kHeaderSize);
    cmd.readAnswer(in);
  } catch (const std::exception& e) {
    return cmd.name() + " answer: " + e.what();
  }
  return {};
}

std::string checkReplies(std::string_view replies) {
  // An error reply, or an EXEC whose transaction was aborted.
  if (replies.starts_with("-") || replies.find("\r\n-") != std::string_view::npos) {
    const auto at = replies.find('-');
    return "Redis: " + std::string(replies.substr(at, replies.find('\r', at) - at));
  }
  if (replies.find("*-1\r\n") != std::string_view::npos) return "Redis: transaction aborted";
  return {};
}

// The streams of a cvdbserver workload in loop mode, connected, bound to
// their databases and prepared.
std::vector<Stream> cvdbStreams(const Settings& s, const loadgen::Workload& w) {
  std::vector<Stream> streams;
  for (unsigned i = 0; i < s.connections; ++i) {
    const std::string key = "bench-" + std::to_string(i);
    if (w.prepare) {
      cvdb::Client c(s.client);
      if (!c.connect(s.dbName(i))) throw std::runtime_error("cannot connect to database " + s.dbName(i));
      w.prepare(c, s.params, key);
    }
    Stream st;
    st.fd = loadgen::connectTo(s.client.host, s.client.port);
    if (w.needsDb) {
      Ipc::DB::Connect connect;
      connect.setRequest(s.dbName(i), 0);
      const std::string answer = loadgen::exchange(st.fd, Wire::Frames, frameBytes(connect));
      const std::string problem = checkFrame(answer, connect);
      if (!problem.empty()) throw std::runtime_error(problem);
      if (connect.respFailed()) throw std::runtime_error(connect.respError());
    }
    auto cmds = w.commands(s.params, key);
    for (const auto& c : cmds) st.requests.push_back(frameBytes(*c));
    st.check = [cmds](std::string_view frame, std::size_t request) { return checkFrame(frame, *cmds[request]); };
    streams.push_back(std::move(st));
  }
  return streams;
}

std::vector<Stream> redisStreams(const Settings& s, const loadgen::RedisWorkload& w) {
  std::vector<Stream> streams;
  for (unsigned i = 0; i < s.connections; ++i) {
    const std::string key = "bench-" + std::to_string(i);
    Stream st;
    st.fd = loadgen::connectTo(s.client.host, s.client.port);
    if (w.setup) {
      for (const auto& request : w.setup(s.params, key)) {
        const std::string problem = checkReplies(loadgen::exchange(st.fd, Wire::Resp, request));
        if (!problem.empty()) throw std::runtime_error(problem);
      }
    }
    st.requests = w.requests(s.params, key);
    st.replies = w.replies;
    st.check = [](std::string_view replies, std::size_t) { return checkReplies(replies); };
    streams.push_back(std::move(st));
  }
  return streams;
}

// Runs the streams on loopThreads event loops.
void runLoops(std::vector<Stream>& streams, Wire wire, unsigned loopThreads, Clock::time_point deadline) {
  const unsigned n = std::max(1u, std::min<unsigned>(loopThreads, static_cast<unsigned>(streams.size())));
  std::vector<std::vector<Stream*>> groups(n);
  for (std::size_t i = 0; i < streams.size(); ++i) groups[i % n].push_back(&streams[i]);
  std::vector<std::thread> threads;
  for (unsigned t = 1; t < n; ++t) threads.emplace_back([&, t] { loadgen::runLoop(groups[t], wire, deadline); });
  loadgen::runLoop(groups[0], wire, deadline);
  for (auto& t : threads) t.join();
}

// Client mode: a thread and a client per connection.
void runClients(const Settings& s, const loadgen::Workload& w, std::vector<Stream>& results, Clock::time_point& begin,
                Clock::time_point& deadline) {
  results.resize(s.connections);
  std::vector<std::unique_ptr<cvdb::Client>> clients(s.connections);
  std::vector<std::vector<std::shared_ptr<Ipc::CmdI>>> cmds(s.connections);
  for (unsigned i = 0; i < s.connections; ++i) {
    const std::string key = "bench-" + std::to_string(i);
    clients[i] = std::make_unique<cvdb::Client>(s.client);
    if (w.needsDb && !clients[i]->connect(s.dbName(i))) {
      throw std::runtime_error("cannot connect to database " + s.dbName(i));
    }
    if (w.prepare) w.prepare(*clients[i], s.params, key);
    cmds[i] = w.commands(s.params, key);
  }
  std::atomic<bool> go{false};
  std::vector<std::thread> threads;
  for (unsigned i = 0; i < s.connections; ++i) {
    threads.emplace_back([&, i] {
      while (!go) std::this_thread::yield();
      Stream& r = results[i];
      r.latenciesNs.reserve(1 << 16);
      for (std::uint64_t n = 0;; ++n) {
        const auto start = Clock::now();
        if (start >= deadline) break;
        try {
          if (s.reconnect) {
            cvdb::Client fresh(s.client);
            fresh.run(*cmds[i][n % cmds[i].size()]);
          } else {
            clients[i]->run(*cmds[i][n % cmds[i].size()]);
          }
        } catch (const std::exception& e) {
          if (r.errors++ == 0) r.firstError = e.what();
          if (!clients[i]->isOpen()) break;
          continue;
        }
        const auto end = Clock::now();
        if (end > deadline) break;
        const auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(end - start).count();
        r.latenciesNs.push_back(static_cast<std::uint64_t>(ns));
      }
    });
  }
  begin = Clock::now();
  deadline = begin + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(s.seconds));
  go = true;
  for (auto& t : threads) t.join();
}

double percentile(const std::vector<std::uint64_t>& sorted, double p) {
  if (sorted.empty()) return 0;
  const auto i = static_cast<std::size_t>(p / 100.0 * static_cast<double>(sorted.size() - 1) + 0.5);
  return sorted[std::min(i, sorted.size() - 1)] / 1000.0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Load generator for cvdbserver (and its Redis counterparts)"};
  Settings s;
  std::size_t size = 0;
  std::string list;
  for (const auto& w : loadgen::workloads()) list += std::string("\n  ") + w.name + ": " + w.what;
  list += "\nwith --redis:";
  for (const auto& w : loadgen::redisWorkloads()) list += std::string("\n  ") + w.name + ": " + w.what;
  app.add_option("--host", s.client.host)->capture_default_str();
  app.add_option("--port", s.client.port)->capture_default_str();
  app.add_option("-c,--connections", s.connections, "Parallel connections")->capture_default_str();
  app.add_option("-t,--seconds", s.seconds, "How long to run")->capture_default_str();
  app.add_option("--command", s.command, "What to send:" + list)->capture_default_str();
  app.add_option("--db", s.db, "Database of the commands that need one")->capture_default_str();
  app.add_option("--databases", s.databases,
                 "Spread the connections over this many databases (--db with -0, -1, ... appended)")
      ->capture_default_str();
  app.add_option("--size", size, "Bytes of a value, data file or pack content (0: the command's default)")
      ->capture_default_str();
  app.add_option("--record-size", s.params.recordSize, "Bytes of a pack record's stored text")->capture_default_str();
  app.add_option("--folder-packs", s.params.folderPacks, "Packs in the folder that getpackinfos lists")
      ->capture_default_str();
  app.add_option("--mode", s.mode, "loop: event loops; client: a thread and a client library per connection")
      ->check(CLI::IsMember({"loop", "client"}))
      ->capture_default_str();
  app.add_option("--loop-threads", s.loopThreads, "Event loops in loop mode")->capture_default_str();
  app.add_flag("--redis", s.redis, "The server is Redis: run the command's Redis counterpart");
  app.add_flag("--json", s.json, "One JSON object as the result");
  bool tls = false;
  cvdb::TlsOptions tlsOptions;
  app.add_flag("--tls", tls, "Connect over TLS (client mode only)");
  app.add_option("--ca", tlsOptions.caFile, "CA certificates that verify the server (with --tls)");
  app.add_option("--cert", tlsOptions.certFile, "Client certificate (with --tls)");
  app.add_option("--key", tlsOptions.keyFile, "Key of the client certificate (with --tls)");
  app.add_flag("--reconnect", s.reconnect, "A new connection for every request (client mode, ping only)");
  CLI11_PARSE(app, argc, argv);
  if (tls) s.client.tls = tlsOptions;
  if ((tls || s.reconnect) && (s.mode != "client" || s.redis)) {
    std::fprintf(stderr, "load_gen: --tls and --reconnect need --mode client\n");
    return 2;
  }
  if (s.reconnect && s.command != "ping") {
    std::fprintf(stderr, "load_gen: --reconnect runs ping only\n");
    return 2;
  }
  s.connections = std::max(1u, s.connections);
  s.databases = std::max(1u, s.databases);

  std::vector<Stream> streams;
  Clock::time_point begin;
  Clock::time_point deadline;
  const auto length = std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(s.seconds));
  try {
    if (s.redis) {
      const auto& table = loadgen::redisWorkloads();
      const auto w = std::find_if(table.begin(), table.end(), [&](const auto& x) { return s.command == x.name; });
      if (w == table.end()) throw std::runtime_error("no Redis counterpart for " + s.command);
      s.params.size = size ? size : w->defaultSize;
      streams = redisStreams(s, *w);
      begin = Clock::now();
      deadline = begin + length;
      runLoops(streams, Wire::Resp, s.loopThreads, deadline);
    } else {
      const auto& table = loadgen::workloads();
      const auto w = std::find_if(table.begin(), table.end(), [&](const auto& x) { return s.command == x.name; });
      if (w == table.end()) throw std::runtime_error("no command " + s.command);
      s.params.size = size ? size : w->defaultSize;
      if (w->prepareDb) {
        // Databases are independent: prepared side by side.
        std::vector<std::thread> preparing;
        std::vector<std::string> problems(std::min(s.databases, s.connections));
        for (unsigned d = 0; d < problems.size(); ++d) {
          preparing.emplace_back([&, d] {
            try {
              cvdb::Client c(s.client);
              if (!c.connect(s.dbName(d))) throw std::runtime_error("cannot connect to database " + s.dbName(d));
              w->prepareDb(c, s.params);
            } catch (const std::exception& e) {
              problems[d] = e.what();
            }
          });
        }
        for (auto& t : preparing) t.join();
        for (const auto& p : problems) {
          if (!p.empty()) throw std::runtime_error(p);
        }
      }
      if (s.mode == "client") {
        deadline = Clock::now() + length;
        runClients(s, *w, streams, begin, deadline);
      } else {
        streams = cvdbStreams(s, *w);
        begin = Clock::now();
        deadline = begin + length;
        runLoops(streams, Wire::Frames, s.loopThreads, deadline);
      }
    }
  } catch (const std::exception& e) {
    std::fprintf(stderr, "load_gen: setup failed: %s\n", e.what());
    return 1;
  }
  const double elapsed = std::chrono::duration<double>(deadline - begin).count();

  std::vector<std::uint64_t> all;
  std::uint64_t errors = 0;
  std::string firstError;
  for (auto& r : streams) {
    all.insert(all.end(), r.latenciesNs.begin(), r.latenciesNs.end());
    errors += r.errors;
    if (firstError.empty()) firstError = r.firstError;
  }
  std::sort(all.begin(), all.end());
  const double opsPerSec = static_cast<double>(all.size()) / elapsed;
  const char* target = s.redis ? "redis" : tls ? "cvdb-tls" : "cvdb";
  if (s.json) {
    std::printf(
        "{\"target\":\"%s\",\"command\":\"%s\",\"mode\":\"%s\",\"connections\":%u,\"databases\":%u,\"size\":%zu,"
        "\"seconds\":%.3f,\"ops\":%zu,\"ops_per_sec\":%.1f,\"p50_us\":%.1f,\"p99_us\":%.1f,\"errors\":%llu}\n",
        target, s.command.c_str(), s.mode.c_str(), s.connections, s.databases, s.params.size, elapsed, all.size(),
        opsPerSec, percentile(all, 50), percentile(all, 99), static_cast<unsigned long long>(errors));
  } else {
    std::printf("%s %s: %u connection(s), %.2f s, %zu ops, %.0f ops/s, p50 %.1f us, p99 %.1f us", target,
                s.command.c_str(), s.connections, elapsed, all.size(), opsPerSec, percentile(all, 50),
                percentile(all, 99));
    if (errors) std::printf(", %llu error(s), first: %s", static_cast<unsigned long long>(errors), firstError.c_str());
    std::printf("\n");
  }
  if (errors)
    std::fprintf(stderr, "load_gen: %llu error(s), first: %s\n", static_cast<unsigned long long>(errors),
                 firstError.c_str());
  return errors ? 1 : 0;
}
