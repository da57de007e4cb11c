#pragma once
// testing_support::FaultEnv: an Env for tests that passes every call to a
// real one (Env::posix() by default) and can
//   - fail the Nth call of a kind, or of any kind, with an error number
//     (the call then has no effect), or every call of a kind whose path
//     contains a text;
//   - count the calls of each kind, so that a test can first run an
//     operation cleanly, then once for every N with the Nth call failing;
//   - simulate a power loss (dropUnsynced): what was written to a file
//     since its last sync is cut off, and names created or renamed in a
//     folder since that folder's last sync disappear again (a rename is
//     undone, and the file it replaced comes back);
//   - run a clock of its own: now() returns a time the test sets, and
//     sleepFor() advances it at once instead of sleeping.
//
// What it does not model: removals that were not synced stay removed, and
// writes inside a file's synced length after its last sync stay written.
//
// Ownership: the tests own it; it must outlive what it was handed to.
// Thread safety: every member may be called from any thread.

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "framework/env.h"
#include "framework/thread_annotations.h"

namespace testing_support {

class FaultEnv final : public sys::Env {
 public:
  enum class Op {
    Open,
    CreateTemp,
    Read,
    Write,
    Sync,
    Close,
    SyncFolder,
    Rename,
    Link,
    Remove,
    RemoveAll,
    CreateFolders,
    List,
    Stat,
    SetModified,
    FreeSpace,
    Access,
    kCount
  };
  // Counts every kind (for failNth).
  static constexpr Op kAny = Op::kCount;

  // scratch: a folder on the same file system as the files the test works
  // on, where replaced files are kept until their folder is synced.
  explicit FaultEnv(sys::Path scratch, sys::Env& base = sys::Env::posix());
  ~FaultEnv() override;

  // From now on, the nth call (1 for the next) of the kind fails with error.
  void failNth(Op kind, std::uint64_t n, int error = EIO);
  // Every call of the kind whose path contains fragment fails.
  void failOnPath(Op kind, std::string fragment, int error = EIO);
  // Clears the failures above (not the counts).
  void clearFailures();
  // Calls of the kind (kAny: of every kind) since construction or resetCounts.
  std::uint64_t count(Op kind) const;
  void resetCounts();
  // Failures injected so far.
  std::uint64_t injected() const;

  // The power loss; also forgets every pending change.
  void dropUnsynced();

  // From now on now() returns start and moves only through advance() and
  // sleepFor(); until then the base clock runs.
  void useManualClock(sys::WallClock::time_point start);
  void advance(std::chrono::milliseconds d);
  // From now on every sleepFor calls hook with its duration instead of
  // sleeping (the manual clock, when used, still advances).
  void setSleepHook(std::function<void(std::chrono::milliseconds)> hook);
  // From now on freeSpace() answers bytes (none: the real file system's).
  void setFreeSpace(std::optional<std::uint64_t> bytes);
  // From now on hook runs at the start of every call, on the caller's
  // thread and before any failure is injected (to interleave another
  // thread's work with a chosen call).
  void setCallHook(std::function<void(Op, const sys::Path&)> hook);

  // sys::Env
  std::unique_ptr<sys::File> open(const sys::Path& path, sys::OpenMode mode) override;
  std::unique_ptr<sys::File> createTemp(const sys::Path& folder, std::string_view prefix, sys::Path* made) override;
  void syncFolder(const sys::Path& folder) override;
  void rename(const sys::Path& from, const sys::Path& to) override;
  void link(const sys::Path& from, const sys::Path& to) override;
  bool remove(const sys::Path& path) override;
  std::uint64_t removeAll(const sys::Path& path) override;
  std::vector<sys::Path> createFolders(const sys::Path& folder) override;
  std::vector<sys::DirEntry> list(const sys::Path& folder) override;
  sys::FileInfo stat(const sys::Path& path, bool follow = false) override;
  void setModified(const sys::Path& path, sys::WallClock::time_point when) override;
  std::uint64_t freeSpace(const sys::Path& path) override;
  bool readWritable(const sys::Path& path) override;
  sys::WallClock::time_point now() override;
  bool sleepFor(std::chrono::milliseconds d, std::stop_token stop = {}) override;

  // For the files it opened.
  void check(Op kind, const sys::Path& path) EXCLUDES(mutex_);
  void synced(const sys::Path& file, std::uint64_t size) EXCLUDES(mutex_);

 private:
  struct Change {
    enum Kind { Created, Renamed } kind;
    sys::Path path;                     // created, or renamed to
    sys::Path from;                     // renamed from
    std::optional<sys::Path> replaced;  // a link to the file the rename replaced
  };
  void pending(const sys::Path& folder, Change change) EXCLUDES(mutex_);

  sys::Env& base_;
  const sys::Path scratch_;
  mutable sys::Mutex mutex_;
  std::uint64_t counts_[static_cast<int>(Op::kCount) + 1] GUARDED_BY(mutex_){};
  struct Nth {
    Op kind;
    std::uint64_t at;  // in the kind's count
    int error;
  };
  std::vector<Nth> nth_ GUARDED_BY(mutex_);
  struct OnPath {
    Op kind;
    std::string fragment;
    int error;
  };
  std::vector<OnPath> onPath_ GUARDED_BY(mutex_);
  std::uint64_t injected_ GUARDED_BY(mutex_) = 0;
  std::vector<std::pair<sys::Path, Change>> changes_ GUARDED_BY(mutex_);  // by folder, in order
  std::map<sys::Path, std::uint64_t> syncedSize_ GUARDED_BY(mutex_);      // files written through this env
  std::uint64_t keptFiles_ GUARDED_BY(mutex_) = 0;
  std::optional<sys::WallClock::time_point> clock_ GUARDED_BY(mutex_);
  std::function<void(std::chrono::milliseconds)> sleepHook_ GUARDED_BY(mutex_);
  std::function<void(Op, const sys::Path&)> callHook_ GUARDED_BY(mutex_);
  std::optional<std::uint64_t> freeSpace_ GUARDED_BY(mutex_);
};

}  // namespace testing_support
