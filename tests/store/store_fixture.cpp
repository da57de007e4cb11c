#include "store_fixture.h"

#include <unistd.h>

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

int FailingFileOps::access(const char* path, int mode) {
  if (++accesses == access_.nth) {
    errno = access_.error;
    return -1;
  }
  return FileOps::access(path, mode);
}

ssize_t FailingFileOps::write(int fd, const void* data, std::size_t size) {
  if (++writes == write_.nth) {
    if (write_.partial > 0) return FileOps::write(fd, data, std::min(size, write_.partial));
    errno = write_.error;
    return -1;
  }
  // After a partial write the next call reports the failure.
  if (write_.nth > 0 && write_.partial > 0 && writes == write_.nth + 1) {
    errno = write_.error;
    return -1;
  }
  return FileOps::write(fd, data, size);
}

int FailingFileOps::fsync(int fd) {
  if (++fsyncs == fsync_.nth) {
    errno = fsync_.error;
    return -1;
  }
  return FileOps::fsync(fd);
}

int FailingFileOps::rename(const char* from, const char* to) {
  if (++renames == rename_.nth) {
    errno = rename_.error;
    return -1;
  }
  return FileOps::rename(from, to);
}

std::vector<std::string> entries(const std::filesystem::path& folder) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator(folder, ec)) names.push_back(e.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace store_testing
