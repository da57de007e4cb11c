#pragma once
// DBServer::DBSvc: the database service that the service host runs. It
// loads the settings, serves the command protocol through the Listener on
// the configured port until it is stopped, and then shuts the engine pool
// down.
//
// Ownership: owns the Listener (shared with the commands in flight) while
// runSvc runs.
// Thread safety: runSvc runs on the host's thread; stopSvc may be called
// from any other thread at any time, also before runSvc has built the
// Listener: such a stop is remembered and ends runSvc as soon as the command
// server exists.
// Failures: runSvc logs "Service main failed. " + the text (or "Service
// main failed with unknown error") and rethrows.

#include <memory>
#include <string>

#include "framework/service_host.h"
#include "framework/thread_annotations.h"
#include "service/metrics_server.h"

class DBConfig;
namespace DB {
class DBInstances;
}

namespace Ipc::DB {
class Listener;
}

namespace DBServer {

class DBSvc final : public Service::I {
 public:
  DBSvc();
  ~DBSvc() override;
  DBSvc(const DBSvc&) = delete;
  DBSvc& operator=(const DBSvc&) = delete;

  // Loads and prints the settings (first DBConfig::inst()).
  bool prepareSvc() override;
  // Loads config.json as a start would and prints the settings in effect;
  // 1 when any of the file was not taken (no file, not JSON, a wrong type).
  int checkConfig() override;
  // Serves until stopSvc(); then releases the Listener and tears the engine
  // pool down.
  void runSvc() override;
  void stopSvc() override;
  const std::string& svcName() const override;
  const std::string& svcDisplayName() const override;

 private:
  // The HTTP listener of /metrics and /healthz when MetricsPort is set.
  std::unique_ptr<MetricsServer> startMetrics(const DBConfig& config, const std::shared_ptr<Ipc::DB::Listener>& served,
                                              const std::shared_ptr<DB::DBInstances>& pool) EXCLUDES(mutex_);

  sys::Mutex mutex_;
  std::shared_ptr<Ipc::DB::Listener> listener GUARDED_BY(mutex_);
  bool stopRequested_ GUARDED_BY(mutex_) = false;
};

}  // namespace DBServer
