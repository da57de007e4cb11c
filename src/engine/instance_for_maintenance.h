#pragma once
// DB::InstanceForMaintenance: a scope-bound maintenance hold on a database.
//
// Shared (backup, cleanup): the database's instance must be open; the hold
// works beside its clients and waits while another hold is set. Exclusive
// (restore): waits until every session of the database has ended and no
// other hold is set, then holds a new, uninitialised instance on which no
// session can begin. Releasing an exclusive hold drops the database's
// record, so the next session creates a new instance and attaches the
// (restored) database anew; releasing a shared hold leaves the instance open.
//
// Waiting polls once a tick (the pool's maintenanceTick, one second) for at
// most the pool's maxWaitMaintenanceSecs ticks, pausing through the pool's
// Env, and telling the progress callback (if any) how long it has waited:
// "Waiting for all clients connected to the database to exit (n/max
// seconds passed)" or "Waiting for another database maintenance operation
// to finish (…)", at ticks 1 to 9 and every fifth tick after. The pool mutex
// is not held while waiting.
//
// Ownership: a stack object of the maintenance thread; it keeps the pool it
// acquired from alive. The progress callback is borrowed for the
// construction only.
// Failures (construction): "No instance exist for <key>" (shared hold on a
// database without instance, at once); "Operation timeout!" when the wait
// is exhausted; DB::DBExc kTermInProgress when the service stops while it
// waits; engine failures of the instance creation. Destruction never throws.

#include <chrono>
#include <memory>
#include <stop_token>
#include <string>

#include "engine/instance.h"
#include "engine/progress.h"

namespace DB {

class DBInstances;

class InstanceForMaintenance {
 public:
  // A stop request through stop (the operation's) ends the wait like the
  // pool's stop does.
  InstanceForMaintenance(std::shared_ptr<DBInstances> pool, std::string dbKey, DBProgressCallback* progress,
                         bool exclusive, std::stop_token stop = {});
  ~InstanceForMaintenance();
  InstanceForMaintenance(const InstanceForMaintenance&) = delete;
  InstanceForMaintenance& operator=(const InstanceForMaintenance&) = delete;

  // The held instance; never null.
  const std::shared_ptr<engine::Instance>& instance() const noexcept { return handle_; }
  const std::string& dbKey() const noexcept { return dbKey_; }
  bool exclusive() const noexcept { return exclusive_; }

 private:
  std::shared_ptr<engine::Instance> acquire(bool set);

  std::shared_ptr<DBInstances> pool_;
  std::shared_ptr<engine::Instance> handle_;
  bool exclusive_;
  std::string dbKey_;
};

}  // namespace DB
