#pragma once
// Internal to the transport: the server-wide bound on the memory that
// connections hold in buffers, and the return of freed memory to the system.
//
// MemoryBudget counts the bytes of answers queued for clients and the bytes
// that large request frames have announced, while they are received and
// while their command runs. Queued answers are charged whatever the usage
// (a running command's answer has nowhere else to go); requests are
// admitted only while the usage allows it: a new command only while the
// usage is below the limit, a large frame only when its whole length fits
// beside what is counted already, or when nothing is counted at all (so a
// frame larger than the whole budget is still served, alone). A request
// that is not admitted registers a wake-up, which is called once the usage
// has fallen far enough for it; the caller then asks again.
//
// While a frame larger than the whole budget waits, nothing else is
// admitted: otherwise a steady stream of small requests would keep the
// usage above zero and the large frame would wait for ever.
//
// MemoryTrimmer hands memory that the allocator keeps after a burst back to
// the system: once enough bytes have been released it calls the trim
// function (malloc_trim by default) on a thread of its own, a moment later,
// at most once per delay.
//
// Thread safety: every member may be called from any thread. Wake-ups are
// called on the thread whose release made room, outside the budget's lock;
// they must only hand the work on (post it), not ask the budget again. A
// wake-up may own what it wakes (a connection that waits has no operation
// in flight that would keep it alive); the budget drops it outside its lock,
// once called or forgotten.

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <limits>
#include <thread>
#include <unordered_map>
#include <vector>

#include "framework/thread_annotations.h"

namespace Ipc::detail {

class MemoryBudget {
 public:
  using Wake = std::function<void()>;
  static constexpr std::uint64_t kUnlimited = std::numeric_limits<std::uint64_t>::max();

  // limit 0 means no limit.
  explicit MemoryBudget(std::uint64_t limit) noexcept : limit_(limit == 0 ? kUnlimited : limit) {}
  MemoryBudget(const MemoryBudget&) = delete;
  MemoryBudget& operator=(const MemoryBudget&) = delete;

  // Counts bytes whatever the usage (answers of running commands).
  void charge(std::uint64_t bytes) noexcept { used_.fetch_add(bytes); }
  // Gives counted bytes back and wakes the waiters that now fit.
  void release(std::uint64_t bytes) EXCLUDES(mutex_);

  // Whether the request of `key` may go on: with bytes 0, a request that
  // needs no reservation (a frame already received); otherwise a frame of
  // that length, whose bytes are then counted. When not, `wake` is kept
  // (replacing what key registered before) and called once it may.
  bool admit(const void* key, std::uint64_t bytes, Wake wake) EXCLUDES(mutex_);
  // Drops what key registered (its owner has ended).
  void forget(const void* key) EXCLUDES(mutex_);

  // Whether a request that needs no reservation may go on, without taking
  // the lock: nobody waits and the usage is below the limit.
  bool admitsAtOnce() const noexcept { return !hasWaiters_.load() && used_.load() < limit_; }

  std::uint64_t limit() const noexcept { return limit_; }
  std::uint64_t used() const noexcept { return used_.load(); }
  std::size_t waiting() const EXCLUDES(mutex_);

 private:
  struct Waiter {
    std::uint64_t bytes;
    Wake wake;
  };
  bool fits(std::uint64_t used, std::uint64_t bytes) const REQUIRES(mutex_);
  // Removes a waiter and returns its wake-up, to be released (or called)
  // after the lock: it may hold the last reference to its owner.
  Wake drop(std::unordered_map<const void*, Waiter>::iterator it) REQUIRES(mutex_);
  // Takes every waiter that fits now out of the list and adds its wake-up
  // to ready, to be called after the lock.
  void takeFitting(std::vector<Wake>& ready) REQUIRES(mutex_);

  const std::uint64_t limit_;
  std::atomic<std::uint64_t> used_{0};
  // Set while waiters_ is not empty; read without the lock by release().
  std::atomic<bool> hasWaiters_{false};
  mutable sys::Mutex mutex_;
  std::unordered_map<const void*, Waiter> waiters_ GUARDED_BY(mutex_);
  std::size_t oversizeWaiting_ GUARDED_BY(mutex_) = 0;  // waiters whose frame exceeds the limit
};

class MemoryTrimmer {
 public:
  using Trim = std::function<void()>;
  // Trims `delay` after `threshold` bytes have been released since the last
  // trim. A zero delay switches trimming off.
  MemoryTrimmer(std::uint64_t threshold, std::chrono::milliseconds delay, Trim trim = defaultTrim());
  ~MemoryTrimmer();
  MemoryTrimmer(const MemoryTrimmer&) = delete;
  MemoryTrimmer& operator=(const MemoryTrimmer&) = delete;

  void released(std::uint64_t bytes) EXCLUDES(mutex_);
  std::uint64_t trims() const noexcept { return trims_.load(); }

  // Returns free memory of every allocator arena to the system.
  static Trim defaultTrim();

 private:
  void run() EXCLUDES(mutex_);

  const std::uint64_t threshold_;
  const std::chrono::milliseconds delay_;
  const Trim trim_;
  std::atomic<std::uint64_t> pending_{0};
  std::atomic<std::uint64_t> trims_{0};
  sys::Mutex mutex_;
  std::condition_variable changed_;  // with mutex_: a trim is due, or the trimmer ends
  bool due_ GUARDED_BY(mutex_) = false;
  bool ending_ GUARDED_BY(mutex_) = false;
  std::thread thread_ GUARDED_BY(mutex_);  // started at the first trim
};

}  // namespace Ipc::detail
