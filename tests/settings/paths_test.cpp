// Where backups and restores may go when maintenance folders are set.

#include "settings/paths.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using testing_support::TempDir;

class MaintenancePaths : public ::testing::Test {
 protected:
  MaintenancePaths() {
    for (const char* folder : {"root", "bak", "allowed/sub", "allowed2", "outside"}) {
      fs::create_directories(dir_.path() / folder);
    }
  }
  std::string at(const std::string& relative) const { return (dir_.path() / relative).string(); }
  DB::Paths paths(std::vector<std::string> folders) const {
    return DB::Paths(at("root/"), at("root/"), at("bak/"), "cvdb.edb", std::move(folders));
  }

  TempDir dir_;
};

TEST_F(MaintenancePaths, WithoutFoldersAnyPathIsAllowed) {
  const DB::Paths open = paths({});
  EXPECT_TRUE(open.allowsMaintenancePath("/etc/passwd"));
  EXPECT_TRUE(open.allowsMaintenancePath(at("outside/x.cvbak")));
}

TEST_F(MaintenancePaths, OnlyTheBackupFolderAndTheListedOnesAreAllowed) {
  const DB::Paths confined = paths({at("allowed/")});
  // Inside, also below and not yet existing.
  EXPECT_TRUE(confined.allowsMaintenancePath(at("bak/a.cvbak")));
  EXPECT_TRUE(confined.allowsMaintenancePath(at("allowed/sub/a.cvbak")));
  EXPECT_TRUE(confined.allowsMaintenancePath(at("allowed/new/deeper/")));
  EXPECT_TRUE(confined.allowsMaintenancePath(at("allowed/")));
  // Outside: another folder, a name that only begins like an allowed one,
  // a way out through "..", the root of the databases, relative paths.
  EXPECT_FALSE(confined.allowsMaintenancePath(at("outside/a.cvbak")));
  EXPECT_FALSE(confined.allowsMaintenancePath(at("allowed2/a.cvbak")));
  EXPECT_FALSE(confined.allowsMaintenancePath(at("allowed/../outside/a.cvbak")));
  EXPECT_FALSE(confined.allowsMaintenancePath(at("allowed/sub/../../root/x/cvdb.edb")));
  EXPECT_FALSE(confined.allowsMaintenancePath(at("allowed/..")));
  EXPECT_FALSE(confined.allowsMaintenancePath("/etc/cron.d/job"));
  EXPECT_FALSE(confined.allowsMaintenancePath("a.cvbak"));
}

TEST_F(MaintenancePaths, SymbolicLinksCountWhereTheyLeadAndWhereTheyAre) {
  const DB::Paths confined = paths({at("allowed/")});
  // A folder link inside that leads out: refused, as is a file through it.
  fs::create_directory_symlink(at("outside"), at("allowed/out"));
  EXPECT_FALSE(confined.allowsMaintenancePath(at("allowed/out/a.cvbak")));
  // A file link outside that leads in: a backup would replace the link
  // where it is, outside.
  fs::create_symlink(at("allowed/a.cvbak"), at("outside/in.cvbak"));
  EXPECT_FALSE(confined.allowsMaintenancePath(at("outside/in.cvbak")));
  // A file link inside that leads out: a restore would read outside.
  fs::create_symlink("/etc/passwd", at("allowed/passwd.cvbak"));
  EXPECT_FALSE(confined.allowsMaintenancePath(at("allowed/passwd.cvbak")));
  // An allowed folder given through a link is what it leads to.
  fs::create_directory_symlink(at("allowed"), at("outside/link-to-allowed"));
  const DB::Paths viaLink = paths({at("outside/link-to-allowed/")});
  EXPECT_TRUE(viaLink.allowsMaintenancePath(at("allowed/sub/a.cvbak")));
}

}  // namespace
