#pragma once
// Logging: one entry per event, written when the entry object is destroyed.
//
//   Log::Lock entry(Log::Notice);
//   entry.logStreamLine() << "New database created in \"" << name << '"';
//
// Entries go to a rotating file in Platform::inst().logDir() (files of
// kRecycleLogFileSize bytes, kKeptLogFiles of them kept), and to standard
// error when console output is on. Each entry carries its time, priority,
// thread and text.
//
// Entries often quote what clients sent (database names, keys, paths), so
// every entry passes through printable() on its way out: no client text can
// end an entry and forge the next one, or put control bytes into the file.
//
// Thread safety: every function here may be called from any thread. One
// entry object belongs to the thread that made it.
// Failures: logging never throws out of an entry's destructor; an entry that
// cannot be written (no disk space, unwritable folder) is dropped, and the
// first such failure is reported once on standard error.

#include <atomic>
#include <cstdint>
#include <functional>
#include <sstream>
#include <string>
#include <string_view>

// Enables entries of priority Log::Debug. Test it before building a debug
// entry so that the text is not formatted for nothing.
extern std::atomic<bool> g_LogVerbose;

namespace Log {

enum LogPriority : int { Error = 3, Warning = 4, Notice = 5, Debug = 7 };

inline constexpr std::uint64_t kRecycleLogFileSize = 10485760;
inline constexpr std::size_t kKeptLogFiles = 5;
inline constexpr const char* kLogFileName = "cvdbserver.log";

class Lock {
 public:
  explicit Lock(LogPriority priority);
  ~Lock();
  Lock(const Lock&) = delete;
  Lock& operator=(const Lock&) = delete;

  std::ostream& logStreamLine() { return text_; }

 private:
  LogPriority priority_;
  std::ostringstream text_;
};

// The text as the log writes it: printable ASCII, tabs and well-formed
// UTF-8 stay; a line break stays only before a tab (the indented
// continuation lines of the server's own multi-line entries) or at the
// very end; every other
// byte becomes "\\xNN" (lower-case hex).
std::string printable(std::string_view text);

// Mirrors every entry to standard error as well (the server's --console).
void setConsole(bool on);

// Closes the current log file; the next entry opens one in the platform's
// (possibly changed) log folder. Called by Platform::changeLogDir.
void reopen();

// Writes buffered entries to disk.
void flush();

// An observer sees every entry that is written, after it is formatted and
// with its priority. Observers are meant for tests and diagnostics; they run
// under the log's observer lock and must not log themselves.
using Observer = std::function<void(LogPriority, const std::string&)>;
std::uint64_t addObserver(Observer observer);
void removeObserver(std::uint64_t id);

}  // namespace Log
