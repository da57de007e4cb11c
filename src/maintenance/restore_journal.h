#pragma once
// maint::RestoreJournal: the durable record of how far a restore has come,
// so that a restore cut short by a crash or a power loss is undone, or
// finished, when the server starts again.
//
// The journal is the file "restore.journal" in the restore's working folder
// (one level below "db.temp/"; the archive is unpacked into a subfolder of
// it, so no archive entry can stand in for the journal). Its text:
//   "cvdb restore journal 1\n" "key <database key>\n" "state <state>\n"
// Each state is written whole (new file, sync, rename, folder sync) before
// the step it announces begins:
//   aside      the live files are about to move into the holding folders;
//              whatever is still in the database and log folders is
//              previous content.
//   placing    every previous file is in a holding folder, on disk; what
//              stands in the database and log folders now is new.
//   committed  the restored files are on disk; the holding folders only
//              wait to be removed.
//
// recoverRestores() runs at the server's start, before any database is
// opened. For every working folder below "db.temp/" with a journal:
// placing -> the new content of the database and log folders is removed
// and the journal goes back to aside; aside -> the held files move back;
// committed -> nothing to undo. Then the working folder is removed, and the
// log says what was done. Working folders without a journal are leftovers
// of operations that had not touched a database yet and are removed. Each
// step can be repeated, so a crash during recovery is recovered from too.
//
// Ownership: the Env outlives the journal; the journal owns a path.
// Thread safety: one thread at a time.
// Failures: std::system_error from the Env when a state cannot be written;
// std::runtime_error from readRestoreJournal for a journal that cannot be
// understood.

#include <optional>
#include <string>
#include <vector>

#include "framework/env.h"
#include "settings/paths.h"

namespace maint {

enum class RestoreState { Aside, Placing, Committed };

// Where the files of a restore of key are, with working folder work.
struct RestoreLayout {
  sys::Path work;            // the working folder
  sys::Path unpacked;        // work + "unpacked/": the archive's entries
  sys::Path dbFolder;        // the database folder
  sys::Path logFolder;       // the log folder
  sys::Path dbHolding;       // work + "db.restore/": previous files of dbFolder
  sys::Path logHolding;      // work + "dblog.restore/": previous files of logFolder
  bool separateLog = false;  // the log folder is not the database folder
};
RestoreLayout restoreLayout(const DB::Paths& paths, const sys::Path& work, const std::string& key);

inline constexpr const char* kRestoreJournalName = "restore.journal";
// The subfolder of a database folder that is content besides its files.
inline constexpr const char* kDataFolderName = "d";

class RestoreJournal {
 public:
  // state: the state on disk, for a journal read back; none for a new one.
  RestoreJournal(sys::Env& env, sys::Path work, std::string key, std::optional<RestoreState> state = std::nullopt);
  // Writes the state durably (see above).
  void write(RestoreState state);
  RestoreState state() const noexcept { return state_; }
  // Whether a state has been written.
  bool written() const noexcept { return written_; }

 private:
  sys::Env& env_;
  sys::Path file_;
  std::string key_;
  RestoreState state_ = RestoreState::Aside;
  bool written_ = false;
};

struct JournalRecord {
  std::string key;
  RestoreState state;
};
// The journal of a working folder. Throws std::runtime_error when it is
// not one this server wrote.
JournalRecord readRestoreJournal(sys::Env& env, const DB::Paths& paths, const sys::Path& work);

// Undoes a restore that has not committed, as far as the journal says it
// came: in state placing the new content of the folders is removed and the
// journal set to aside; then every held file moves back. Throws the first
// failure (the journal then still tells the next attempt where to go on).
void rollBack(sys::Env& env, const RestoreLayout& at, RestoreJournal& journal);

// Moves every held entry of holding back into target (created when
// missing), then syncs target. An entry whose name something else has taken
// in target meanwhile comes back as "<name>.before-restore" (".2", ".3", ...
// after that when taken too), logged, so nothing held is lost with the
// working folder.
void moveBack(sys::Env& env, const sys::Path& holding, const sys::Path& target);

// Removes what counts as content of a database folder (regular files and
// the data folder) or, with keptSubfolder empty, of a log folder (regular
// files), then syncs the folder. A missing folder has none.
void removeContent(sys::Env& env, const sys::Path& folder, const std::string& keptSubfolder);

// Recovers every interrupted restore (above). Returns the keys of the
// databases whose recovery failed: they must not be opened (their journal
// stays for the next start).
std::vector<std::string> recoverRestores(sys::Env& env, const DB::Paths& paths);

}  // namespace maint
