#include "framework/platform.h"

#include <unistd.h>

#include <cstdlib>

#include "framework/log.h"

namespace {

std::filesystem::path homeDir() {
  const char* home = std::getenv("HOME");
  if (home && *home) return home;
  return "/tmp";
}

}  // namespace

Platform& Platform::inst() {
  static Platform platform;
  return platform;
}

Platform::Platform() {
  if (::geteuid() == 0) {
    configDir_ = "/var/lib/corvina";
    logDir_ = "/var/log/corvina";
  } else {
    configDir_ = homeDir() / ".local/share/corvina";
    logDir_ = homeDir() / ".local/state/corvina/log";
  }
}

std::filesystem::path Platform::logDir() const {
  sys::MutexLock lock(mutex_);
  return logDir_;
}

void Platform::changeLogDir(const std::filesystem::path& dir) {
  {
    sys::MutexLock lock(mutex_);
    logDir_ = dir;
  }
  Log::reopen();
}

std::filesystem::path Platform::corvinaSystemConfigDir() const {
  sys::MutexLock lock(mutex_);
  return configDir_;
}

void Platform::changeSystemConfigDir(const std::filesystem::path& dir) {
  sys::MutexLock lock(mutex_);
  configDir_ = dir;
}
