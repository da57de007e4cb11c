#include "maintenance/file_replacer.h"

#include <exception>
#include <utility>

#include "framework/log.h"

namespace maint {

FileReplacer::FileReplacer(sys::Env& env, sys::Path targetFolder, const sys::Path& holdingFolder,
                           std::string keptSubfolder)
    : env_(env), target_(std::move(targetFolder)), kept_(std::move(keptSubfolder)) {
  try {
    if (env_.stat(target_, true).type == sys::FileType::Missing) return;
    env_.createFolders(holdingFolder);
    for (const sys::DirEntry& entry : env_.list(target_)) {
      if (!isContent(entry)) continue;
      sys::Path aside = holdingFolder / entry.name;
      env_.rename(target_ / entry.name, aside);
      moved_.push_back(std::move(aside));
    }
  } catch (...) {
    // Put back what was moved so far; the caller sees the original error.
    // What still stands in the target is original content that was not
    // reached yet, so nothing is removed there.
    rollback(false);
    target_.clear();
    throw;
  }
}

FileReplacer::~FileReplacer() {
  if (!target_.empty()) rollback(true);
}

bool FileReplacer::isContent(const sys::DirEntry& entry) const {
  if (entry.type == sys::FileType::Regular) return true;
  return !kept_.empty() && entry.type == sys::FileType::Folder && sys::Path(entry.name) == sys::Path(kept_);
}

void FileReplacer::rollback(bool removeNewContent) noexcept {
  try {
    if (env_.stat(target_, true).type == sys::FileType::Missing) {
      if (!moved_.empty()) env_.createFolders(target_);
    } else if (removeNewContent) {
      // Whatever content stands in the target now was put there by the
      // operation that failed.
      for (const sys::DirEntry& entry : env_.list(target_)) {
        if (isContent(entry)) env_.removeAll(target_ / entry.name);
      }
    }
    for (const sys::Path& aside : moved_) env_.rename(aside, target_ / aside.filename());
  } catch (const std::exception&) {
    try {
      Log::Lock(Log::Error).logStreamLine() << "Critical: Failed to restore original file(s) at \"" << target_.string()
                                            << "\"! Database may be left in unpredictable state.";
    } catch (...) {
    }
  }
  moved_.clear();
}

}  // namespace maint
