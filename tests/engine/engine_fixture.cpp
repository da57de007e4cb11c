#include "engine_fixture.h"

#include "engine/instance_for_maintenance.h"

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

EngineTest::EngineTest() { applyConfig(config()); }

EngineTest::~EngineTest() {
  DB::DBInstances::teardown();
  DB::Transaction::setPauseForTesting({});
  DB::InstanceForMaintenance::setTickForTesting(std::chrono::milliseconds(1000));
}

DBConfig EngineTest::config() const {
  if (override_) return DBConfig::inst();
  DBConfig c;
  c.DBRoot = root();
  c.DBLogRoot = dir_.path().string() + "/logs/";
  c.BackupFolder = root() + "db.backup/";
  return c;
}

void EngineTest::applyConfig(const DBConfig& changed) {
  override_.reset();
  override_ = std::make_unique<DBConfig::TestOverride>(changed);
}

engine::InstanceSettings EngineTest::settingsFor(const std::string& key) const {
  engine::InstanceSettings settings;
  settings.key = key;
  settings.instanceFolder = root() + key + "/";
  settings.logFolder = dir_.path().string() + "/logs/" + key + "/";
  settings.databaseFileName = "cvdb.edb";
  settings.busyTimeout = std::chrono::milliseconds(5000);
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
