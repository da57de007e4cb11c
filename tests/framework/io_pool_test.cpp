// The elastic I/O threads: blocked commands never keep other work waiting
// for long, short commands do not make the pool grow, idle spares go, and
// the limit on threads is reported.

#include "framework/io_pool.h"

#include <gtest/gtest.h>

#include <atomic>
#include <boost/asio/defer.hpp>
#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/post.hpp>
#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <thread>

namespace {

using namespace std::chrono_literals;
using Ipc::detail::IoPool;
namespace asio = boost::asio;

// A gate that commands wait at until the test opens it.
class Gate {
 public:
  void open() {
    std::lock_guard lock(mutex_);
    open_ = true;
    changed_.notify_all();
  }
  void pass() {
    std::unique_lock lock(mutex_);
    ++waiting_;
    changed_.notify_all();
    changed_.wait(lock, [this] { return open_; });
  }
  bool waitForWaiting(int n) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, 10s, [&] { return waiting_ >= n; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  bool open_ = false;
  int waiting_ = 0;
};

template <typename Pred>
bool eventually(Pred pred) {
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (!pred()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(2ms);
  }
  return true;
}

// An I/O context kept running by a work guard, and a pool on it.
struct Rig {
  explicit Rig(IoPool::Options options, IoPool::ErrorReport report = {})
      : io(std::make_shared<asio::io_context>()), work(io->get_executor()), pool(options, std::move(report)) {
    pool.start(io);
  }
  ~Rig() { stop(); }
  void stop() {
    work.reset();
    pool.join();
  }
  // A command: runs in a busy scope, as the transport runs them.
  template <typename F>
  void command(F f) {
    asio::post(*io, [this, f = std::move(f)]() mutable {
      IoPool::Busy busy(pool);
      f();
    });
  }

  std::shared_ptr<asio::io_context> io;
  asio::executor_work_guard<asio::io_context::executor_type> work;
  IoPool pool;
};

// Six commands blocked at once, and plain I/O work that still runs: only
// possible with spares beside the two base threads.
void blockSixAndServe(Rig& rig, Gate& gate) {
  for (int i = 0; i < 6; ++i) rig.command([&] { gate.pass(); });
  ASSERT_TRUE(gate.waitForWaiting(6));
  EXPECT_EQ(rig.pool.busyCount(), 6u);
  std::promise<void> ran;
  asio::post(*rig.io, [&] { ran.set_value(); });
  ASSERT_EQ(ran.get_future().wait_for(10s), std::future_status::ready);
  EXPECT_GE(rig.pool.threadCount(), 7u);
}

TEST(IoPool, BlockedCommandsNeverKeepOtherWorkWaitingAndIdleSparesEnd) {
  Rig rig({2, 64, 50ms, 1000us});
  Gate gate;
  blockSixAndServe(rig, gate);
  gate.open();
  EXPECT_TRUE(eventually([&] { return rig.pool.threadCount() == 2; }));
  std::promise<void> after;
  rig.command([&] { after.set_value(); });
  EXPECT_EQ(after.get_future().wait_for(10s), std::future_status::ready);
}

TEST(IoPool, SparesNoLongerNeededParkAndAreWokenBeforeNewOnesStart) {
  Rig rig({2, 64, 30s, 1000us});
  Gate first;
  blockSixAndServe(rig, first);
  first.open();
  const std::size_t threads = rig.pool.threadCount();
  // Spares step aside after a handler once no command has needed them for
  // a while; plain I/O work gives them handlers to finish.
  ASSERT_TRUE(eventually([&] {
    for (int i = 0; i < 50; ++i) asio::post(*rig.io, [] {});
    return rig.pool.activeCount() == 2;
  }));
  EXPECT_EQ(rig.pool.threadCount(), threads);  // parked, not ended

  // Woken again, then stepping aside again, several times over. Handlers
  // run one at a time, each deferring a follow-up as a read defers its
  // command. A spare that steps aside after such a handler must run the
  // follow-up first: Asio hands it back to the shared queue without waking
  // a thread, so it would wait for an unrelated event (with a lone client,
  // for ever).
  for (int cycle = 0; cycle < 3; ++cycle) {
    Gate again;
    blockSixAndServe(rig, again);
    EXPECT_EQ(rig.pool.threadCount(), threads);  // woken, none started
    again.open();
    for (int round = 0; rig.pool.activeCount() > 2; ++round) {
      ASSERT_LT(round, 1000000);
      std::promise<void> followed;
      asio::post(*rig.io, [&] { asio::defer(*rig.io, [&] { followed.set_value(); }); });
      ASSERT_EQ(followed.get_future().wait_for(10s), std::future_status::ready) << "a follow-up was left unrun";
    }
  }
}

// Every base thread blocked for longer than the watcher takes to go
// quiet: the spare that serves meanwhile must neither park nor end, since
// nothing would serve the other work (nor wake the watcher) until a
// blocked command ended. Each round posts work for well past the quiet
// period and wants every piece run within 250 ms: unserved work would wait
// for the gate, which opens only after the round (the bound leaves room
// for a loaded machine).
TEST(IoPool, ASpareStaysWhileEveryOtherThreadBlocksAndGoesWhenTheyAreFree) {
  Rig rig({2, 64, 200ms, 1000us});
  for (int round = 0; round < 5; ++round) {
    Gate gate;
    // Opened however the round ends, so that a failure cannot hang the rig.
    const std::shared_ptr<void> opener(nullptr, [&](void*) { gate.open(); });
    for (int i = 0; i < 2; ++i) rig.command([&] { gate.pass(); });
    ASSERT_TRUE(gate.waitForWaiting(2));
    const auto until = std::chrono::steady_clock::now() + 600ms;
    while (std::chrono::steady_clock::now() < until) {
      auto ran = std::make_shared<std::promise<void>>();
      asio::post(*rig.io, [ran] { ran->set_value(); });
      ASSERT_EQ(ran->get_future().wait_for(250ms), std::future_status::ready) << "round " << round;
      std::this_thread::sleep_for(5ms);
    }
    gate.open();
    // Free again: the spare goes once it has been idle for spareIdle.
    EXPECT_TRUE(eventually([&] { return rig.pool.threadCount() == 2; })) << rig.pool.threadCount();
  }
}

TEST(IoPool, ShortCommandsDoNotMakeThePoolGrow) {
  Rig rig({2, 64, 30s, 1000us});
  std::atomic<int> left{20000};
  std::promise<void> done;
  for (int i = 0; i < 20000; ++i) {
    rig.command([&] {
      volatile unsigned x = 0;
      for (int k = 0; k < 200; ++k) x = x + static_cast<unsigned>(k);
      if (--left == 0) done.set_value();
    });
  }
  ASSERT_EQ(done.get_future().wait_for(60s), std::future_status::ready);
  // Both threads are in a command most of the time; a spare is due only
  // when neither finishes one for a whole millisecond (a long preemption on
  // a loaded machine), not whenever both are busy.
  EXPECT_LE(rig.pool.threadCount(), 4u);
}

TEST(IoPool, FailingHandlersAndTheThreadLimitAreReportedAndWorkWaitsForACommandToEnd) {
  std::mutex m;
  std::vector<std::string> reports;
  Rig rig({1, 2, 30s, 500us}, [&](const std::string& t) {
    std::lock_guard lock(m);
    reports.push_back(t);
  });
  const auto reported = [&](std::size_t n) {
    return eventually([&] {
      std::lock_guard lock(m);
      return reports.size() >= n;
    });
  };
  // A handler that throws is reported, and its thread goes on.
  asio::post(*rig.io, [] { throw std::runtime_error("boom"); });
  ASSERT_TRUE(reported(1));

  Gate gate;
  for (int i = 0; i < 2; ++i) rig.command([&] { gate.pass(); });
  ASSERT_TRUE(gate.waitForWaiting(2));
  std::promise<void> ran;
  asio::post(*rig.io, [&] { ran.set_value(); });
  auto ranFuture = ran.get_future();
  ASSERT_TRUE(reported(2));
  EXPECT_EQ(ranFuture.wait_for(20ms), std::future_status::timeout);
  gate.open();
  EXPECT_EQ(ranFuture.wait_for(10s), std::future_status::ready);
  std::lock_guard lock(m);
  ASSERT_EQ(reports.size(), 2u);  // the limit once
  EXPECT_NE(reports[0].find("boom"), std::string::npos) << reports[0];
  EXPECT_NE(reports[1].find("All 2 I/O threads are busy in commands"), std::string::npos) << reports[1];
}

TEST(IoPool, ACommandMayReleaseTheLastOwnerOfThePool) {
  auto rig = std::make_shared<Rig>(IoPool::Options{2, 4, 30s, 1000us});
  std::promise<void> released;
  Rig* raw = rig.get();
  // The command may run, and release every other owner of the context,
  // before post has returned from waking a thread for it: post must not
  // wake it through a context that is gone.
  const auto io = rig->io;
  raw->command([owner = std::move(rig), &released]() mutable {
    owner->work.reset();
    owner.reset();  // joins the other threads, detaches this one
    released.set_value();
  });
  EXPECT_EQ(released.get_future().wait_for(10s), std::future_status::ready);
}

}  // namespace
