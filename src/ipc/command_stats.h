#pragma once
// Ipc::DB::CommandStats: what the Listener's commands did, per command:
// requests, failures and a histogram of the time their handlers took, for
// the metrics page (Prometheus text format).
//
// A progress command (Backup, Restore, Cleanup) counts the start of its
// operation as its request; the operation, which runs on a maintenance
// thread, is counted when it ends (recordOperation).
//
// Thread safety: record() and write() from any thread; the counters are
// relaxed atomics, so a page may show a request counted in one line and not
// yet in another.

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <ostream>
#include <string>

namespace Ipc::DB {

class CommandStats {
 public:
  // Upper bounds of the histogram's buckets, in seconds.
  static constexpr std::array<double, 12> kBuckets = {0.0001, 0.00025, 0.0005, 0.001, 0.0025, 0.005,
                                                      0.01,   0.025,   0.05,   0.1,   0.5,    2.5};

  // name must live as long as the process (a command's name() does).
  void record(std::uint8_t tag, const std::string& name, std::chrono::nanoseconds took, bool failed) noexcept;

  // The end of a maintenance operation that the command tag started.
  void recordOperation(std::uint8_t tag, const std::string& name, std::chrono::nanoseconds took,
                       bool succeeded) noexcept;

  // cvdb_requests_total, cvdb_request_failures_total and
  // cvdb_request_duration_seconds, one series per command seen; for the
  // maintenance commands cvdb_maintenance_operations_total by outcome,
  // cvdb_maintenance_last_duration_seconds and
  // cvdb_maintenance_last_success (1 or 0) of the last operation that ended.
  void write(std::ostream& out) const;

 private:
  struct PerTag {
    std::atomic<const std::string*> name{nullptr};
    std::atomic<std::uint64_t> requests{0};
    std::atomic<std::uint64_t> failures{0};
    std::atomic<std::uint64_t> nanos{0};
    std::array<std::atomic<std::uint64_t>, kBuckets.size()> buckets{};  // not cumulative
    // Maintenance operations (they end on their own threads).
    std::atomic<std::uint64_t> operationsOk{0};
    std::atomic<std::uint64_t> operationsFailed{0};
    std::atomic<std::uint64_t> lastOperationNanos{0};
    std::atomic<bool> lastOperationOk{false};
  };
  std::array<PerTag, 256> tags_{};
};

}  // namespace Ipc::DB
