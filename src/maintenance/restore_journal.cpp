#include "maintenance/restore_journal.h"

#include <optional>
#include <sstream>
#include <stdexcept>
#include <utility>

#include "framework/log.h"
#include "settings/names.h"

namespace maint {
namespace {

constexpr std::string_view kMagic = "cvdb restore journal 1";

const char* stateText(RestoreState s) {
  switch (s) {
    case RestoreState::Aside:
      return "aside";
    case RestoreState::Placing:
      return "placing";
    case RestoreState::Committed:
      return "committed";
  }
  return "?";
}

bool isContent(const sys::DirEntry& e, const std::string& keptSubfolder) {
  return e.type == sys::FileType::Regular ||
         (!keptSubfolder.empty() && e.type == sys::FileType::Folder && e.name == keptSubfolder);
}

// Undoes or finishes the restore whose working folder is work.
void recoverOne(sys::Env& env, const DB::Paths& paths, const sys::Path& work) {
  const JournalRecord record = readRestoreJournal(env, paths, work);
  const RestoreLayout at = restoreLayout(paths, work, record.key);
  RestoreJournal journal(env, work, record.key, record.state);
  if (record.state != RestoreState::Committed) {
    rollBack(env, at, journal);
    Log::Lock(Log::Notice).logStreamLine()
        << "Restore of \"" << record.key << "\" was interrupted; its previous files were put back";
  } else {
    Log::Lock(Log::Notice).logStreamLine() << "Restore of \"" << record.key
                                           << "\" had completed before the server stopped; its previous files are "
                                              "removed";
  }
  env.removeAll(work);
}

}  // namespace

RestoreLayout restoreLayout(const DB::Paths& paths, const sys::Path& work, const std::string& key) {
  RestoreLayout at;
  at.work = work;
  at.unpacked = work / "unpacked";
  at.dbFolder = paths.databaseFolder(key);
  at.logFolder = paths.logFolder(key);
  at.dbHolding = work / "db.restore";
  at.logHolding = work / "dblog.restore";
  at.separateLog = paths.logFolder(key) != paths.databaseFolder(key);
  return at;
}

RestoreJournal::RestoreJournal(sys::Env& env, sys::Path work, std::string key, std::optional<RestoreState> state)
    : env_(env), file_(std::move(work) / kRestoreJournalName), key_(std::move(key)) {
  if (state) {
    state_ = *state;
    written_ = true;
  }
}

void RestoreJournal::write(RestoreState state) {
  std::string text(kMagic);
  text += "\nkey " + key_ + "\nstate " + stateText(state) + "\n";
  env_.writeFileDurably(file_, text);
  state_ = state;
  written_ = true;
}

JournalRecord readRestoreJournal(sys::Env& env, const DB::Paths& paths, const sys::Path& work) {
  const sys::Path file = work / kRestoreJournalName;
  std::istringstream in(env.readFile(file));
  std::string magic, key, state;
  const bool read = std::getline(in, magic) && std::getline(in, key) && std::getline(in, state);
  const auto bad = [&](const std::string& why) {
    return std::runtime_error("The restore journal \"" + file.string() + "\" " + why);
  };
  if (!read || magic != kMagic || !key.starts_with("key ") || !state.starts_with("state ")) {
    throw bad("is not one this server wrote");
  }
  JournalRecord record;
  record.key = key.substr(4);
  // The key decides which folders recovery changes: it must be one a
  // client could use (nothing outside the database root).
  std::string why;
  if (!paths.acceptsName(record.key, &why) || DB::folderName(record.key) != record.key) {
    throw bad("names no valid database (\"" + record.key + "\": " + why + ")");
  }
  const std::string s = state.substr(6);
  if (s == "aside") {
    record.state = RestoreState::Aside;
  } else if (s == "placing") {
    record.state = RestoreState::Placing;
  } else if (s == "committed") {
    record.state = RestoreState::Committed;
  } else {
    throw bad("has an unknown state \"" + s + "\"");
  }
  return record;
}

void rollBack(sys::Env& env, const RestoreLayout& at, RestoreJournal& journal) {
  if (journal.state() == RestoreState::Placing) {
    // What stands in the folders is the restore's own; once it is gone the
    // journal says so, and only then do previous files move back.
    if (at.separateLog) removeContent(env, at.logFolder, "");
    removeContent(env, at.dbFolder, kDataFolderName);
    journal.write(RestoreState::Aside);
  }
  moveBack(env, at.dbHolding, at.dbFolder);
  if (at.separateLog) moveBack(env, at.logHolding, at.logFolder);
}

void moveBack(sys::Env& env, const sys::Path& holding, const sys::Path& target) {
  if (env.stat(holding).type != sys::FileType::Folder) return;
  const auto held = env.list(holding);
  if (held.empty()) return;
  for (const sys::Path& level : env.createFolders(target)) env.syncFolder(level.parent_path());
  for (const sys::DirEntry& e : held) {
    sys::Path to = target / e.name;
    if (env.stat(to).type != sys::FileType::Missing) {
      // Something else wrote that name meanwhile. The previous file comes
      // back under a name of its own rather than go with the working folder.
      for (int n = 1; env.stat(to).type != sys::FileType::Missing; ++n) {
        to = target / (e.name + ".before-restore" + (n > 1 ? "." + std::to_string(n) : ""));
      }
      Log::Lock(Log::Error).logStreamLine() << "Restore recovery: \"" << (target / e.name).string()
                                            << "\" exists; its previous version is kept as \"" << to.string() << '"';
    }
    env.rename(holding / e.name, to);
  }
  env.syncFolder(target);
}

void removeContent(sys::Env& env, const sys::Path& folder, const std::string& keptSubfolder) {
  if (env.stat(folder).type != sys::FileType::Folder) return;
  for (const sys::DirEntry& e : env.list(folder)) {
    if (isContent(e, keptSubfolder)) env.removeAll(folder / e.name);
  }
  env.syncFolder(folder);
}

std::vector<std::string> recoverRestores(sys::Env& env, const DB::Paths& paths) {
  std::vector<std::string> failed;
  const sys::Path temp = paths.root() + DB::kTempSubfolder;
  if (env.stat(temp).type != sys::FileType::Folder) return failed;
  for (const sys::DirEntry& e : env.list(temp)) {
    const sys::Path work = temp / e.name;
    try {
      if (e.type == sys::FileType::Folder && env.stat(work / kRestoreJournalName).type == sys::FileType::Regular) {
        recoverOne(env, paths, work);
      } else {
        // A backup's or an unjournaled restore's leftovers: no database
        // file was touched yet.
        env.removeAll(work);
      }
    } catch (const std::exception& ex) {
      std::string key;
      try {
        key = readRestoreJournal(env, paths, work).key;
      } catch (const std::exception&) {
        // Unreadable: nobody can tell which database it concerns.
      }
      Log::Lock(Log::Error).logStreamLine()
          << "Critical: recovery of the interrupted restore in \"" << work.string() << "\" failed: " << ex.what()
          << (key.empty() ? "" : "; database \"" + key + "\" stays closed");
      if (!key.empty()) failed.push_back(key);
    }
  }
  return failed;
}

}  // namespace maint
