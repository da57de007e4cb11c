#pragma once
// Shared set-up of the store tests: a fresh engine pool per test whose
// folders lie in a temporary folder and whose files and clock go through a
// fault double (which fails chosen calls), and pack records to send.

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "engine/db_instances.h"
#include "framework/json.h"
#include "protocol/pack_info.h"
#include "store/db_local.h"
#include "support/fault_env.h"
#include "support/raw_db.h"
#include "support/temp_dir.h"

namespace store_testing {

class StoreTest : public ::testing::Test {
 protected:
  StoreTest();
  ~StoreTest() override;

  std::string root() const { return dir_.path().string() + "/db/"; }
  std::string logRoot() const { return dir_.path().string() + "/logs/"; }
  const std::shared_ptr<DB::DBInstances>& pool() const { return pool_; }
  // A store on the database, opened (and created when missing).
  std::unique_ptr<DB::DBLocal> open(const std::string& name);

  testing_support::TempDir dir_;
  testing_support::FaultEnv env_{dir_ / "scratch"};

 private:
  std::shared_ptr<DB::DBInstances> pool_;
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
