// The memory budget's admission rules and wake-ups, and the trimmer's
// timing, without sockets.

#include "framework/memory_budget.h"

#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <thread>
#include <vector>

namespace {

using Ipc::detail::MemoryBudget;
using Ipc::detail::MemoryTrimmer;
using namespace std::chrono_literals;

// Keys of waiting requests and how often each was woken.
struct Waiters {
  int woken[4] = {0, 0, 0, 0};
  const void* key(int i) const { return &woken[i]; }
  MemoryBudget::Wake wake(int i) {
    return [this, i] { ++woken[i]; };
  }
};

TEST(MemoryBudget, NewRequestsWaitWhileTheUsageIsAtTheLimitAndAreWokenOnceWhenItFalls) {
  MemoryBudget budget(1000);
  Waiters w;
  EXPECT_TRUE(budget.admitsAtOnce());
  // Answers are charged past the limit.
  budget.charge(600);
  budget.charge(600);
  EXPECT_EQ(budget.used(), 1200u);
  EXPECT_FALSE(budget.admitsAtOnce());
  EXPECT_FALSE(budget.admit(w.key(0), 0, w.wake(0)));
  // Asking again replaces the registration rather than adding one.
  EXPECT_FALSE(budget.admit(w.key(0), 0, w.wake(0)));
  EXPECT_FALSE(budget.admit(w.key(1), 0, w.wake(1)));
  EXPECT_EQ(budget.waiting(), 2u);

  budget.release(200);  // at the limit: still no room
  EXPECT_EQ(w.woken[0] + w.woken[1], 0);
  budget.release(1);
  EXPECT_EQ(w.woken[0], 1);
  EXPECT_EQ(w.woken[1], 1);
  EXPECT_EQ(budget.waiting(), 0u);
  budget.release(999);  // nobody left to wake
  EXPECT_EQ(w.woken[0], 1);
  EXPECT_EQ(budget.used(), 0u);
  EXPECT_TRUE(budget.admitsAtOnce());
}

TEST(MemoryBudget, ALargeFrameReservesItsWholeLengthAndWaitsUntilItFits) {
  MemoryBudget budget(1000);
  Waiters w;
  ASSERT_TRUE(budget.admit(w.key(0), 600, w.wake(0)));
  EXPECT_EQ(budget.used(), 600u);
  // A second frame of that size would take both past the limit.
  EXPECT_FALSE(budget.admit(w.key(1), 600, w.wake(1)));
  // A request without a reservation still fits below the limit.
  EXPECT_TRUE(budget.admit(w.key(2), 0, w.wake(2)));
  budget.charge(100);
  budget.release(100);  // 600 used: the frame still does not fit
  EXPECT_EQ(w.woken[1], 0);
  budget.release(200);  // 400 + 600 fits exactly
  EXPECT_EQ(w.woken[1], 1);
  EXPECT_TRUE(budget.admit(w.key(1), 600, w.wake(1)));
  EXPECT_EQ(budget.used(), 1000u);
  budget.release(1000);
  EXPECT_EQ(budget.used(), 0u);
}

TEST(MemoryBudget, AFrameLargerThanTheBudgetGoesAloneAndHoldsBackOthersUntilItsTurn) {
  MemoryBudget budget(1000);
  Waiters w;
  // Alone, it goes at once.
  ASSERT_TRUE(budget.admit(w.key(0), 5000, w.wake(0)));
  EXPECT_FALSE(budget.admit(w.key(1), 0, w.wake(1)));
  budget.release(5000);
  EXPECT_EQ(w.woken[1], 1);

  // Beside other usage it waits for the usage to drain, and meanwhile no
  // other request is admitted, so a steady stream of them cannot starve it.
  budget.charge(10);
  EXPECT_FALSE(budget.admit(w.key(0), 5000, w.wake(0)));
  EXPECT_FALSE(budget.admit(w.key(1), 0, w.wake(1)));
  EXPECT_FALSE(budget.admit(w.key(2), 100, w.wake(2)));
  budget.charge(5);
  budget.release(5);
  EXPECT_EQ(w.woken[0], 0);
  budget.release(10);
  EXPECT_EQ(w.woken[0], 1);
  EXPECT_EQ(w.woken[1], 2);
  EXPECT_EQ(w.woken[2], 1);
  EXPECT_TRUE(budget.admit(w.key(0), 5000, w.wake(0)));

  // A waiting oversize frame whose connection ends lets the others go.
  budget.release(5000);
  budget.charge(10);
  EXPECT_FALSE(budget.admit(w.key(0), 5000, w.wake(0)));
  EXPECT_FALSE(budget.admit(w.key(1), 0, w.wake(1)));
  budget.forget(w.key(0));
  EXPECT_EQ(w.woken[1], 3);
  EXPECT_EQ(w.woken[0], 1);
  EXPECT_EQ(budget.waiting(), 0u);
}

// Releases and admissions that cross on different threads never lose a
// wake-up: a request that was refused saw usage that a later release gives
// back, so every refused request is woken exactly once.
TEST(MemoryBudget, ConcurrentReleasesWakeEveryRefusedRequest) {
  MemoryBudget budget(100);
  constexpr int kRounds = 20000;
  std::atomic<bool> done{false};
  std::atomic<int> spin{0};
  std::atomic<int> refused{0};
  std::atomic<int> woken{0};
  std::thread holder([&] {
    for (int i = 0; i < kRounds; ++i) {
      budget.charge(100);
      // Holds the budget full for a moment, so that requests meet it full.
      for (int k = 0; k < 100; ++k) spin.fetch_add(1, std::memory_order_relaxed);
      budget.release(100);
    }
    done = true;
  });
  // Every request with a key of its own: a refused one stays registered
  // until a release wakes it.
  for (std::uintptr_t key = 1; !done; ++key) {
    if (!budget.admit(reinterpret_cast<const void*>(key), 0, [&] { ++woken; })) ++refused;
  }
  holder.join();
  EXPECT_GT(refused.load(), 0);
  EXPECT_EQ(woken.load(), refused.load());
  EXPECT_EQ(budget.waiting(), 0u);
  EXPECT_EQ(budget.used(), 0u);
}

TEST(MemoryTrimmer, TrimsOnceAfterABurstAndNotForSmallReleases) {
  std::mutex mutex;
  std::condition_variable changed;
  int trims = 0;
  MemoryTrimmer trimmer(1000, 200ms, [&] {
    std::lock_guard lock(mutex);
    ++trims;
    changed.notify_all();
  });
  trimmer.released(999);
  // A burst: many releases past the threshold make one trim.
  for (int i = 0; i < 50; ++i) trimmer.released(100);
  {
    std::unique_lock lock(mutex);
    ASSERT_TRUE(changed.wait_for(lock, 10s, [&] { return trims > 0; }));
    EXPECT_EQ(trims, 1);
  }
  // The count started again with the trim: 999 more bytes are not enough.
  trimmer.released(999);
  trimmer.released(1);
  std::unique_lock lock(mutex);
  ASSERT_TRUE(changed.wait_for(lock, 10s, [&] { return trims == 2; }));
}

}  // namespace
