#include "engine/open_files.h"

#include <sys/resource.h>

namespace engine {

OpenFileLimit raiseOpenFileLimit() noexcept {
  OpenFileLimit result;
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return result;
  result.before = limit.rlim_cur;
  result.hard = limit.rlim_max;
  result.after = limit.rlim_cur;
  if (limit.rlim_cur < limit.rlim_max) {
    limit.rlim_cur = limit.rlim_max;
    if (::setrlimit(RLIMIT_NOFILE, &limit) == 0) result.after = limit.rlim_cur;
  }
  return result;
}

}  // namespace engine
