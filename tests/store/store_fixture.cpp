#include "store_fixture.h"

#include <algorithm>

#include "engine/db_instances.h"

namespace store_testing {

namespace {

DB::PoolSettings testSettings() {
  DB::PoolSettings s;
  s.maintenanceTick = std::chrono::milliseconds(5);
  return s;
}

}  // namespace

StoreTest::StoreTest()
    : pool_(DB::DBInstances::create(testSettings(), DB::Paths(root(), logRoot(), root() + "db.backup/", "cvdb.edb"),
                                    env_)) {}

StoreTest::~StoreTest() { pool_->stop(); }

std::unique_ptr<DB::DBLocal> StoreTest::open(const std::string& name) {
  auto db = std::make_unique<DB::DBLocal>(pool_, name);
  EXPECT_TRUE(db->exists(false));
  return db;
}

std::vector<std::string> entries(const std::filesystem::path& folder) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator(folder, ec)) names.push_back(e.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

Ipc::PackInfo complete(const std::string& id, const std::string& folder, std::int32_t status, const std::string& name) {
  Ipc::PackInfoPartial p;
  p.name = name;
  p.owner = "anna";
  p.created = 1700000000;
  p.modified = 1700003600;
  p.docCount = 3;
  return Ipc::PackInfo(id, folder, status, p);
}

Ipc::PackInfo useRequest(const std::string& id, Ipc::UseInfo::State state, const std::string& host,
                         std::uint32_t process, const std::string& user) {
  Ipc::PackInfo p(id);
  p.uses.append(Ipc::UseInfo(state, host, user, process));
  return p;
}

}  // namespace store_testing
