#include "service/read_cache_log.h"

#include <iomanip>
#include <sstream>

#include "framework/log.h"

namespace DBServer {

std::string readCacheLine(const DB::ReadCache::Stats& now, const DB::ReadCache::Stats& before) {
  const std::uint64_t hits = now.hits - before.hits;
  const std::uint64_t misses = now.misses - before.misses;
  std::ostringstream line;
  line << "Read cache: " << hits << " hits, " << misses << " misses";
  if (hits + misses > 0) {
    line << " (" << std::fixed << std::setprecision(1)
         << 100.0 * static_cast<double>(hits) / static_cast<double>(hits + misses) << "% hits)";
  }
  line << "; " << now.insertions - before.insertions << " kept, " << now.evictions - before.evictions
       << " evicted for room, " << now.invalidations - before.invalidations << " dropped by writes or closes, "
       << now.refused - before.refused << " not kept (written meanwhile); " << now.entries << " entries, "
       << std::setprecision(1);
  if (now.bytes < (1 << 20)) {
    line << static_cast<double>(now.bytes) / (1 << 10) << " KiB";
  } else {
    line << static_cast<double>(now.bytes) / (1 << 20) << " MiB";
  }
  line << " of " << now.capacity / (1 << 20) << " MiB";
  return line.str();
}

ReadCacheLog::ReadCacheLog(const DB::ReadCache& cache, sys::Env& env, std::chrono::milliseconds period)
    : cache_(cache), env_(env), period_(period) {
  if (cache_.enabled()) thread_ = std::jthread([this](std::stop_token stop) { run(std::move(stop)); });
}

ReadCacheLog::~ReadCacheLog() {
  if (!thread_.joinable()) return;
  thread_.request_stop();
  thread_.join();
  try {
    const DB::ReadCache::Stats totals = cache_.stats();
    if (totals.hits + totals.misses == 0) return;
    Log::Lock(Log::Notice).logStreamLine() << readCacheLine(totals, {}) << " (since the start)";
  } catch (const std::exception&) {
    // Out of memory for a log line at the stop: nothing to tell then.
  }
}

void ReadCacheLog::run(std::stop_token stop) {
  DB::ReadCache::Stats before = cache_.stats();
  while (env_.sleepFor(period_, stop)) {
    try {
      const DB::ReadCache::Stats now = cache_.stats();
      if (now.hits + now.misses != before.hits + before.misses) {
        Log::Lock(Log::Notice).logStreamLine() << readCacheLine(now, before);
      }
      before = now;
    } catch (const std::exception&) {
      // A line lost to a shortage of memory; the next period tells again.
    }
  }
}

}  // namespace DBServer
