#include "framework/open_files.h"

#include <sys/resource.h>

#include <algorithm>

namespace sys {

OpenFileLimit raiseOpenFileLimit() noexcept {
  OpenFileLimit result;
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return result;
  result.before = limit.rlim_cur;
  result.hard = limit.rlim_max;
  result.after = limit.rlim_cur;
  if (limit.rlim_cur < limit.rlim_max) {
    limit.rlim_cur = limit.rlim_max;
    if (::setrlimit(RLIMIT_NOFILE, &limit) != 0) {
      // An unlimited hard limit is more than the kernel grants one process.
      limit.rlim_cur = std::min<rlim_t>(limit.rlim_max, 1048576);
      if (::setrlimit(RLIMIT_NOFILE, &limit) != 0) return result;
    }
    result.after = limit.rlim_cur;
  }
  return result;
}

}  // namespace sys
