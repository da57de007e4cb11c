#pragma once
// DB::Paths: where the files of every database are, from the configured
// roots. Built once from the settings and handed to the layers that work
// with files, so that none of them reads the process-wide settings.
//
// Every folder text ends with "/". Keys come from folderName() of a valid
// name (names.h); the paths below a root are keyPath() of the key.
// Thread safety: immutable after construction; any thread.

#include <string>
#include <string_view>
#include <vector>

class DBConfig;

namespace DB {

class Paths {
 public:
  explicit Paths(const DBConfig& config);
  // root, logRoot and backupFolder end with "/".
  Paths(std::string root, std::string logRoot, std::string backupFolder, std::string dbFileName,
        std::vector<std::string> maintenanceFolders = {});

  const std::string& root() const noexcept { return root_; }
  const std::string& logRoot() const noexcept { return logRoot_; }
  const std::string& backupFolder() const noexcept { return backupFolder_; }
  const std::string& dbFileName() const noexcept { return dbFileName_; }

  std::string databaseFolder(std::string_view key) const;  // root + key + "/"
  std::string logFolder(std::string_view key) const;       // logRoot + key + "/"
  // root + "db.temp/" + the backup file name of the key without its
  // extension ("team\\sales" -> "team_sales") + "/": one level, so that no
  // database's working folder holds another's.
  std::string tempFolder(std::string_view key) const;
  std::string mainFile(std::string_view key) const;    // databaseFolder + dbFileName
  std::string dataFolder(std::string_view key) const;  // databaseFolder + "d/"
  std::string backupFile(std::string_view key) const;  // backupFolder + backupFileName

  // Whether a client may use the name here: isValidDatabaseName (names.h),
  // and no component below the first begins with the database file name.
  // Such a component would be a folder where another database keeps, or
  // will keep, its file or one of its companions ("a\\cvdb.edb-wal" is
  // the folder root/a/cvdb.edb-wal, the place of a's log), and that
  // database could never open again. why, when given, receives the reason.
  bool acceptsName(std::string_view name, std::string* why = nullptr) const;

  // The folders that backup targets and restore sources must lie in,
  // besides the backup folder; empty when any path is allowed.
  const std::vector<std::string>& maintenanceFolders() const noexcept { return maintenanceFolders_; }
  // Whether a backup or restore may use the path (a file or a folder, which
  // need not exist yet): always when no maintenance folders are set, else
  // when, with ".." and symbolic links resolved as far as the path exists,
  // it lies in one of them or in the backup folder.
  bool allowsMaintenancePath(const std::string& path) const;

 private:
  std::string root_;
  std::string logRoot_;
  std::string backupFolder_;
  std::string dbFileName_;
  std::vector<std::string> maintenanceFolders_;
};

}  // namespace DB
