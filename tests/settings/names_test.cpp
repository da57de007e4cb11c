#include "settings/names.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <iterator>
#include <random>
#include <string>
#include <vector>

#include "settings/paths.h"
#include "support/log_capture.h"

namespace {

using testing_support::LogCapture;

class Names : public ::testing::Test {
 protected:
  const DB::Paths paths_{"/srv/root/", "/srv/logs/", "/srv/bak/", "main.edb"};
};

TEST(FolderName, NamesBecomeLowerCaseKeysWithDataFoldersEscaped) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      {"", "root.db"},
      {"\\", "root.db"},
      {"/", "root.db"},
      {"Sales", "sales"},
      {"Sales\\", "sales"},
      {"Sales\\\\", "sales\\"},
      {"x\\d", "x\\d_"},
      {"x\\D\\y", "x\\d_\\y"},
      {"x\\d\\d", "x\\d_\\d_"},
      {"d\\x", "d\\x"},
      {"d", "d"},
      {"x\\dd", "x\\dd"},
      {"x\\d_", "x\\d_"},
      {"x\\\\d", "x\\\\d_"},
      // "/" separates levels as "\" does, so it cannot reach a data folder.
      {"x/d", "x\\d_"},
      {"X/D/y", "x\\d_\\y"},
      {"a/b\\c/", "a\\b\\c"},
      // Only A to Z change; UTF-8 bytes stay as they are.
      {"\xC3\x84rger", "\xC3\x84rger"},
  };
  for (const auto& [name, key] : cases) EXPECT_EQ(DB::folderName(name), key) << name;
}

TEST(ValidName, RefusesNamesThatLeaveTheRootOrAliasAnotherKey) {
  for (const std::string name : {"", "\\", "/", "Sales", "a\\b", "a/b", "sales\\", "x\\d", "..x", "a.b", "root.db",
                                 "...", "x\\db.temp", "DB.temp2"}) {
    EXPECT_TRUE(DB::isValidDatabaseName(name)) << name;
  }
  for (const std::string name : {"..", ".", "a\\..\\b", "a/../b", "./a", "a\\.", "A/..", "\\sales", "/sales", "a\\\\b",
                                 "a//b", "sales\\\\", "db.temp\\x", "DB.Backup", ".config/x", "db.backup"}) {
    std::string why;
    EXPECT_FALSE(DB::isValidDatabaseName(name, &why)) << name;
    EXPECT_FALSE(why.empty()) << name;
  }
  EXPECT_FALSE(DB::isValidDatabaseName(std::string("a\0b", 3)));
  EXPECT_FALSE(DB::isValidDatabaseName(std::string("\0", 1)));
}

TEST_F(Names, PathsOfAKeyUseSlashesBelowTheirRootsAndNeverLeaveThem) {
  const std::string key = DB::folderName("Team\\Sales");
  EXPECT_EQ(paths_.databaseFolder(key), "/srv/root/team/sales/");
  EXPECT_EQ(paths_.logFolder(key), "/srv/logs/team/sales/");
  EXPECT_EQ(paths_.tempFolder(key), "/srv/root/db.temp/team_sales/");
  EXPECT_EQ(paths_.mainFile(key), "/srv/root/team/sales/main.edb");
  EXPECT_EQ(paths_.dataFolder(key), "/srv/root/team/sales/d/");
  EXPECT_EQ(paths_.backupFile(key), "/srv/bak/team_sales.cvbak");
  EXPECT_EQ(paths_.databaseFolder("root.db"), "/srv/root/root.db/");
  EXPECT_EQ(DB::nameFromRelativeFolder("Team/sales/"), "team\\sales");
  // Keys with empty components come from refused names only, but a path
  // must never turn absolute or gain "//" on the way.
  EXPECT_EQ(paths_.databaseFolder("\\sales"), "/srv/root/sales/");
  EXPECT_EQ(paths_.databaseFolder("sales\\"), "/srv/root/sales/");
  EXPECT_EQ(paths_.tempFolder("a\\\\b"), "/srv/root/db.temp/a__b/");
  EXPECT_EQ(paths_.tempFolder("a_b"), "/srv/root/db.temp/a-_b/");
  // The server's own folders below the root are no databases.
  for (const char* name : {"db.backup", "db.temp", ".config"}) EXPECT_FALSE(DB::isDBFolderName(name)) << name;
  for (const char* name : {"DB.backup", "db.backup2", "sales", ".configx"})
    EXPECT_TRUE(DB::isDBFolderName(name)) << name;
}

// For any name a client may use, the database's folder lies below DBRoot,
// is no other database's data folder, and the database found there on disk
// has the same key again.
// No name may put a folder where a database keeps, or will keep, its file
// or a companion of it.
TEST_F(Names, NamesThatWouldTakeTheFilesOfADatabaseAreRefused) {
  std::string why;
  for (const char* name :
       {"a\\main.edb", "a\\main.edb-wal", "a\\MAIN.EDB-shm", "a\\b\\main.edb.creating", "a/main.edb-journal/x"}) {
    EXPECT_FALSE(paths_.acceptsName(name, &why)) << name;
  }
  EXPECT_EQ(why, "a component of the name is the name of a database's own file");
  for (const char* name : {"main.edb", "a\\main", "a\\xmain.edb", "a\\b"})
    EXPECT_TRUE(paths_.acceptsName(name)) << name;
  EXPECT_FALSE(paths_.acceptsName("a\\..\\b"));  // the general rules first
}

TEST_F(Names, ValidNamesStayInsideTheirOwnFolder) {
  std::mt19937 random(20240611);
  const std::string alphabet = "aD./\\\\d..-_x";
  std::uniform_int_distribution<std::size_t> length(0, 10);
  std::uniform_int_distribution<std::size_t> pick(0, alphabet.size() - 1);
  const std::filesystem::path root = paths_.root();
  int valid = 0;
  for (int i = 0; i < 20000; ++i) {
    std::string name;
    for (std::size_t n = length(random); n > 0; --n) name += alphabet[pick(random)];
    if (!DB::isValidDatabaseName(name)) continue;
    ++valid;
    const std::string key = DB::folderName(name);
    const std::string folder = paths_.databaseFolder(key);
    ASSERT_EQ(std::filesystem::path(folder).lexically_normal().string(), folder) << name;
    const std::filesystem::path relative = std::filesystem::path(folder).lexically_relative(root);
    ASSERT_FALSE(relative.empty()) << name;
    ASSERT_NE(*relative.begin(), "..") << name;
    ASSERT_TRUE(DB::isDBFolderName(relative.begin()->string())) << name;
    for (auto part = std::next(relative.begin()); part != relative.end(); ++part) {
      ASSERT_NE(*part, "d") << name;
    }
    ASSERT_EQ(DB::nameFromRelativeFolder(relative.string()), key) << name;
  }
  EXPECT_GT(valid, 1000);
}

TEST(BackupFileName, EscapesWithTheHyphenAndReadsBackForAnyKey) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      {"sales", "sales.cvbak"}, {"a-b", "a--b.cvbak"},    {"a_b", "a-_b.cvbak"},    {"a\\b", "a_b.cvbak"},
      {"a-\\b", "a--_b.cvbak"}, {"a_\\b", "a-__b.cvbak"}, {"x\\d_", "x_d-_.cvbak"}, {"root.db", "root.db.cvbak"},
  };
  LogCapture log;
  for (const auto& [key, file] : cases) {
    EXPECT_EQ(DB::backupFileName(key), file) << key;
    EXPECT_EQ(DB::nameFromBackupFile(file), key) << file;
  }
  std::mt19937 random(77);
  const std::string alphabet = "--__\\\\ab.d";
  std::uniform_int_distribution<std::size_t> length(0, 16);
  std::uniform_int_distribution<std::size_t> pick(0, alphabet.size() - 1);
  for (int i = 0; i < 5000; ++i) {
    std::string key;
    for (std::size_t n = length(random); n > 0; --n) key += alphabet[pick(random)];
    const std::string file = DB::backupFileName(key);
    ASSERT_EQ(file.find('\\'), std::string::npos) << key;
    ASSERT_EQ(DB::nameFromBackupFile(file), key) << key;
  }
  EXPECT_EQ(log.count("Old backup filename"), 0u);
}

TEST(BackupFileName, ForeignAndOldFileNames) {
  LogCapture log;
  EXPECT_EQ(DB::nameFromBackupFile("SALES.CVBAK"), "SALES");
  EXPECT_EQ(DB::folderName(DB::nameFromBackupFile("SALES.CVBAK")), "sales");
  EXPECT_EQ(DB::nameFromBackupFile("notes.txt"), "");
  EXPECT_EQ(DB::nameFromBackupFile("cvbak"), "");
  EXPECT_EQ(DB::nameFromBackupFile("x.cvbak.tmp"), "");
  EXPECT_EQ(log.count("Old backup filename"), 0u);

  EXPECT_EQ(DB::nameFromBackupFile("old-name.cvbak"), "old-name");
  EXPECT_EQ(log.count(Log::Notice, "Old backup filename ('-' not escaped). Ignored"), 1u);

  log.clear();
  // One line per unescaped hyphen, a trailing one included.
  EXPECT_EQ(DB::nameFromBackupFile("a-b---.cvbak"), "a-b--");
  EXPECT_EQ(log.count(Log::Notice, "Old backup filename ('-' not escaped). Ignored"), 2u);
}

}  // namespace
