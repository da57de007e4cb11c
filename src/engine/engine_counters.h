#pragma once
// engine::counters(): what the engine layer refused or retried since the
// process started, for the metrics page.
//
// Thread safety: relaxed atomics, counted from any thread.

#include <atomic>
#include <cstdint>

namespace engine {

struct Counters {
  std::atomic<std::uint64_t> transactionRetries{0};      // failed attempts that were tried again
  std::atomic<std::uint64_t> refusedByDatabaseLimit{0};  // sessions refused by MaxActiveDBs
  std::atomic<std::uint64_t> refusedByClientLimit{0};    // sessions refused by MaxActiveClientsPerDB
};

inline Counters& counters() noexcept {
  static Counters all;
  return all;
}

}  // namespace engine
