#include "engine/instance_for_maintenance.h"

#include "engine/db_exc.h"
#include "engine/db_instances.h"
#include "engine/engine_errors.h"
#include "framework/log.h"

namespace DB {
InstanceForMaintenance::InstanceForMaintenance(std::shared_ptr<DBInstances> pool, std::string dbKey,
                                               DBProgressCallback* progress, bool exclusive, std::stop_token stop)
    : pool_(std::move(pool)), exclusive_(exclusive), dbKey_(std::move(dbKey)) {
  handle_ = acquire(true);
  if (handle_) return;
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DBInstances: InstanceForMaintenance for " << dbKey_
                                          << " can not acquire instance handle. Waiting and retrying...";
  }
  const std::int32_t maxWait = pool_->settings().maxWaitMaintenanceSecs;
  for (std::int64_t n = 1; n <= maxWait; ++n) {
    if (!pool_->waitTick(stop)) throwEngineError(err::kTermInProgress);
    if (n < 10 || n % 5 == 0) {
      const std::string text =
          std::string(exclusive_ ? "Waiting for all clients connected to the database to exit ("
                                 : "Waiting for another database maintenance operation to finish (") +
          std::to_string(n) + "/" + std::to_string(maxWait) + "seconds passed)";
      if (progress != nullptr) progress->onProgress(0, text);
    }
    handle_ = acquire(true);
    if (handle_) return;
  }
  throw DBExc("Operation timeout!");
}

InstanceForMaintenance::~InstanceForMaintenance() {
  if (!handle_) return;
  try {
    acquire(false);
  } catch (const std::exception& e) {
    Log::Lock(Log::Error).logStreamLine()
        << "DBInstances: releasing the maintenance hold on " << dbKey_ << " failed: " << e.what();
  }
}

std::shared_ptr<engine::Instance> InstanceForMaintenance::acquire(bool set) {
  return exclusive_ ? pool_->acquireExclusive(dbKey_, set) : pool_->acquireShared(dbKey_, set);
}

}  // namespace DB
