#include "settings/paths.h"

#include "settings/config.h"
#include "settings/names.h"

namespace DB {

Paths::Paths(const DBConfig& config) : Paths(config.DBRoot, config.DBLogRoot, config.BackupFolder, config.DBFileName) {}

Paths::Paths(std::string root, std::string logRoot, std::string backupFolder, std::string dbFileName)
    : root_(std::move(root)),
      logRoot_(std::move(logRoot)),
      backupFolder_(std::move(backupFolder)),
      dbFileName_(std::move(dbFileName)) {}

std::string Paths::databaseFolder(std::string_view key) const { return root_ + keyPath(key); }

std::string Paths::logFolder(std::string_view key) const { return logRoot_ + keyPath(key); }

std::string Paths::tempFolder(std::string_view key) const { return root_ + kTempSubfolder + keyPath(key); }

std::string Paths::mainFile(std::string_view key) const { return databaseFolder(key) + dbFileName_; }

std::string Paths::dataFolder(std::string_view key) const { return databaseFolder(key) + kDataSubfolder; }

std::string Paths::backupFile(std::string_view key) const { return backupFolder_ + backupFileName(key); }

}  // namespace DB
