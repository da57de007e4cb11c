#pragma once
// Shared set-up of the store tests: settings whose folders lie in a
// temporary folder, a fresh engine pool per test, and a file-system double
// that fails chosen calls.

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "service/config.h"
#include "store/db_local.h"
#include "store/file_ops.h"
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

}  // namespace store_testing
