#pragma once
// Lock annotations that clang checks at compile time (-Wthread-safety), and
// a mutex and a scoped lock that carry them.
//
// A field declared GUARDED_BY(mutex_) may only be read or written with
// mutex_ held; a function declared REQUIRES(mutex_) may only be called with
// it held, and its body may use what mutex_ guards; EXCLUDES(mutex_) says
// the function takes mutex_ itself, so a caller must not hold it. Under
// clang with CVDB_THREAD_SAFETY (the CI's clang build) a breach is a
// compile error; under GCC the macros expand to nothing.
//
// Mutex is std::mutex with the annotations; MutexLock holds one for its
// scope. A wait on a std::condition_variable takes lock.native(); the
// analysis treats the mutex as held across the wait, which is what the
// caller sees (the wait returns with it held again). A predicate lambda
// runs with the mutex held and says so: [this]() REQUIRES(mutex_) {...}.
// MutexLock also offers lock()/unlock(), so std::condition_variable_any can
// wait on it, and a function can let go of the mutex for a while.
//
// NO_THREAD_SAFETY_ANALYSIS turns the check off for one function; use it
// only where the locking is right but cannot be expressed, and say why.
//
// Ownership: a Mutex is a member of what it guards; a MutexLock lives on the
// stack of one thread.
// Thread safety: that of std::mutex and std::unique_lock.
// Failures: those of std::mutex (std::system_error from lock()).

#include <mutex>

#if defined(__clang__)
#define CVDB_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define CVDB_THREAD_ANNOTATION(x)
#endif

// On a class: its objects are capabilities (locks), named in diagnostics.
#define CAPABILITY(name) CVDB_THREAD_ANNOTATION(capability(name))
// On a class: an RAII holder of a capability.
#define SCOPED_CAPABILITY CVDB_THREAD_ANNOTATION(scoped_lockable)
// On a field: read and written only with the capability held.
#define GUARDED_BY(x) CVDB_THREAD_ANNOTATION(guarded_by(x))
// On a pointer field: what it points to is used only with the capability held.
#define PT_GUARDED_BY(x) CVDB_THREAD_ANNOTATION(pt_guarded_by(x))
// On a capability: acquired only after, or before, the ones named.
#define ACQUIRED_BEFORE(...) CVDB_THREAD_ANNOTATION(acquired_before(__VA_ARGS__))
#define ACQUIRED_AFTER(...) CVDB_THREAD_ANNOTATION(acquired_after(__VA_ARGS__))
// On a function: called with the capabilities held (exclusively, shared).
#define REQUIRES(...) CVDB_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define REQUIRES_SHARED(...) CVDB_THREAD_ANNOTATION(requires_shared_capability(__VA_ARGS__))
// On a function: takes, or lets go of, the capabilities (none named: this).
#define ACQUIRE(...) CVDB_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define ACQUIRE_SHARED(...) CVDB_THREAD_ANNOTATION(acquire_shared_capability(__VA_ARGS__))
#define RELEASE(...) CVDB_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define RELEASE_SHARED(...) CVDB_THREAD_ANNOTATION(release_shared_capability(__VA_ARGS__))
// On a function: takes the capability when it returns the first argument.
#define TRY_ACQUIRE(...) CVDB_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
// On a function: called without the capabilities held (it takes them).
#define EXCLUDES(...) CVDB_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
// On a function: checks at run time that the capability is held; the
// analysis assumes it is afterwards.
#define ASSERT_CAPABILITY(x) CVDB_THREAD_ANNOTATION(assert_capability(x))
// On a function: returns a reference to the capability named.
#define RETURN_CAPABILITY(x) CVDB_THREAD_ANNOTATION(lock_returned(x))
// On a function: not checked.
#define NO_THREAD_SAFETY_ANALYSIS CVDB_THREAD_ANNOTATION(no_thread_safety_analysis)

namespace sys {

class CAPABILITY("mutex") Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  void lock() ACQUIRE() { mutex_.lock(); }
  void unlock() RELEASE() { mutex_.unlock(); }
  bool try_lock() TRY_ACQUIRE(true) { return mutex_.try_lock(); }

 private:
  friend class MutexLock;
  std::mutex mutex_;
};

class SCOPED_CAPABILITY MutexLock {
 public:
  explicit MutexLock(Mutex& mutex) ACQUIRE(mutex) : lock_(mutex.mutex_) {}
  // Lets go of the mutex unless unlock() did already.
  ~MutexLock() RELEASE() {}
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

  // Takes the mutex again after unlock().
  void lock() ACQUIRE() { lock_.lock(); }
  // Lets go of the mutex before the end of the scope.
  void unlock() RELEASE() { lock_.unlock(); }

  // For std::condition_variable's waits, which let go of the mutex and take
  // it again before they return. Not for locking or unlocking it otherwise:
  // the analysis would not see that.
  std::unique_lock<std::mutex>& native() noexcept { return lock_; }

 private:
  std::unique_lock<std::mutex> lock_;
};

}  // namespace sys
