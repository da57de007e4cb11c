#include "service/db_svc.h"

#include <unistd.h>

#include <iostream>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "engine/db_instances.h"
#include "engine/instance_for_maintenance.h"
#include "framework/log.h"
#include "framework/tls_files.h"
#include "ipc/listener.h"
#include "maintenance/restore_journal.h"
#include "service/metrics_page.h"
#include "service/read_cache_log.h"
#include "settings/config.h"
#include "store/stale_files.h"

namespace DBServer {
namespace {

const std::string kSvcName = "CorvinaDB";
const std::string kSvcDisplayName = "Corvina database server";

// Says once where backups and restores may read and write; a root server
// that lets clients name any path deserves a warning.
void logMaintenanceFolders(const DB::Paths& paths) {
  if (paths.maintenanceFolders().empty()) {
    Log::Lock(geteuid() == 0 ? Log::Warning : Log::Notice).logStreamLine()
        << "Backup and restore accept any path on the server: MaintenanceFolders is not set";
    return;
  }
  Log::Lock entry(Log::Notice);
  auto& line = entry.logStreamLine();
  line << "Backup and restore are confined to \"" << paths.backupFolder() << '"';
  for (const std::string& folder : paths.maintenanceFolders()) line << ", \"" << folder << '"';
}

// Whether the client port can be served as the settings ask: a TLS setting
// that cannot be used stops the start rather than leave the port in plain
// TCP. Empty when it can; else the reason, naming the setting or file.
std::string tlsProblem(const DBConfig& config) {
  if (!config.TlsProblem.empty()) return config.TlsProblem;
  try {
    Ipc::checkTlsFiles(config.tlsFiles());
  } catch (const std::exception& e) {
    return e.what();
  }
  return {};
}

void debugLine(const char* text) {
  if (!g_LogVerbose) return;
  Log::Lock entry(Log::Debug);
  entry.logStreamLine() << text;
}

}  // namespace

DBSvc::DBSvc() = default;

DBSvc::~DBSvc() {
  debugLine("Svc object destroyed");
  sys::MutexLock lock(mutex_);
  listener.reset();
}

int DBSvc::checkConfig() {
  std::string problem;
  const DBConfig config = DBConfig::load(DBConfig::defaultRoot(), sys::Env::posix(), &problem);
  std::cout << config.printout() << "\tmaintenance folders: ";
  if (config.MaintenanceFolders.empty()) std::cout << "any path";
  for (std::size_t i = 0; i < config.MaintenanceFolders.size(); ++i) {
    std::cout << (i == 0 ? "\"" : ", \"") << config.MaintenanceFolders[i] << '"';
  }
  std::cout << '\n';
  const std::string tls = tlsProblem(config);
  if (!tls.empty()) std::cout << "The server would not start: " << tls << '\n';
  if (!config.MaintenanceFoldersProblem.empty()) {
    std::cout << "The server would not start: " << config.MaintenanceFoldersProblem << '\n';
  }
  if (!problem.empty()) {
    std::cout << "Not taken whole: " << problem << '\n';
    return 1;
  }
  if (!tls.empty() || !config.MaintenanceFoldersProblem.empty()) return 1;
  std::cout << "The configuration was read whole.\n";
  return 0;
}

bool DBSvc::prepareSvc() {
  const DBConfig& config = DBConfig::inst();
  if (!config.MaintenanceFoldersProblem.empty()) {
    Log::Lock(Log::Error).logStreamLine() << "Cannot confine backup and restore: " << config.MaintenanceFoldersProblem;
    return false;
  }
  if (const std::string problem = tlsProblem(config); !problem.empty()) {
    Log::Lock(Log::Error).logStreamLine() << "Cannot serve clients over TLS: " << problem;
    return false;
  }
  return true;
}

void DBSvc::runSvc() {
  try {
    const DBConfig& config = DBConfig::inst();
    // Everything below the service gets its settings, paths and Env from
    // here, through the pool; nothing below reads the process-wide record.
    const auto pool = DB::DBInstances::create(DB::PoolSettings::from(config), DB::Paths(config), sys::Env::posix());
    logMaintenanceFolders(pool->paths());
    // Restores that a crash cut short are undone (or finished) before any
    // database opens; a database whose recovery failed stays held, so no
    // client opens it half restored, until a later start recovers it.
    std::vector<std::unique_ptr<DB::InstanceForMaintenance>> unrecovered;
    for (const std::string& key : maint::recoverRestores(pool->env(), pool->paths())) {
      unrecovered.push_back(std::make_unique<DB::InstanceForMaintenance>(pool, key, nullptr, true));
    }
    // Temporary files of data-file writes that a crash cut short go in the
    // background, beside the clients; the thread ends with the service.
    // This process's own writes carry its prefix and are never swept, so
    // the line needs no margin: a file that a crash left moments before
    // this start goes too.
    const auto started = pool->env().now();
    std::jthread sweeper(
        [pool, started](std::stop_token stop) { DB::removeStaleTempFiles(pool->env(), pool->paths(), started, stop); });
    // Destroyed before the pool stops, logging the cache's totals.
    std::optional<ReadCacheLog> cacheLog(std::in_place, pool->readCache(), pool->env());
    Ipc::SvcStub::Options transport;
    transport.memoryBudget = config.MaxBufferedMiB << 20;  // 0 stays 0: no limit
    transport.tls = config.tlsFiles();
    std::shared_ptr<Ipc::DB::Listener> created =
        Ipc::DB::createListener(config.ServerPort, config.ForceIP4, pool, transport);
    Ipc::SvcStub& server = Ipc::DB::serverOf(*created);
    {
      sys::MutexLock lock(mutex_);
      listener = created;
      // A stop that came while there was no server to tell.
      if (stopRequested_) server.signalStop();
    }
    std::unique_ptr<MetricsServer> metrics = startMetrics(config, created, pool);
    server.waitToFinish();
    metrics.reset();
    // Running maintenance operations stop at their next safe point (their
    // clients are gone already) before the pool they use is stopped.
    created->stopMaintenance();
    {
      sys::MutexLock lock(mutex_);
      listener.reset();
    }
    // The Listener and its server go with the last command that holds them.
    created.reset();

    sweeper.request_stop();
    sweeper.join();
    unrecovered.clear();
    cacheLog.reset();
    pool->stop();
    debugLine("Svc stopped");
  } catch (const std::exception& e) {
    Log::Lock entry(Log::Error);
    entry.logStreamLine() << "Service main failed. " << e.what();
    throw;
  } catch (...) {
    Log::Lock entry(Log::Error);
    entry.logStreamLine() << "Service main failed with unknown error";
    throw;
  }
}

std::unique_ptr<MetricsServer> DBSvc::startMetrics(const DBConfig& config,
                                                   const std::shared_ptr<Ipc::DB::Listener>& served,
                                                   const std::shared_ptr<DB::DBInstances>& pool) {
  if (config.MetricsPort == 0) return nullptr;
  const std::weak_ptr<Ipc::DB::Listener> weak = served;
  std::unique_ptr<MetricsServer> metrics;
  try {
    metrics = std::make_unique<MetricsServer>(
        config.MetricsAddress, config.MetricsPort,
        [weak, pool, &config] {
          const auto l = weak.lock();
          if (!l) throw std::runtime_error("the server is stopping");
          return metricsPage(*l, *pool, config);
        },
        [this] {
          sys::MutexLock lock(mutex_);
          return listener != nullptr && !stopRequested_;
        });
  } catch (const std::exception& e) {
    // Monitoring is not worth refusing the clients for.
    Log::Lock(Log::Error).logStreamLine() << "Metrics are not served: " << e.what();
    return nullptr;
  }
  Log::Lock(Log::Notice).logStreamLine() << "Metrics on http://" << config.MetricsAddress << ':' << metrics->port()
                                         << "/metrics and /healthz";
  return metrics;
}

void DBSvc::stopSvc() {
  debugLine("Svc stopping...");
  sys::MutexLock lock(mutex_);
  stopRequested_ = true;
  if (listener) Ipc::DB::serverOf(*listener).signalStop();
}

const std::string& DBSvc::svcName() const { return kSvcName; }

const std::string& DBSvc::svcDisplayName() const { return kSvcDisplayName; }

}  // namespace DBServer
