// SIGTERM while clients write. Each writer owns one configuration part or
// one data file and writes increasing sequence numbers to it; it records
// the last write that was answered and the one that met the Bye. After the
// stop the server starts again on the same root: every part and file must
// hold the last answered sequence number exactly. Holding the number of
// the write that met the Bye would mean a write was carried out while its
// client was told the server was stopping; holding an older one, that an
// answered write was lost.
//
// CVDB_STOP_ROUNDS sets the number of stops (3 by default).

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <mutex>
#include <thread>

#include "e2e_support.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using namespace e2e;
using Clock = std::chrono::steady_clock;
using testing_support::ServerOptions;
using testing_support::TempDir;

constexpr int kWriters = 6;
constexpr int kDatabases = 3;
// Writes every writer gets answered before the stop comes.
constexpr int kWritesBeforeStop = 15;

int rounds() {
  const char* v = std::getenv("CVDB_STOP_ROUNDS");
  return v ? std::max(1, std::atoi(v)) : 3;
}

std::string dbOf(int writer) { return "stop" + std::to_string(writer % kDatabases); }
bool writesData(int writer) { return writer % 2 == 1; }
std::string keyOf(int writer) { return "w" + std::to_string(writer); }
std::string contentOf(std::int64_t seq) { return "seq:" + std::to_string(seq) + ":" + std::string(3000, 'x'); }

// What one writer saw in one round.
struct Writer {
  std::int64_t answered = 0;  // last sequence number answered with success
  std::int64_t byed = 0;      // the sequence number whose request met the Bye
  std::string reason;         // why the connection ended
};

class StopUnderLoad : public ::testing::Test {
 protected:
  fs::path root() const { return dir_.path() / "root"; }
  std::unique_ptr<ServerProcess> start() {
    fs::create_directories(root());
    ServerOptions o;
    o.configJson = R"({"ServerPort": 0, "DBRoot": ")" + root().string() + R"(/"})";
    return std::make_unique<ServerProcess>(kServer, o);
  }

  // The sequence number stored for the writer, 0 for none.
  static std::int64_t stored(cvdb::Client& c, int w) {
    if (writesData(w)) {
      const SharedMemBuffer b = c.getData(keyOf(w), "f.bin");
      const std::string text(reinterpret_cast<const char*>(b.data()), b.size());
      return text.size() > 4 ? std::stoll(text.substr(4)) : 0;
    }
    const json::Value v = c.getCfg(keyOf(w));
    if (v.empty() || !v.isObject()) return 0;
    return json::Object(v).get("seq").asInteger();
  }

  TempDir dir_;
};

TEST_F(StopUnderLoad, NoWriteThatMetTheByeWasCarriedOutAndNoAnsweredWriteIsLost) {
  std::int64_t next[kWriters] = {};
  auto longest = Clock::duration::zero();
  int byes = 0;
  for (int round = 0; round < rounds(); ++round) {
    auto server = start();
    std::mutex mutex;
    std::condition_variable changed;
    int ready = 0;
    Writer seen[kWriters];
    std::vector<std::thread> threads;
    for (int w = 0; w < kWriters; ++w) {
      threads.emplace_back([&, w] {
        auto c = clientOf(*server, dbOf(w));
        int answered = 0;
        for (;;) {
          const std::int64_t seq = ++next[w];
          try {
            if (writesData(w)) {
              c->setData(keyOf(w), "f.bin", bytes(contentOf(seq)));
            } else {
              json::Object part;
              part.set("seq", json::Value::integer(seq));
              part.set("pad", json::Value::string(std::string(3000, 'y')));
              c->setCfg(keyOf(w), part);
            }
          } catch (const cvdb::ConnectionEnded& e) {
            std::lock_guard lock(mutex);
            seen[w].byed = seq;
            seen[w].reason = e.byServer() ? e.reason() : "(dropped) " + e.reason();
            return;
          }
          seen[w].answered = seq;
          if (++answered == kWritesBeforeStop) {
            std::lock_guard lock(mutex);
            ++ready;
            changed.notify_all();
          }
        }
      });
    }
    {
      std::unique_lock lock(mutex);
      ASSERT_TRUE(changed.wait_for(lock, std::chrono::seconds(60), [&] { return ready == kWriters; }));
    }
    const auto stopAt = Clock::now();
    EXPECT_EQ(server->stop(SIGTERM), 0);
    longest = std::max(longest, Clock::now() - stopAt);
    for (auto& t : threads) t.join();
    server.reset();

    auto again = start();
    for (int w = 0; w < kWriters; ++w) {
      SCOPED_TRACE("round " + std::to_string(round) + ", writer " + keyOf(w));
      EXPECT_EQ(seen[w].reason, "Server is stopping");
      auto c = clientOf(*again, dbOf(w));
      const std::int64_t have = stored(*c, w);
      EXPECT_NE(have, seen[w].byed) << "a write was carried out while its client got the Bye";
      EXPECT_EQ(have, seen[w].answered) << "an answered write is missing";
      next[w] = std::max(next[w], have);
      if (seen[w].byed != 0) ++byes;
    }
  }
  std::cout << "stops: " << rounds() << ", writes that met the Bye: " << byes << " (none carried out), longest stop: "
            << std::chrono::duration_cast<std::chrono::milliseconds>(longest).count() << " ms\n";
}

}  // namespace
