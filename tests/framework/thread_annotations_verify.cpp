// Not a test binary: clang compiles this file with -Xclang -verify, which
// fails unless the lock analysis reports exactly the warnings marked
// "expected-warning" below (tests/framework/CMakeLists.txt). It proves that
// the annotations of framework/thread_annotations.h reach the analysis
// under clang, so that the clang build's silence on the tree means
// something, and that the correct uses of Mutex and MutexLock the tree
// relies on (relocking, condition-variable waits, predicates) pass.

#include <chrono>
#include <condition_variable>

#include "framework/thread_annotations.h"

namespace {

class Counter {
 public:
  // Correct uses: none of these may warn.
  void add() EXCLUDES(mutex_) {
    sys::MutexLock lock(mutex_);
    ++value_;
    addLocked();
  }
  void relock() EXCLUDES(mutex_) {
    sys::MutexLock lock(mutex_);
    ++value_;
    lock.unlock();
    outside();
    lock.lock();
    ++value_;
  }
  void unlockEarly() EXCLUDES(mutex_) {
    sys::MutexLock lock(mutex_);
    ++value_;
    lock.unlock();
    outside();
  }
  bool tryAdd() EXCLUDES(mutex_) {
    if (!mutex_.try_lock()) return false;
    ++value_;
    mutex_.unlock();
    return true;
  }
  void waitPositive() EXCLUDES(mutex_) {
    sys::MutexLock lock(mutex_);
    changed_.wait(lock.native(), [this]() REQUIRES(mutex_) { return value_ > 0; });
    --value_;
  }
  bool waitPositiveFor(std::chrono::milliseconds timeout) EXCLUDES(mutex_) {
    sys::MutexLock lock(mutex_);
    while (value_ <= 0) {
      if (changed_.wait_for(lock.native(), timeout) == std::cv_status::timeout) return false;
    }
    --value_;
    return true;
  }
  void waitAny() EXCLUDES(mutex_) {
    sys::MutexLock lock(mutex_);
    changedAny_.wait(lock, [this]() REQUIRES(mutex_) { return value_ > 0; });
    --value_;
  }
  int viaPointer() EXCLUDES(mutex_) {
    sys::MutexLock lock(mutex_);
    return *shared_;
  }

  // Faults the analysis must report. Each expected warning sits on the line
  // of its fault, so the formatter must keep these lines as they are.
  // clang-format off
  int readUnlocked() { return value_; }  // expected-warning {{reading variable 'value_' requires holding mutex 'mutex_'}}
  void writeUnlocked() { value_ = 1; }  // expected-warning {{writing variable 'value_' requires holding mutex 'mutex_' exclusively}}
  void callUnlocked() { addLocked(); }  // expected-warning {{calling function 'addLocked' requires holding mutex 'mutex_' exclusively}}
  // clang-format on
  void callWhileHeld() {
    sys::MutexLock lock(mutex_);
    add();  // expected-warning {{cannot call function 'add' while mutex 'mutex_' is held}}
  }
  void writeAfterUnlock() {
    sys::MutexLock lock(mutex_);
    lock.unlock();
    value_ = 2;  // expected-warning {{writing variable 'value_' requires holding mutex 'mutex_' exclusively}}
  }
  void lockTwice() {
    sys::MutexLock lock(mutex_);  // expected-note {{mutex acquired here}}
    mutex_.lock();                // expected-warning {{acquiring mutex 'mutex_' that is already held}}
    mutex_.unlock();
  }
  void keepLocked() {
    mutex_.lock();  // expected-note {{mutex acquired here}}
  }                 // expected-warning {{mutex 'mutex_' is still held at the end of function}}
  void addOnFailedTry() {
    if (mutex_.try_lock()) {
      mutex_.unlock();
      return;
    }
    ++value_;  // expected-warning {{writing variable 'value_' requires holding mutex 'mutex_' exclusively}}
  }
  // clang-format off
  int pointeeUnlocked() { return *shared_; }  // expected-warning {{reading the value pointed to by 'shared_' requires holding mutex 'mutex_'}}
  void predicateUnannotated() {
    sys::MutexLock lock(mutex_);
    changed_.wait(lock.native(), [this] { return value_ > 0; });  // expected-warning {{reading variable 'value_' requires holding mutex 'mutex_'}}
  }
  // clang-format on

 private:
  void addLocked() REQUIRES(mutex_) { ++value_; }
  void outside() EXCLUDES(mutex_) {}

  sys::Mutex mutex_;
  std::condition_variable changed_;
  std::condition_variable_any changedAny_;
  int value_ GUARDED_BY(mutex_) = 0;
  int* shared_ PT_GUARDED_BY(mutex_) = nullptr;
};

}  // namespace

// Odr-uses every member, so that none is left uncompiled.
void useCounter(Counter& c) {
  c.add();
  c.relock();
  c.unlockEarly();
  c.tryAdd();
  c.waitPositive();
  c.waitPositiveFor(std::chrono::milliseconds(1));
  c.waitAny();
  c.viaPointer();
  c.readUnlocked();
  c.writeUnlocked();
  c.callUnlocked();
  c.callWhileHeld();
  c.writeAfterUnlock();
  c.lockTwice();
  c.keepLocked();
  c.addOnFailedTry();
  c.pointeeUnlocked();
  c.predicateUnannotated();
}
