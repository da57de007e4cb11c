// A bystander's latency while large configuration parts are written: each
// of --writers connections sends one SetCfgPart of --mib MiB of JSON to a
// database of its own, all at once, while a bystander connection reads a
// small configuration part of a third database back to back. Prints the
// bystander's median, p99 and maximum latency over the writers' time, how
// many reads it made then, and how long the slowest writer took.
//
//   big_cfg_bench --port 45678 [--writers 2] [--mib 150]
//
// The JSON text is an object holding an array of small records (numbers,
// strings, an array, a literal), about 150 bytes each: the shape of a real
// configuration, whose parse costs what such a part costs the server. The
// requests are built before the clock starts; a writer's time runs from its
// first byte sent to its answer.

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
#include "framework/wire.h"
#include "protocol/config_data_cmds.h"

namespace {

using Clock = std::chrono::steady_clock;

// A JSON object of at least size bytes.
std::string bigPart(std::size_t size) {
  std::string text;
  text.reserve(size + 256);
  text += "{\"kind\":\"bench\",\"items\":[";
  for (std::uint64_t i = 0; text.size() < size; ++i) {
    if (i) text += ',';
    const std::string n = std::to_string(i);
    text += "{\"id\":" + n + ",\"name\":\"item " + n +
            "\",\"note\":\"a configuration entry with a little text in it, as a real one has\",\"tags\":[\"alpha\","
            "\"beta\"],\"w\":" +
            n + ".25,\"on\":true}";
  }
  text += "]}";
  return text;
}

// The payload of SetCfgPart storing the text under key.
std::string setPayload(const std::string& key, const std::string& text) {
  std::string payload;
  payload.reserve(text.size() + key.size() + 16);
  wire::Writer w(payload);
  w.str(key);
  w.boolean(false);
  w.boolean(true);
  w.str(text);
  return payload;
}

double ms(Clock::duration d) { return std::chrono::duration<double, std::milli>(d).count(); }

}  // namespace

int main(int argc, char** argv) {
  cvdb::ClientOptions options;
  options.ioTimeout = std::chrono::minutes(10);
  unsigned writers = 2;
  std::size_t mib = 150;
  CLI::App app("Bystander latency while large configuration parts are written");
  app.add_option("--host", options.host, "server address");
  app.add_option("--port", options.port, "server port");
  app.add_option("--writers", writers, "connections that each write one large part")->check(CLI::Range(1u, 64u));
  app.add_option("--mib", mib, "size of each part in MiB")->check(CLI::Range(std::size_t{1}, std::size_t{1000}));
  CLI11_PARSE(app, argc, argv);

  try {
    const std::string payload = setPayload("big", bigPart(mib << 20));

    cvdb::Client bystander(options);
    if (!bystander.connect("bench-bystander")) throw std::runtime_error("cannot connect the bystander");
    json::Object small;
    small.set("theme", json::Value::string("dark"));
    bystander.setCfg("probe", small);

    std::vector<std::unique_ptr<cvdb::Client>> clients;
    for (unsigned i = 0; i < writers; ++i) {
      clients.push_back(std::make_unique<cvdb::Client>(options));
      if (!clients.back()->connect("bench-writer-" + std::to_string(i))) {
        throw std::runtime_error("cannot connect writer " + std::to_string(i));
      }
    }

    std::atomic<bool> go{false};
    std::atomic<bool> writing{false};
    std::atomic<bool> done{false};
    std::vector<double> latencies;
    // The longest read and when it began, from the writers' start.
    double longest = 0;
    double longestAt = 0;
    Clock::time_point writersStart;
    std::string bystanderError;
    std::thread reader([&] {
      latencies.reserve(1 << 20);
      try {
        while (!done) {
          const auto t0 = Clock::now();
          const bool counted = writing;
          if (bystander.getCfg("probe").empty()) throw std::runtime_error("the probe part is missing");
          if (counted) {
            latencies.push_back(ms(Clock::now() - t0));
            if (latencies.back() > longest) {
              longest = latencies.back();
              longestAt = ms(t0 - writersStart);
            }
          }
        }
      } catch (const std::exception& e) {
        bystanderError = e.what();
      }
    });

    std::vector<double> writerMs(writers);
    std::vector<std::string> writerErrors(writers);
    std::vector<std::thread> threads;
    for (unsigned i = 0; i < writers; ++i) {
      threads.emplace_back([&, i] {
        while (!go) std::this_thread::yield();
        const auto t0 = Clock::now();
        try {
          clients[i]->request(Ipc::DB::SetCfgPart::kTag, payload);
        } catch (const std::exception& e) {
          writerErrors[i] = e.what();
        }
        writerMs[i] = ms(Clock::now() - t0);
      });
    }
    // The bystander is under way before the writers start.
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    writersStart = Clock::now();
    writing = true;
    go = true;
    for (auto& t : threads) t.join();
    writing = false;
    done = true;
    reader.join();

    for (unsigned i = 0; i < writers; ++i) {
      if (!writerErrors[i].empty()) throw std::runtime_error("writer " + std::to_string(i) + ": " + writerErrors[i]);
    }
    if (!bystanderError.empty()) throw std::runtime_error("bystander: " + bystanderError);
    if (latencies.empty()) throw std::runtime_error("the bystander made no read while the parts were written");
    std::sort(latencies.begin(), latencies.end());
    const auto pick = [&](double q) {
      return latencies[std::min(latencies.size() - 1, static_cast<std::size_t>(q * latencies.size()))];
    };
    const auto over = [&](double limit) {
      return latencies.end() - std::upper_bound(latencies.begin(), latencies.end(), limit);
    };
    std::printf(
        "bystander p50 %.3f ms p99 %.3f ms max %.3f ms reads %zu (over 20 ms: %td, over 200 ms: %td; longest at +%.0f "
        "ms); %u writers of %zu MiB, slowest %.0f ms\n",
        pick(0.5), pick(0.99), latencies.back(), latencies.size(), over(20), over(200), longestAt, writers, mib,
        *std::max_element(writerMs.begin(), writerMs.end()));
  } catch (const std::exception& e) {
    std::fprintf(stderr, "big_cfg_bench: %s\n", e.what());
    return 1;
  }
  return 0;
}
