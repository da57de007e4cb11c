#include "settings/paths.h"

#include <algorithm>
#include <filesystem>
#include <optional>
#include <system_error>

#include "settings/config.h"
#include "settings/names.h"

namespace DB {

Paths::Paths(const DBConfig& config)
    : Paths(config.DBRoot, config.DBLogRoot, config.BackupFolder, config.DBFileName, config.MaintenanceFolders) {}

Paths::Paths(std::string root, std::string logRoot, std::string backupFolder, std::string dbFileName,
             std::vector<std::string> maintenanceFolders)
    : root_(std::move(root)),
      logRoot_(std::move(logRoot)),
      backupFolder_(std::move(backupFolder)),
      dbFileName_(std::move(dbFileName)),
      maintenanceFolders_(std::move(maintenanceFolders)) {}

bool Paths::allowsMaintenancePath(const std::string& path) const {
  namespace fs = std::filesystem;
  if (maintenanceFolders_.empty()) return true;
  // Resolved on every call: a folder or a link may change while the
  // server runs.
  const auto resolve = [](const std::string& text) -> std::optional<fs::path> {
    std::error_code ec;
    fs::path p = fs::weakly_canonical(fs::path(text), ec);
    if (ec || !p.is_absolute()) return std::nullopt;
    return p;
  };
  const auto within = [&](const fs::path& target, const std::string& folder) {
    const auto base = resolve(folder);
    if (!base) return false;
    // Component by component: "/srv/backup2" is not inside "/srv/backup".
    auto t = target.begin();
    for (auto b = base->begin(); b != base->end(); ++b, ++t) {
      if (b->empty()) continue;  // the empty last component of "dir/"
      if (t == target.end() || *t != *b) return false;
    }
    return true;
  };
  const auto allowed = [&](const fs::path& target) {
    if (within(target, backupFolder_)) return true;
    return std::any_of(maintenanceFolders_.begin(), maintenanceFolders_.end(),
                       [&](const std::string& folder) { return within(target, folder); });
  };
  // Both where the path leads (what a restore reads) and where its last
  // component is (a backup replaces a link there instead of following it).
  const auto target = resolve(path);
  const fs::path given(path);
  const auto parent = resolve(given.parent_path().string());
  return target && parent && allowed(*target) && allowed(*parent / given.filename());
}

std::string Paths::databaseFolder(std::string_view key) const { return root_ + keyPath(key); }

std::string Paths::logFolder(std::string_view key) const { return logRoot_ + keyPath(key); }

std::string Paths::tempFolder(std::string_view key) const {
  // One flat level: the backup file's stem is unique per key and has no
  // separator, so no working folder lies inside another database's (a key
  // path would put "a\\b"'s below "a"'s, where removing "a"'s would take the
  // files a restore of "a\\b" has set aside).
  std::string stem = backupFileName(key);
  stem.resize(stem.size() - std::string_view(kBackupExtension).size());
  return root_ + kTempSubfolder + stem + "/";
}

std::string Paths::mainFile(std::string_view key) const { return databaseFolder(key) + dbFileName_; }

std::string Paths::dataFolder(std::string_view key) const { return databaseFolder(key) + kDataSubfolder; }

bool Paths::acceptsName(std::string_view name, std::string* why) const {
  if (!isValidDatabaseName(name, why)) return false;
  const std::string key = folderName(name);
  std::size_t start = key.find('\\');
  while (start != std::string::npos) {
    const std::size_t end = key.find('\\', start + 1);
    const std::string_view part =
        std::string_view(key).substr(start + 1, end == std::string::npos ? end : end - start - 1);
    if (!dbFileName_.empty() && part.starts_with(dbFileName_)) {
      if (why) *why = "a component of the name is the name of a database's own file";
      return false;
    }
    start = end;
  }
  return true;
}

std::string Paths::backupFile(std::string_view key) const { return backupFolder_ + backupFileName(key); }

}  // namespace DB
