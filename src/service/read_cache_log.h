#pragma once
// DBServer::ReadCacheLog: the read cache's figures in the log, for an
// operator judging whether ReadCacheMiB fits: one line a period (a minute)
// when reads went through the cache in it, and the totals when the
// service stops. Quiet periods write nothing.
//
// Ownership: the cache and the Env outlive the object. Thread safety: one
// thread of its own, ended and joined by the destructor.

#include <chrono>
#include <string>
#include <thread>

#include "engine/read_cache.h"
#include "framework/env.h"

namespace DBServer {

// One line: the reads of the span from before to now (hits, misses, the
// hit rate), what was kept, evicted and dropped in it, and the fill.
std::string readCacheLine(const DB::ReadCache::Stats& now, const DB::ReadCache::Stats& before);

class ReadCacheLog {
 public:
  ReadCacheLog(const DB::ReadCache& cache, sys::Env& env, std::chrono::milliseconds period = std::chrono::minutes(1));
  // Stops the thread and logs the totals (when the cache saw reads).
  ~ReadCacheLog();
  ReadCacheLog(const ReadCacheLog&) = delete;
  ReadCacheLog& operator=(const ReadCacheLog&) = delete;

 private:
  void run(std::stop_token stop);

  const DB::ReadCache& cache_;
  sys::Env& env_;
  const std::chrono::milliseconds period_;
  std::jthread thread_;
};

}  // namespace DBServer
