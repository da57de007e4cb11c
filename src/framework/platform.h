#pragma once
// Platform folders: where the server keeps its databases and its logs.
//
// Defaults on Linux:
//   system configuration folder  /var/lib/corvina  (root)
//                                $HOME/.local/share/corvina  (other users)
//   log folder                   /var/log/corvina  (root)
//                                $HOME/.local/state/corvina/log  (other users)
// The service host sets both from --home and --log-dir before anything else
// runs; tests do the same to keep everything in a temporary folder.
//
// Thread safety: every member may be called from any thread.

#include <filesystem>

#include "framework/thread_annotations.h"

class Platform {
 public:
  static Platform& inst();

  std::filesystem::path logDir() const EXCLUDES(mutex_);
  // Later log entries go to the new folder (created on the first entry).
  void changeLogDir(const std::filesystem::path& dir) EXCLUDES(mutex_);

  std::filesystem::path corvinaSystemConfigDir() const EXCLUDES(mutex_);
  void changeSystemConfigDir(const std::filesystem::path& dir) EXCLUDES(mutex_);

 private:
  Platform();

  mutable sys::Mutex mutex_;
  std::filesystem::path logDir_ GUARDED_BY(mutex_);
  std::filesystem::path configDir_ GUARDED_BY(mutex_);
};
