#include "service/metrics_page.h"

#include <sstream>

#include "engine/commit_queue.h"
#include "engine/db_instances.h"
#include "engine/engine_counters.h"
#include "ipc/listener.h"
#include "settings/config.h"

namespace DBServer {
namespace {

void gauge(std::ostream& out, const char* name, const char* help, std::uint64_t value, const char* type = "gauge") {
  out << "# HELP " << name << ' ' << help << "\n# TYPE " << name << ' ' << type << '\n' << name << ' ' << value << '\n';
}

}  // namespace

std::string metricsPage(Ipc::DB::Listener& listener, const DB::DBInstances& pool, const DBConfig& config) {
  const Ipc::SvcStub& server = Ipc::DB::serverOf(listener);
  std::ostringstream out;
  gauge(out, "cvdb_connections_open", "Client connections open.", server.connectionCount());
  gauge(out, "cvdb_connections_waiting_for_memory", "Connections whose next request waits for the memory budget.",
        server.connectionsWaitingForMemory());
  gauge(out, "cvdb_buffered_bytes", "Bytes of queued answers and large requests counted against the budget.",
        server.bufferedBytes());
  if (config.MaxBufferedMiB != 0) {
    gauge(out, "cvdb_buffered_limit_bytes", "The memory budget (MaxBufferedMiB).", server.memoryLimit());
  }
  gauge(out, "cvdb_received_bytes_total", "Bytes read from client connections.", server.bytesReceived(), "counter");
  gauge(out, "cvdb_sent_bytes_total", "Bytes written to client connections.", server.bytesSent(), "counter");
  gauge(out, "cvdb_databases_open", "Databases open (engine instances).", pool.liveInstances());
  gauge(out, "cvdb_databases_limit", "MaxActiveDBs.", config.MaxActiveDBs);
  gauge(out, "cvdb_clients_per_database_limit", "MaxActiveClientsPerDB.", config.MaxActiveClientsPerDB);
  const auto& engineCounts = engine::counters();
  out << "# HELP cvdb_sessions_refused_total Connections to a database refused at a limit, by the setting.\n"
         "# TYPE cvdb_sessions_refused_total counter\n"
      << "cvdb_sessions_refused_total{limit=\"MaxActiveDBs\"} "
      << engineCounts.refusedByDatabaseLimit.load(std::memory_order_relaxed) << '\n'
      << "cvdb_sessions_refused_total{limit=\"MaxActiveClientsPerDB\"} "
      << engineCounts.refusedByClientLimit.load(std::memory_order_relaxed) << '\n';
  gauge(out, "cvdb_transaction_retries_total", "Write transactions tried again after a conflict or a lock wait.",
        engineCounts.transactionRetries.load(std::memory_order_relaxed), "counter");
  gauge(out, "cvdb_maintenance_running", "Maintenance operations (backup, restore, cleanup) running.",
        listener.maintenanceRunning());
  const auto commits = engine::CommitQueue::stats();
  gauge(out, "cvdb_commit_groups_total", "Write transactions committed (or failed) for the commit queue's groups.",
        commits.commits, "counter");
  gauge(out, "cvdb_commit_grouped_requests_total", "Write requests carried by those groups.", commits.requests,
        "counter");
  gauge(out, "cvdb_commit_group_largest", "The most write requests that shared one commit.", commits.largest);
  const DB::ReadCache::Stats cache = pool.readCache().stats();
  gauge(out, "cvdb_read_cache_hits_total", "Configuration-part and pack-record reads answered from memory.", cache.hits,
        "counter");
  gauge(out, "cvdb_read_cache_misses_total", "Such reads that went to the database.", cache.misses, "counter");
  gauge(out, "cvdb_read_cache_insertions_total", "Values kept after a miss.", cache.insertions, "counter");
  gauge(out, "cvdb_read_cache_evictions_total", "Values dropped for room (least recently used first).", cache.evictions,
        "counter");
  gauge(out, "cvdb_read_cache_invalidations_total", "Values dropped by writes, restores and closed databases.",
        cache.invalidations, "counter");
  gauge(out, "cvdb_read_cache_refused_total", "Values not kept because a write of the key came during the read.",
        cache.refused, "counter");
  gauge(out, "cvdb_read_cache_entries", "Values kept.", cache.entries);
  gauge(out, "cvdb_read_cache_bytes", "Memory the kept values take (estimate).", cache.bytes);
  gauge(out, "cvdb_read_cache_limit_bytes", "The cache's budget (ReadCacheMiB; 0: off).", cache.capacity);
  listener.stats().write(out);
  return out.str();
}

}  // namespace DBServer
