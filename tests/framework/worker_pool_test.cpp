// The elastic worker pool: blocking tasks never wait for each other, idle
// threads go, shutdown drops what has not started and waits for the rest.

#include "framework/worker_pool.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <thread>

namespace {

using namespace std::chrono_literals;

// A gate that tasks wait at until the test opens it.
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
  bool waitForWaiting(int n, std::chrono::milliseconds timeout = 10s) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return waiting_ >= n; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  bool open_ = false;
  int waiting_ = 0;
};

TEST(WorkerPool, BlockingTasksAllRunAtOnceBeyondTheKeptThreads) {
  Ipc::WorkerPool pool({2, 64, 30s}, {});
  Gate gate;
  for (int i = 0; i < 12; ++i) ASSERT_TRUE(pool.submit([&] { gate.pass(); }));
  // Only possible if twelve threads run at the same time.
  EXPECT_TRUE(gate.waitForWaiting(12));
  EXPECT_GE(pool.threadCount(), 12u);
  gate.open();
  pool.shutdown();
}

TEST(WorkerPool, IdleThreadsBeyondTheKeptOnesEnd) {
  Ipc::WorkerPool pool({1, 64, 20ms}, {});
  Gate gate;
  for (int i = 0; i < 6; ++i) pool.submit([&] { gate.pass(); });
  ASSERT_TRUE(gate.waitForWaiting(6));
  gate.open();
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (pool.threadCount() > 1 && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(5ms);
  EXPECT_EQ(pool.threadCount(), 1u);
  // The one kept thread still works.
  std::promise<void> ran;
  pool.submit([&] { ran.set_value(); });
  EXPECT_EQ(ran.get_future().wait_for(10s), std::future_status::ready);
}

TEST(WorkerPool, AtTheThreadLimitTasksWaitTheirTurnAndTheProblemIsReported) {
  std::mutex m;
  std::vector<std::string> reports;
  Ipc::WorkerPool pool({1, 2, 30s}, [&](const std::string& t) {
    std::lock_guard lock(m);
    reports.push_back(t);
  });
  Gate gate;
  std::atomic<int> done{0};
  for (int i = 0; i < 5; ++i) pool.submit([&] {
      gate.pass();
      ++done;
    });
  ASSERT_TRUE(gate.waitForWaiting(2));
  EXPECT_EQ(pool.threadCount(), 2u);
  gate.open();
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (done < 5 && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(5ms);
  EXPECT_EQ(done, 5);
  std::lock_guard lock(m);
  ASSERT_EQ(reports.size(), 1u);  // once per burst, not once per task
  EXPECT_NE(reports[0].find("busy"), std::string::npos);
}

TEST(WorkerPool, ShutdownDropsQueuedTasksAndWaitsForRunningOnes) {
  Ipc::WorkerPool pool({1, 1, 30s}, {});
  Gate gate;
  std::atomic<bool> queuedRan{false};
  std::atomic<bool> runningEnded{false};
  pool.submit([&] {
    gate.pass();
    runningEnded = true;
  });
  pool.submit([&] { queuedRan = true; });
  ASSERT_TRUE(gate.waitForWaiting(1));

  auto stopped = std::async(std::launch::async, [&] { pool.shutdown(); });
  EXPECT_EQ(stopped.wait_for(100ms), std::future_status::timeout);
  gate.open();
  stopped.get();
  EXPECT_TRUE(runningEnded);
  EXPECT_FALSE(queuedRan);
  EXPECT_FALSE(pool.submit([] {}));
  EXPECT_EQ(pool.threadCount(), 0u);
}

TEST(WorkerPool, AFailingTaskIsReportedAndItsThreadGoesOn) {
  std::promise<std::string> report;
  Ipc::WorkerPool pool({1, 1, 30s}, [&](const std::string& t) {
    if (t.find("boom") != std::string::npos) report.set_value(t);
  });
  pool.submit([] { throw std::runtime_error("boom"); });
  std::promise<void> after;
  pool.submit([&] { after.set_value(); });
  auto text = report.get_future();
  EXPECT_EQ(text.wait_for(10s), std::future_status::ready);
  EXPECT_EQ(after.get_future().wait_for(10s), std::future_status::ready);
}

TEST(WorkerPool, ATaskMayDestroyThePoolThatRunsIt) {
  auto pool = std::make_shared<Ipc::WorkerPool>(Ipc::WorkerPool::Options{1, 4, 30s}, Ipc::WorkerPool::ErrorReport{});
  std::promise<void> destroyed;
  auto* raw = pool.get();
  raw->submit([p = std::move(pool), &destroyed]() mutable {
    p.reset();
    destroyed.set_value();
  });
  EXPECT_EQ(destroyed.get_future().wait_for(10s), std::future_status::ready);
}

}  // namespace
