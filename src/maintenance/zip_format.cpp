#include "maintenance/zip_format.h"

#include <ctime>
#include <mutex>

namespace maint::zip {
namespace {

// The C library reads the time zone into shared state on the first local
// time conversion, under a lock of its own that the thread sanitizer cannot
// see; conversions on the archive's worker threads take this lock too, so
// the checked build has nothing to report and the result is the same.
std::mutex& timeZoneMutex() {
  static std::mutex mutex;
  return mutex;
}

}  // namespace

std::uint32_t toDosDateTime(sys::WallClock::time_point when) {
  const std::time_t t = sys::WallClock::to_time_t(when);
  std::tm tm{};
  bool converted = false;
  {
    const std::lock_guard lock(timeZoneMutex());
    converted = localtime_r(&t, &tm) != nullptr;
  }
  if (!converted || tm.tm_year < 80) return (1u << 5 | 1u) << 16;  // 1980-01-01 00:00
  if (tm.tm_year > 207) return ((127u << 9 | 12u << 5 | 31u) << 16) | (23u << 11 | 59u << 5 | 29u);
  const auto date = static_cast<std::uint32_t>((tm.tm_year - 80) << 9 | (tm.tm_mon + 1) << 5 | tm.tm_mday);
  const auto time = static_cast<std::uint32_t>(tm.tm_hour << 11 | tm.tm_min << 5 | tm.tm_sec / 2);
  return date << 16 | time;
}

sys::WallClock::time_point fromDosDateTime(std::uint32_t dos) {
  std::tm tm{};
  tm.tm_mday = static_cast<int>((dos >> 16) & 0x1f);
  tm.tm_mon = static_cast<int>((dos >> 21) & 0x0f) - 1;
  tm.tm_year = static_cast<int>((dos >> 25) & 0x7f) + 80;
  tm.tm_hour = static_cast<int>((dos >> 11) & 0x1f);
  tm.tm_min = static_cast<int>((dos >> 5) & 0x3f);
  tm.tm_sec = static_cast<int>(dos & 0x1f) * 2;
  // -1: the writer packed local time with daylight saving as it was then,
  // so the reader lets the rules decide instead of assuming standard time
  // (which would move every summer time stamp by an hour).
  tm.tm_isdst = -1;
  std::time_t t = -1;
  {
    const std::lock_guard lock(timeZoneMutex());
    t = std::mktime(&tm);
  }
  return sys::WallClock::from_time_t(t == -1 ? 0 : t);
}

}  // namespace maint::zip
