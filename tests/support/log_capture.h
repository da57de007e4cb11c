#pragma once
// Records every log entry written while it exists, for assertions on the
// server's log lines.

#include <cstdint>
#include <string>
#include <vector>

#include "framework/log.h"
#include "framework/thread_annotations.h"

namespace testing_support {

class LogCapture {
 public:
  struct Entry {
    Log::LogPriority priority;
    std::string text;
  };

  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<Entry> entries() const;
  // Number of entries of that priority whose text contains the fragment.
  std::size_t count(Log::LogPriority priority, const std::string& fragment) const;
  bool contains(Log::LogPriority priority, const std::string& fragment) const { return count(priority, fragment) > 0; }
  // Number of entries of any priority whose text contains the fragment.
  std::size_t count(const std::string& fragment) const;
  void clear();

 private:
  mutable sys::Mutex mutex_;
  std::vector<Entry> entries_ GUARDED_BY(mutex_);
  std::uint64_t id_;
};

// Switches verbose logging on for its lifetime and restores the old value.
class VerboseLog {
 public:
  explicit VerboseLog(bool on = true) : old_(g_LogVerbose.exchange(on)) {}
  ~VerboseLog() { g_LogVerbose = old_; }

 private:
  bool old_;
};

}  // namespace testing_support
