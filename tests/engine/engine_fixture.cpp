#include "engine_fixture.h"

namespace engine_testing {

int codeOf(const std::function<void()>& action) {
  try {
    action();
  } catch (const DB::DBExc& e) {
    return e.code();
  }
  return 0;
}

std::string failureOf(const std::function<void()>& action) {
  try {
    action();
  } catch (const std::exception& e) {
    return e.what();
  }
  return "";
}

DB::PoolSettings testSettings(std::uint64_t maxDbs, std::uint64_t maxClients, std::int32_t maxWait) {
  DB::PoolSettings s;
  s.maxActiveDBs = maxDbs;
  s.maxClientsPerDB = maxClients;
  s.maxWaitMaintenanceSecs = maxWait;
  s.maintenanceTick = std::chrono::milliseconds(5);
  return s;
}

EngineTest::EngineTest() { configure(testSettings()); }

EngineTest::~EngineTest() {
  if (pool_) pool_->stop();
}

void EngineTest::configure(DB::PoolSettings settings) {
  if (pool_) pool_->stop();
  pool_ = DB::DBInstances::create(settings, paths(), env_);
}

DB::Paths EngineTest::paths() const {
  return DB::Paths(root(), dir_.path().string() + "/logs/", root() + "db.backup/", "cvdb.edb");
}

engine::InstanceSettings EngineTest::settingsFor(const std::string& key) {
  engine::InstanceSettings settings;
  settings.key = key;
  settings.instanceFolder = root() + key + "/";
  settings.logFolder = dir_.path().string() + "/logs/" + key + "/";
  settings.databaseFileName = "cvdb.edb";
  settings.busyTimeout = std::chrono::milliseconds(5000);
  settings.env = &env_;
  return settings;
}

std::shared_ptr<engine::Instance> EngineTest::makeInstance(const std::string& key, std::uint64_t maxSessions) {
  engine::InstanceSettings settings = settingsFor(key);
  settings.maxSessions = maxSessions;
  return makeInstance(settings);
}

std::shared_ptr<engine::Instance> EngineTest::makeInstance(const engine::InstanceSettings& settings) {
  auto instance = engine::Instance::create(settings);
  instance->init();
  return instance;
}

std::unique_ptr<engine::Session> EngineTest::makeDatabase(const std::shared_ptr<engine::Instance>& instance) {
  auto session = instance->beginSession();
  session->createDatabase(instance->settings().instanceFolder / instance->settings().databaseFileName);
  DB::Transaction txn(*session);
  session->execute(
      "CREATE TABLE counter(id INTEGER PRIMARY KEY, value INTEGER NOT NULL) STRICT;"
      "INSERT INTO counter VALUES(1, 0);"
      "CREATE TABLE blobs(id BLOB NOT NULL PRIMARY KEY, blob BLOB) STRICT;");
  txn.commit();
  return session;
}

std::unique_ptr<engine::Session> EngineTest::openSession(const std::shared_ptr<engine::Instance>& instance) {
  auto session = instance->beginSession();
  session->openDatabase();
  return session;
}

std::int64_t EngineTest::counter(engine::Session& session) {
  auto s = session.prepare("SELECT value FROM counter WHERE id = 1");
  EXPECT_TRUE(s.step());
  return s.columnInt64(0);
}

}  // namespace engine_testing
