// The memory a long value costs: the store must move a long value through
// the caller's buffer only, never through a second copy of its size (which
// binding it whole, or reading its column whole, would make). Kept in an
// executable of its own so that no other test's memory blurs the figures.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <fstream>
#include <thread>

#include "store_fixture.h"

namespace {

// The highest resident size of the process while it runs, sampled every
// millisecond from /proc.
class PeakRss {
 public:
  PeakRss()
      : peak_(current()), thread_([this] {
          while (!stop_) {
            std::int64_t now = current();
            std::int64_t seen = peak_.load();
            while (now > seen && !peak_.compare_exchange_weak(seen, now)) {
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
          }
        }) {}
  ~PeakRss() { stop(); }
  std::int64_t stop() {
    stop_ = true;
    if (thread_.joinable()) thread_.join();
    return peak_;
  }

  static std::int64_t current() {
    std::ifstream statm("/proc/self/statm");
    std::int64_t size = 0, resident = 0;
    statm >> size >> resident;
    return resident * sysconf(_SC_PAGESIZE);
  }

 private:
  std::atomic<bool> stop_{false};
  std::atomic<std::int64_t> peak_;
  std::thread thread_;
};

constexpr std::int64_t kMiB = 1 << 20;
constexpr std::int64_t kValue = 200 * kMiB;
// Page cache of the session, blob chunks, allocator slack.
constexpr std::int64_t kOverhead = 48 * kMiB;

using LongValueMemory = store_testing::StoreTest;

TEST_F(LongValueMemory, SavingAndLoading200MiBHoldsTheValueOnce) {
#if defined(__SANITIZE_THREAD__)
  // Its shadow memory, four times what the process touches, is part of the
  // resident size measured here.
  GTEST_SKIP() << "the resident size is not the store's under ThreadSanitizer";
#endif
  auto db = open("big");
  std::int64_t saveCost = 0;
  {
    std::string value(static_cast<std::size_t>(kValue), '\0');
    for (std::size_t i = 0; i < value.size(); i += 4096) value[i] = static_cast<char>(i >> 12);
    const std::int64_t before = PeakRss::current();
    PeakRss peak;
    db->saveMetaBlob(value.data(), value.size(), "value");
    saveCost = peak.stop() - before;
  }
  const std::int64_t before = PeakRss::current();
  PeakRss peak;
  const MemBuffer back = db->loadMetaBlob("value");
  const std::int64_t loadCost = peak.stop() - before;
  ASSERT_EQ(back.size(), static_cast<std::uint64_t>(kValue));
  EXPECT_EQ(back.data()[4096 * 3], 3);

  std::printf("200 MiB value: save costs %lld MiB beyond the caller's buffer, load costs %lld MiB\n",
              static_cast<long long>(saveCost / kMiB), static_cast<long long>(loadCost / kMiB));
  EXPECT_LT(saveCost, kOverhead);
  EXPECT_LT(loadCost, kValue + kOverhead);
}

}  // namespace
