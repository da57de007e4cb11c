#include "framework/log.h"

#include "framework/utf8.h"

#include <spdlog/logger.h>
#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/sinks/stdout_sinks.h>

#include <cstdio>
#include <filesystem>
#include <map>
#include <memory>

#include "framework/platform.h"
#include "framework/thread_annotations.h"

std::atomic<bool> g_LogVerbose{false};

namespace Log {
namespace {

struct State {
  sys::Mutex mutex;
  std::shared_ptr<spdlog::logger> logger GUARDED_BY(mutex);
  bool console GUARDED_BY(mutex) = false;
  bool reportedFailure GUARDED_BY(mutex) = false;
  sys::Mutex observerMutex;
  std::map<std::uint64_t, Observer> observers GUARDED_BY(observerMutex);
  std::uint64_t nextObserver GUARDED_BY(observerMutex) = 1;
};

State& state() {
  static State s;
  return s;
}

const char* priorityName(LogPriority p) {
  switch (p) {
    case Error:
      return "error";
    case Warning:
      return "warning";
    case Notice:
      return "notice";
    case Debug:
      return "debug";
  }
  return "other";
}

spdlog::level::level_enum levelOf(LogPriority p) {
  switch (p) {
    case Error:
      return spdlog::level::err;
    case Warning:
      return spdlog::level::warn;
    case Notice:
      return spdlog::level::info;
    case Debug:
      return spdlog::level::debug;
  }
  return spdlog::level::info;
}

// Builds the logger for the current log folder.
std::shared_ptr<spdlog::logger> makeLogger(State& s) REQUIRES(s.mutex) {
  std::vector<spdlog::sink_ptr> sinks;
  try {
    const auto dir = Platform::inst().logDir();
    std::filesystem::create_directories(dir);
    sinks.push_back(std::make_shared<spdlog::sinks::rotating_file_sink_mt>((dir / kLogFileName).string(),
                                                                           kRecycleLogFileSize, kKeptLogFiles));
  } catch (const std::exception& e) {
    if (!s.reportedFailure) {
      s.reportedFailure = true;
      std::fprintf(stderr, "cvdbserver: cannot open log file: %s\n", e.what());
    }
  }
  if (s.console) sinks.push_back(std::make_shared<spdlog::sinks::stderr_sink_mt>());
  auto logger = std::make_shared<spdlog::logger>("cvdb", sinks.begin(), sinks.end());
  logger->set_pattern("[%Y-%m-%d %H:%M:%S.%e] [%t] %v");
  logger->set_level(spdlog::level::debug);
  // Every entry reaches the file when it is written (no sync), so that an
  // operator following the log sees the server's lines as they happen and a
  // crash loses none of them. Entries are rare outside verbose mode, and in
  // verbose mode one write per line is a fair price for a complete log.
  logger->flush_on(spdlog::level::debug);
  return logger;
}

std::shared_ptr<spdlog::logger> currentLogger() {
  State& s = state();
  sys::MutexLock lock(s.mutex);
  if (!s.logger) s.logger = makeLogger(s);
  return s.logger;
}

}  // namespace

std::string printable(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  const auto* p = reinterpret_cast<const unsigned char*>(text.data());
  const auto* end = p + text.size();
  static constexpr char kHex[] = "0123456789abcdef";
  while (p < end) {
    const unsigned c = *p;
    const bool continuation = c == '\n' && (p + 1 == end || p[1] == '\t');
    if ((c >= 0x20 && c < 0x7F) || c == '\t' || continuation) {
      out.push_back(static_cast<char>(c));
      ++p;
      continue;
    }
    if (const std::size_t n = c >= 0x80 ? utf8::sequenceLength(p, end) : 0) {
      out.append(reinterpret_cast<const char*>(p), n);
      p += n;
      continue;
    }
    out += "\\x";
    out.push_back(kHex[c >> 4]);
    out.push_back(kHex[c & 15]);
    ++p;
  }
  return out;
}

Lock::Lock(LogPriority priority) : priority_(priority) {}

Lock::~Lock() {
  if (priority_ == Debug && !g_LogVerbose) return;
  try {
    const std::string text = printable(std::move(text_).str());
    auto logger = currentLogger();
    logger->log(levelOf(priority_), "[{}] {}", priorityName(priority_), text);
    State& s = state();
    sys::MutexLock lock(s.observerMutex);
    for (auto& [id, observer] : s.observers) observer(priority_, text);
  } catch (...) {
    // A log entry must never take its caller down.
  }
}

void setConsole(bool on) {
  State& s = state();
  sys::MutexLock lock(s.mutex);
  s.console = on;
  s.logger.reset();
}

void reopen() {
  State& s = state();
  std::shared_ptr<spdlog::logger> old;
  {
    sys::MutexLock lock(s.mutex);
    old.swap(s.logger);
  }
  if (old) old->flush();
}

void flush() {
  State& s = state();
  std::shared_ptr<spdlog::logger> logger;
  {
    sys::MutexLock lock(s.mutex);
    logger = s.logger;
  }
  if (logger) logger->flush();
}

std::uint64_t addObserver(Observer observer) {
  State& s = state();
  sys::MutexLock lock(s.observerMutex);
  const std::uint64_t id = s.nextObserver++;
  s.observers.emplace(id, std::move(observer));
  return id;
}

void removeObserver(std::uint64_t id) {
  State& s = state();
  sys::MutexLock lock(s.observerMutex);
  s.observers.erase(id);
}

}  // namespace Log
