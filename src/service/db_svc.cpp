#include "service/db_svc.h"

#include <memory>
#include <thread>
#include <vector>

#include "engine/db_instances.h"
#include "engine/instance_for_maintenance.h"
#include "framework/log.h"
#include "ipc/listener.h"
#include "maintenance/restore_journal.h"
#include "settings/config.h"
#include "store/stale_files.h"

namespace DBServer {
namespace {

const std::string kSvcName = "CorvinaDB";
const std::string kSvcDisplayName = "Corvina database server";

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

bool DBSvc::prepareSvc() {
  DBConfig::inst();
  return true;
}

void DBSvc::runSvc() {
  try {
    const DBConfig& config = DBConfig::inst();
    // Everything below the service gets its settings, paths and Env from
    // here, through the pool; nothing below reads the process-wide record.
    const auto pool = DB::DBInstances::create(DB::PoolSettings::from(config), DB::Paths(config), sys::Env::posix());
    // Restores that a crash cut short are undone (or finished) before any
    // database opens; a database whose recovery failed stays held, so no
    // client opens it half restored, until a later start recovers it.
    std::vector<std::unique_ptr<DB::InstanceForMaintenance>> unrecovered;
    for (const std::string& key : maint::recoverRestores(pool->env(), pool->paths())) {
      unrecovered.push_back(std::make_unique<DB::InstanceForMaintenance>(pool, key, nullptr, true));
    }
    // Temporary files of data-file writes that a crash cut short go in the
    // background, beside the clients; the thread ends with the service.
    // File times are coarser than the clock: a margin keeps a write that
    // starts right away clear of the line.
    const auto started = pool->env().now() - std::chrono::seconds(2);
    std::jthread sweeper(
        [pool, started](std::stop_token stop) { DB::removeStaleTempFiles(pool->env(), pool->paths(), started, stop); });
    Ipc::SvcStub::Options transport;
    transport.memoryBudget = config.MaxBufferedMiB << 20;  // 0 stays 0: no limit
    std::shared_ptr<Ipc::DB::Listener> created =
        Ipc::DB::createListener(config.ServerPort, config.ForceIP4, pool, transport);
    Ipc::SvcStub& server = Ipc::DB::serverOf(*created);
    {
      sys::MutexLock lock(mutex_);
      listener = created;
      // A stop that came while there was no server to tell.
      if (stopRequested_) server.signalStop();
    }
    server.waitToFinish();
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

void DBSvc::stopSvc() {
  debugLine("Svc stopping...");
  sys::MutexLock lock(mutex_);
  stopRequested_ = true;
  if (listener) Ipc::DB::serverOf(*listener).signalStop();
}

const std::string& DBSvc::svcName() const { return kSvcName; }

const std::string& DBSvc::svcDisplayName() const { return kSvcDisplayName; }

}  // namespace DBServer
