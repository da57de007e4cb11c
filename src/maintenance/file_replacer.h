#pragma once
// maint::FileReplacer: sets the current content of a folder aside while an
// operation puts new content there, and puts the old content back unless the
// operation commits.
//
// Content of the target folder, for moving aside and for deleting during a
// rollback alike: every regular file directly in it, and, when keptSubfolder
// is not empty, the one subfolder of that name (moved and removed as a
// whole). Other subfolders, links and special files are never touched.
//
// Construction moves the content, in listing order, into the holding folder
// (created with its missing parents; both folders must be on one file
// system). A target that does not exist is not an error: nothing is moved
// and no holding folder is made. If construction fails part way (a rename, a
// listing, the holding folder), what was already moved goes back before the
// error reaches the caller.
//
// States: armed (after construction) -> committed (commit()) -> released.
// Destroying an armed replacer rolls back: the new content standing in the
// target is removed (the target is re-created if it vanished and something
// is to come back), then every moved entry is renamed back in move order.
// Destroying a committed one touches nothing; what was set aside stays in
// the holding folder for the caller to remove with its working folder.
//
// Ownership: the Env outlives the replacer; the replacer owns only paths.
// Thread safety: one thread at a time; nothing else may change the target
// folder while a replacer is armed.
// Failures: the constructor throws the Env's std::system_error after its
// partial rollback. The rollback never throws: its first failure stops it
// (entries not yet moved back stay in the holding folder) and is logged at
// priority 3 as "Critical: Failed to restore original file(s) at \"<target>\"!
// Database may be left in unpredictable state."

#include <string>
#include <vector>

#include "framework/env.h"

namespace maint {

class FileReplacer {
 public:
  FileReplacer(sys::Env& env, sys::Path targetFolder, const sys::Path& holdingFolder, std::string keptSubfolder);
  ~FileReplacer();
  FileReplacer(const FileReplacer&) = delete;
  FileReplacer& operator=(const FileReplacer&) = delete;

  // The new content stays; destruction no longer rolls back.
  void commit() noexcept { target_.clear(); }
  bool committed() const noexcept { return target_.empty(); }
  // Paths inside the holding folder of what was set aside, in move order.
  const std::vector<sys::Path>& moved() const noexcept { return moved_; }

 private:
  bool isContent(const sys::DirEntry& entry) const;
  // removeNewContent: the target's current content is the failed
  // operation's and goes before the moved entries come back.
  void rollback(bool removeNewContent) noexcept;

  sys::Env& env_;
  std::vector<sys::Path> moved_;
  sys::Path target_;  // empty once committed
  std::string kept_;
};

}  // namespace maint
