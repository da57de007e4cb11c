#include "ipc/command_stats.h"

#include <algorithm>

namespace Ipc::DB {
namespace {

constexpr auto kRelaxed = std::memory_order_relaxed;

}  // namespace

void CommandStats::record(std::uint8_t tag, const std::string& name, std::chrono::nanoseconds took,
                          bool failed) noexcept {
  PerTag& t = tags_[tag];
  if (t.name.load(kRelaxed) == nullptr) t.name.store(&name, std::memory_order_release);
  t.requests.fetch_add(1, kRelaxed);
  if (failed) t.failures.fetch_add(1, kRelaxed);
  const auto nanos = static_cast<std::uint64_t>(std::max<std::int64_t>(0, took.count()));
  t.nanos.fetch_add(nanos, kRelaxed);
  const double seconds = static_cast<double>(nanos) / 1e9;
  const auto bucket = std::lower_bound(kBuckets.begin(), kBuckets.end(), seconds);
  if (bucket != kBuckets.end()) t.buckets[static_cast<std::size_t>(bucket - kBuckets.begin())].fetch_add(1, kRelaxed);
}

void CommandStats::recordOperation(std::uint8_t tag, const std::string& name, std::chrono::nanoseconds took,
                                   bool succeeded) noexcept {
  PerTag& t = tags_[tag];
  if (t.name.load(kRelaxed) == nullptr) t.name.store(&name, std::memory_order_release);
  (succeeded ? t.operationsOk : t.operationsFailed).fetch_add(1, kRelaxed);
  t.lastOperationNanos.store(static_cast<std::uint64_t>(std::max<std::int64_t>(0, took.count())), kRelaxed);
  t.lastOperationOk.store(succeeded, kRelaxed);
}

void CommandStats::write(std::ostream& out) const {
  const auto each = [this](const auto& f) {
    for (const PerTag& t : tags_) {
      if (const std::string* name = t.name.load(std::memory_order_acquire)) f(*name, t);
    }
  };
  out << "# HELP cvdb_requests_total Requests handled, by command.\n# TYPE cvdb_requests_total counter\n";
  each([&](const std::string& name, const PerTag& t) {
    out << "cvdb_requests_total{command=\"" << name << "\"} " << t.requests.load(kRelaxed) << '\n';
  });
  out << "# HELP cvdb_request_failures_total Requests that failed (their connection ended), by command.\n"
         "# TYPE cvdb_request_failures_total counter\n";
  each([&](const std::string& name, const PerTag& t) {
    out << "cvdb_request_failures_total{command=\"" << name << "\"} " << t.failures.load(kRelaxed) << '\n';
  });
  out << "# HELP cvdb_request_duration_seconds Time the handler took, by command.\n"
         "# TYPE cvdb_request_duration_seconds histogram\n";
  each([&](const std::string& name, const PerTag& t) {
    std::uint64_t cumulative = 0;
    for (std::size_t i = 0; i < kBuckets.size(); ++i) {
      cumulative += t.buckets[i].load(kRelaxed);
      out << "cvdb_request_duration_seconds_bucket{command=\"" << name << "\",le=\"" << kBuckets[i] << "\"} "
          << cumulative << '\n';
    }
    const std::uint64_t count = t.requests.load(kRelaxed);
    out << "cvdb_request_duration_seconds_bucket{command=\"" << name << "\",le=\"+Inf\"} " << count << '\n'
        << "cvdb_request_duration_seconds_sum{command=\"" << name << "\"} "
        << static_cast<double>(t.nanos.load(kRelaxed)) / 1e9 << '\n'
        << "cvdb_request_duration_seconds_count{command=\"" << name << "\"} " << count << '\n';
  });
  const auto eachOperation = [&](const auto& f) {
    each([&](const std::string& name, const PerTag& t) {
      if (t.operationsOk.load(kRelaxed) + t.operationsFailed.load(kRelaxed) != 0) f(name, t);
    });
  };
  out << "# HELP cvdb_maintenance_operations_total Maintenance operations that ended, by command and outcome.\n"
         "# TYPE cvdb_maintenance_operations_total counter\n";
  eachOperation([&](const std::string& name, const PerTag& t) {
    out << "cvdb_maintenance_operations_total{command=\"" << name << "\",outcome=\"ok\"} "
        << t.operationsOk.load(kRelaxed) << '\n'
        << "cvdb_maintenance_operations_total{command=\"" << name << "\",outcome=\"failed\"} "
        << t.operationsFailed.load(kRelaxed) << '\n';
  });
  out << "# HELP cvdb_maintenance_last_duration_seconds How long the last maintenance operation took, by command.\n"
         "# TYPE cvdb_maintenance_last_duration_seconds gauge\n";
  eachOperation([&](const std::string& name, const PerTag& t) {
    out << "cvdb_maintenance_last_duration_seconds{command=\"" << name << "\"} "
        << static_cast<double>(t.lastOperationNanos.load(kRelaxed)) / 1e9 << '\n';
  });
  out << "# HELP cvdb_maintenance_last_success Whether the last maintenance operation succeeded, by command.\n"
         "# TYPE cvdb_maintenance_last_success gauge\n";
  eachOperation([&](const std::string& name, const PerTag& t) {
    out << "cvdb_maintenance_last_success{command=\"" << name << "\"} " << (t.lastOperationOk.load(kRelaxed) ? 1 : 0)
        << '\n';
  });
}

}  // namespace Ipc::DB
