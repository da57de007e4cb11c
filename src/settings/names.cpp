#include "settings/names.h"

#include <array>
#include <vector>

#include "framework/log.h"

namespace DB {
namespace {

constexpr char kSeparator = '\\';
constexpr std::string_view kBackupExtensionView = ".cvbak";

// Folders directly below the root that belong to the server itself.
constexpr std::array<std::string_view, 3> kReservedTopFolders = {"db.backup", "db.temp", ".config"};

std::vector<std::string_view> split(std::string_view text, char separator) {
  std::vector<std::string_view> parts;
  std::size_t start = 0;
  while (true) {
    const auto end = text.find(separator, start);
    parts.push_back(text.substr(start, end == std::string_view::npos ? std::string_view::npos : end - start));
    if (end == std::string_view::npos) return parts;
    start = end + 1;
  }
}

char lowerAscii(char c) { return (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c; }

}  // namespace

// Keys as relative paths: "\" becomes "/", and empty components (a
// leading separator, doubled or trailing ones) are dropped. Such keys come
// only from names that isValidDatabaseName refuses; collapsing them keeps
// every derived path a plain, canonical text below its root, so that a
// prefix test against DBRoot holds and "/x" never reads as absolute.
std::string keyPath(std::string_view key) {
  std::string path;
  for (const auto part : split(key, kSeparator)) {
    if (part.empty()) continue;
    path.append(part);
    path.push_back('/');
  }
  return path;
}

std::string folderName(std::string_view name) {
  std::string key;
  key.reserve(name.size() + 2);
  for (const char c : name) {
    // Linux has only "/" as path separator, but clients treat both as the
    // separator of the hierarchy; folding "/" into "\" here keeps a name
    // such as x/d from reaching the data folder "d" of database x.
    key.push_back(c == '/' ? kSeparator : lowerAscii(c));
  }
  if (key.empty() || key == "\\") return kRootDbName;
  if (key.back() == kSeparator) key.pop_back();

  // A component named exactly "d" would be the data folder of the database
  // one level up, so it becomes "d_". The first component has no database
  // above it and stays as it is.
  std::string escaped;
  escaped.reserve(key.size() + 4);
  bool first = true;
  for (const auto part : split(key, kSeparator)) {
    if (!first) escaped.push_back(kSeparator);
    escaped.append(part);
    if (!first && part == "d") escaped.push_back('_');
    first = false;
  }
  return escaped;
}

bool isValidDatabaseName(std::string_view name, std::string* why) {
  const auto refuse = [why](const char* reason) {
    if (why) *why = reason;
    return false;
  };
  if (name.find('\0') != std::string_view::npos) return refuse("the name holds a NUL byte");
  // The key shows what the name addresses: separators unified, one trailing
  // separator dropped, the empty name mapped to the root database.
  const std::string key = folderName(name);
  if (key == kRootDbName) return true;
  const auto parts = split(key, kSeparator);
  for (const auto part : parts) {
    // An empty component would give a second key for the same folder
    // ("\x" and "x", "a\\b" and "a\b"), so two engine instances and two
    // sets of maintenance holds would work on one database.
    if (part.empty()) return refuse("the name has an empty component");
    if (part == "." || part == "..") return refuse("the name has a component \".\" or \"..\"");
  }
  if (!isDBFolderName(parts.front())) {
    return refuse("the name's first component is reserved for the server's own folders");
  }
  return true;
}

std::string backupFileName(std::string_view key) {
  std::string out;
  out.reserve(key.size() + 16);
  for (const char c : key) {
    switch (c) {
      case '-':
        out += "--";
        break;
      case '_':
        out += "-_";
        break;
      case '\\':
        out += '_';
        break;
      default:
        out += c;
    }
  }
  out += kBackupExtension;
  return out;
}

std::string nameFromBackupFile(std::string_view fileName) {
  const auto ext = kBackupExtensionView.size();
  if (fileName.size() < ext) return {};
  for (std::size_t i = 0; i < ext; ++i) {
    if (lowerAscii(fileName[fileName.size() - ext + i]) != kBackupExtensionView[i]) return {};
  }
  const std::string_view stem = fileName.substr(0, fileName.size() - ext);
  std::string name;
  name.reserve(stem.size());
  for (std::size_t i = 0; i < stem.size(); ++i) {
    const char c = stem[i];
    if (c == '_') {
      name += kSeparator;
    } else if (c != '-') {
      name += c;
    } else if (i + 1 < stem.size() && (stem[i + 1] == '-' || stem[i + 1] == '_')) {
      name += stem[++i];
    } else {
      // Files written before the hyphen became the escape character.
      name += c;
      Log::Lock(Log::Notice).logStreamLine() << "Old backup filename ('" << c << "' not escaped). Ignored";
    }
  }
  return name;
}

bool isDBFolderName(std::string_view entryName) {
  for (const auto reserved : kReservedTopFolders) {
    if (entryName == reserved) return false;
  }
  return true;
}

std::string nameFromRelativeFolder(std::string_view relativePath) {
  std::string name;
  for (const auto part : split(relativePath, '/')) {
    if (part.empty()) continue;
    if (!name.empty()) name += kSeparator;
    name.append(part);
  }
  return folderName(name);
}

}  // namespace DB
