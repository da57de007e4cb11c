#include "support/log_capture.h"

namespace testing_support {

LogCapture::LogCapture() {
  id_ = Log::addObserver([this](Log::LogPriority p, const std::string& text) {
    sys::MutexLock lock(mutex_);
    entries_.push_back({p, text});
  });
}

LogCapture::~LogCapture() { Log::removeObserver(id_); }

std::vector<LogCapture::Entry> LogCapture::entries() const {
  sys::MutexLock lock(mutex_);
  return entries_;
}

std::size_t LogCapture::count(Log::LogPriority priority, const std::string& fragment) const {
  sys::MutexLock lock(mutex_);
  std::size_t n = 0;
  for (const auto& e : entries_) n += (e.priority == priority && e.text.find(fragment) != std::string::npos);
  return n;
}

std::size_t LogCapture::count(const std::string& fragment) const {
  sys::MutexLock lock(mutex_);
  std::size_t n = 0;
  for (const auto& e : entries_) n += e.text.find(fragment) != std::string::npos;
  return n;
}

void LogCapture::clear() {
  sys::MutexLock lock(mutex_);
  entries_.clear();
}

}  // namespace testing_support
