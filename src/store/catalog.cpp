#include "store/catalog.h"

#include "settings/names.h"

namespace DB {
namespace {

// Visits folder (its path below the root is relative, "" for the root
// itself) and the folders below it.
void walk(sys::Env& env, const Paths& paths, const std::string& relative, std::vector<std::string>& keys) {
  const std::string folder = paths.root() + relative;
  const std::vector<sys::DirEntry> entries = env.list(folder);
  bool holdsDatabase = false;
  for (const auto& e : entries) {
    if (e.type == sys::FileType::Regular && e.name == paths.dbFileName()) holdsDatabase = true;
  }
  bool isDatabase = false;
  if (holdsDatabase && !relative.empty()) {
    const std::string key = nameFromRelativeFolder(relative);
    if (paths.databaseFolder(key) == folder) {
      keys.push_back(key);
      isDatabase = true;
    }
  }
  for (const auto& e : entries) {
    if (e.type != sys::FileType::Folder) continue;
    if (relative.empty() && !isDBFolderName(e.name)) continue;   // the server's own folders
    if (isDatabase && e.name + '/' == kDataSubfolder) continue;  // its data files
    walk(env, paths, relative + e.name + '/', keys);
  }
}

}  // namespace

std::vector<std::string> databaseKeys(sys::Env& env, const Paths& paths) {
  std::vector<std::string> keys;
  if (env.stat(paths.root(), true).type != sys::FileType::Folder) return keys;
  walk(env, paths, "", keys);
  return keys;
}

}  // namespace DB
