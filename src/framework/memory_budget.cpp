#include "framework/memory_budget.h"

#include <system_error>
#include <vector>

#if defined(__GLIBC__)
#include <malloc.h>
#endif

namespace Ipc::detail {

// ---------------------------------------------------------------- budget

bool MemoryBudget::fits(std::uint64_t used, std::uint64_t bytes) const {
  // An empty budget takes anything, a frame larger than the limit included.
  if (used == 0) return true;
  if (bytes > limit_) return false;
  // Room is kept for the oversize frame that waits for the usage to drain.
  if (oversizeWaiting_ > 0) return false;
  return used < limit_ && bytes <= limit_ - used;
}

MemoryBudget::Wake MemoryBudget::drop(std::unordered_map<const void*, Waiter>::iterator it) {
  if (it->second.bytes > limit_) --oversizeWaiting_;
  Wake wake = std::move(it->second.wake);
  waiters_.erase(it);
  return wake;
}

void MemoryBudget::release(std::uint64_t bytes) {
  used_.fetch_sub(bytes);
  // admit() sets the flag before it reads the usage, and this reads the flag
  // after it has changed the usage: of a release and an admission that
  // cross, one of the two sees the other.
  if (!hasWaiters_.load()) return;
  std::vector<Wake> ready;
  {
    sys::MutexLock lock(mutex_);
    takeFitting(ready);
  }
  for (auto& wake : ready) {
    if (wake) wake();
  }
}

bool MemoryBudget::admit(const void* key, std::uint64_t bytes, Wake wake) {
  // A wake-up may own what it wakes: the one replaced goes after the lock.
  Wake replaced;
  sys::MutexLock lock(mutex_);
  hasWaiters_.store(true);
  if (auto it = waiters_.find(key); it != waiters_.end()) replaced = drop(it);
  if (fits(used_.load(), bytes)) {
    used_.fetch_add(bytes);
    hasWaiters_.store(!waiters_.empty());
    return true;
  }
  if (bytes > limit_) ++oversizeWaiting_;
  waiters_.emplace(key, Waiter{bytes, std::move(wake)});
  return false;
}

void MemoryBudget::forget(const void* key) {
  std::vector<Wake> ready;
  Wake forgotten;  // released after the lock, like the ones called
  {
    sys::MutexLock lock(mutex_);
    const auto it = waiters_.find(key);
    if (it == waiters_.end()) return;
    const bool oversize = it->second.bytes > limit_;
    forgotten = drop(it);
    hasWaiters_.store(!waiters_.empty());
    // The others may have waited only for that frame to get its turn.
    if (oversize && oversizeWaiting_ == 0) takeFitting(ready);
  }
  for (auto& wake : ready) {
    if (wake) wake();
  }
}

void MemoryBudget::takeFitting(std::vector<Wake>& ready) {
  const std::uint64_t used = used_.load();
  for (auto it = waiters_.begin(); it != waiters_.end();) {
    if (fits(used, it->second.bytes)) {
      auto next = std::next(it);
      ready.push_back(drop(it));
      it = next;
    } else {
      ++it;
    }
  }
  hasWaiters_.store(!waiters_.empty());
}

std::size_t MemoryBudget::waiting() const {
  sys::MutexLock lock(mutex_);
  return waiters_.size();
}

// ---------------------------------------------------------------- trimmer

MemoryTrimmer::MemoryTrimmer(std::uint64_t threshold, std::chrono::milliseconds delay, Trim trim)
    : threshold_(threshold == 0 ? 1 : threshold), delay_(delay), trim_(std::move(trim)) {}

MemoryTrimmer::~MemoryTrimmer() {
  std::thread thread;
  {
    sys::MutexLock lock(mutex_);
    ending_ = true;
    thread = std::move(thread_);
  }
  changed_.notify_all();
  if (thread.joinable()) thread.join();
}

MemoryTrimmer::Trim MemoryTrimmer::defaultTrim() {
  return [] {
#if defined(__GLIBC__)
    malloc_trim(0);
#endif
  };
}

void MemoryTrimmer::released(std::uint64_t bytes) {
  if (delay_.count() <= 0 || bytes == 0) return;
  // Only the release that crosses the threshold goes further; the count
  // starts again when the trim runs.
  const std::uint64_t before = pending_.fetch_add(bytes);
  if (before >= threshold_ || before + bytes < threshold_) return;
  {
    sys::MutexLock lock(mutex_);
    if (ending_) return;
    due_ = true;
    if (!thread_.joinable()) {
      try {
        thread_ = std::thread([this] { run(); });
      } catch (const std::system_error&) {
        // No thread now: the next crossing tries again.
        due_ = false;
        pending_.store(0);
      }
      return;
    }
  }
  changed_.notify_all();
}

void MemoryTrimmer::run() {
  sys::MutexLock lock(mutex_);
  for (;;) {
    changed_.wait(lock.native(), [this]() REQUIRES(mutex_) { return due_ || ending_; });
    if (ending_) return;
    // A moment later: the release that made the trim due is usually one of
    // a burst, and the memory of the rest goes in the same trim.
    const auto at = std::chrono::steady_clock::now() + delay_;
    changed_.wait_until(lock.native(), at, [this]() REQUIRES(mutex_) { return ending_; });
    if (ending_) return;
    due_ = false;
    pending_.store(0);
    lock.unlock();
    trim_();
    trims_.fetch_add(1);
    lock.lock();
  }
}

}  // namespace Ipc::detail
