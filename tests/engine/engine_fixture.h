#pragma once
// Shared set-up of the engine tests: settings whose folders lie in a
// temporary folder, instances and sessions made directly on the engine
// layer, and a small counter table for write tests.

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
#include "service/config.h"
#include "support/temp_dir.h"

namespace engine_testing {

namespace err = DB::err;

// The engine code of what the action throws; 0 when it throws nothing.
int codeOf(const std::function<void()>& action);
// The text of what the action throws; "" when it throws nothing.
std::string failureOf(const std::function<void()>& action);

// Settings in a temporary folder; the pool is torn down after each test so
// that every test starts without instances.
class EngineTest : public ::testing::Test {
 protected:
  EngineTest();
  ~EngineTest() override;

  DBConfig config() const;
  // Applies a config (from config() with changes) for the rest of the test.
  void applyConfig(const DBConfig& changed);

  std::string root() const { return dir_.path().string() + "/db/"; }

  // Settings of an instance of key below root(), its file "cvdb.edb".
  engine::InstanceSettings settingsFor(const std::string& key) const;
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

 private:
  std::unique_ptr<DBConfig::TestOverride> override_;
};

}  // namespace engine_testing
