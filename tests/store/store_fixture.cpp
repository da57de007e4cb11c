#include "store_fixture.h"

#include <algorithm>

#include "engine/db_instances.h"

namespace store_testing {

StoreTest::StoreTest() {
  DBConfig config;
  config.DBRoot = root();
  config.DBLogRoot = logRoot();
  config.BackupFolder = root() + "db.backup/";
  override_ = std::make_unique<DBConfig::TestOverride>(config);
}

StoreTest::~StoreTest() {
  DB::DBInstances::teardown();
  DB::DBLocal::setCreationHookForTesting({});
}

std::unique_ptr<DB::DBLocal> StoreTest::open(const std::string& name) {
  auto db = std::make_unique<DB::DBLocal>(name);
  EXPECT_TRUE(db->exists(false));
  return db;
}

ssize_t FailingFileOps::write(int fd, const void* data, std::size_t size) {
  ++writes_;
  if (writes_ == write_.nth && write_.partial > 0) return FileOps::write(fd, data, std::min(size, write_.partial));
  if (writes_ == write_.nth + (write_.partial > 0 ? 1 : 0)) {
    errno = write_.error;
    return -1;
  }
  return FileOps::write(fd, data, size);
}

int FailingFileOps::fsync(int fd) {
  if (++fsyncs_ != fsync_.nth) return FileOps::fsync(fd);
  errno = fsync_.error;
  return -1;
}

int FailingFileOps::rename(const char* from, const char* to) {
  if (++renames_ != rename_.nth) return FileOps::rename(from, to);
  errno = rename_.error;
  return -1;
}

std::vector<std::string> entries(const std::filesystem::path& folder) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator(folder, ec)) names.push_back(e.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

Ipc::PackInfo complete(const std::string& id, const std::string& folder, std::int32_t status,
                       const std::string& name) {
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
