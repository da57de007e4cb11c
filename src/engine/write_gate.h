#pragma once
// engine::WriteGate: the in-process write lock of one database.
//
// Writers of a database take it before SQLite's write lock, so that they
// queue here and are handed the lock as soon as it is free, instead of
// polling in SQLite's busy handler. It is a gate, not a mutex: it is not
// owned by a thread, so a transaction may be closed by a thread other than
// the one that opened it.
//
// Thread safety: every member may be called from any thread.
// Failures: none; enter() reports a timeout by returning false.

#include <chrono>
#include <condition_variable>

#include "framework/thread_annotations.h"

namespace engine {

class WriteGate {
 public:
  // Waits at most `timeout` for the gate; true when it is now held.
  bool enter(std::chrono::milliseconds timeout) EXCLUDES(mutex_) {
    sys::MutexLock lock(mutex_);
    if (!freed_.wait_for(lock.native(), timeout, [this]() REQUIRES(mutex_) { return !held_; })) return false;
    held_ = true;
    return true;
  }

  void leave() noexcept EXCLUDES(mutex_) {
    {
      sys::MutexLock lock(mutex_);
      held_ = false;
    }
    freed_.notify_one();
  }

 private:
  sys::Mutex mutex_;
  std::condition_variable freed_;  // with mutex_: the gate was left
  bool held_ GUARDED_BY(mutex_) = false;
};

}  // namespace engine
