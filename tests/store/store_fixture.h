#pragma once
// Shared set-up of the store tests: settings whose folders lie in a
// temporary folder, a fresh engine pool per test, a file-system double
// that fails chosen calls, and pack records to send.

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "framework/json.h"
#include "protocol/pack_info.h"
#include "service/config.h"
#include "store/db_local.h"
#include "store/file_ops.h"
#include "support/raw_db.h"
#include "support/temp_dir.h"

namespace store_testing {

class StoreTest : public ::testing::Test {
 protected:
  StoreTest();
  ~StoreTest() override;

  std::string root() const { return dir_.path().string() + "/db/"; }
  std::string logRoot() const { return dir_.path().string() + "/logs/"; }
  // A store on the database, opened (and created when missing).
  std::unique_ptr<DB::DBLocal> open(const std::string& name);

  testing_support::TempDir dir_;

 private:
  std::unique_ptr<DBConfig::TestOverride> override_;
};

// Real calls, except that the nth call (from 1) of a kind fails with error;
// a write that fails after `partial` bytes first writes those bytes.
class FailingFileOps : public DB::FileOps {
 public:
  struct Failure {
    int nth = 0;
    int error = EIO;
    std::size_t partial = 0;
  };
  Failure write_, fsync_, rename_;

  ssize_t write(int fd, const void* data, std::size_t size) override;
  int fsync(int fd) override;
  int rename(const char* from, const char* to) override;

 private:
  int writes_ = 0, fsyncs_ = 0, renames_ = 0;
};

// The names in a folder, sorted; empty when it is missing.
std::vector<std::string> entries(const std::filesystem::path& folder);

// A complete pack record.
Ipc::PackInfo complete(const std::string& id, const std::string& folder, std::int32_t status,
                       const std::string& name = "name");
// A request that names the pack and carries one use entry.
Ipc::PackInfo useRequest(const std::string& id, Ipc::UseInfo::State state, const std::string& host,
                         std::uint32_t process = 7, const std::string& user = "u");
// The JSON text stored for a pack's record; none without a row.
inline std::optional<std::string> storedText(const testing_support::RawDb& raw, const std::string& id) {
  return raw.value("SELECT blob FROM info WHERE id = ?1", {id});
}
inline json::Object storedRecord(const testing_support::RawDb& raw, const std::string& id) {
  return json::strToObject(storedText(raw, id).value());
}

}  // namespace store_testing
