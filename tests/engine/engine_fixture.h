#pragma once
// Shared set-up of the engine tests: a pool whose folders lie in a
// temporary folder and whose files and clock go through a fault double,
// instances and sessions made directly on the engine layer, and a small
// counter table for write tests.

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <string>

#include "engine/db_exc.h"
#include "engine/db_instances.h"
#include "engine/engine_errors.h"
#include "engine/instance.h"
#include "engine/session.h"
#include "engine/transaction.h"
#include "support/fault_env.h"
#include "support/temp_dir.h"

namespace engine_testing {

namespace err = DB::err;

// The engine code of what the action throws; 0 when it throws nothing.
int codeOf(const std::function<void()>& action);
// The text of what the action throws; "" when it throws nothing.
std::string failureOf(const std::function<void()>& action);

// A fresh pool per test (maintenance ticks of 5 ms), stopped after it.
class EngineTest : public ::testing::Test {
 protected:
  EngineTest();
  ~EngineTest() override;

  // Replaces the pool by one with these settings (the old one is stopped).
  void configure(DB::PoolSettings settings);
  const std::shared_ptr<DB::DBInstances>& pool() const { return pool_; }

  std::string root() const { return dir_.path().string() + "/db/"; }
  DB::Paths paths() const;

  // Settings of an instance of key below root(), its file "cvdb.edb".
  engine::InstanceSettings settingsFor(const std::string& key);
  // An initialised instance of its own (not in the pool).
  std::shared_ptr<engine::Instance> makeInstance(const std::string& key, std::uint64_t maxSessions = 100);
  std::shared_ptr<engine::Instance> makeInstance(const engine::InstanceSettings& settings);
  // A session on a fresh database with a "counter" table (id INTEGER
  // PRIMARY KEY, value INTEGER) holding row 1 = 0, and a rowid table
  // "blobs" (id BLOB NOT NULL PRIMARY KEY, blob BLOB) STRICT.
  std::unique_ptr<engine::Session> makeDatabase(const std::shared_ptr<engine::Instance>& instance);
  // A second session on the instance's database.
  std::unique_ptr<engine::Session> openSession(const std::shared_ptr<engine::Instance>& instance);

  std::int64_t counter(engine::Session& session);

  testing_support::TempDir dir_;
  testing_support::FaultEnv env_{dir_ / "scratch"};

 private:
  std::shared_ptr<DB::DBInstances> pool_;
};

// Pool settings of the tests: the defaults, with short maintenance ticks.
DB::PoolSettings testSettings(std::uint64_t maxDbs = 100, std::uint64_t maxClients = 100, std::int32_t maxWait = 10);

}  // namespace engine_testing
