#pragma once
// maint::TempFolder: owns the path of a working folder (or of one file) and
// removes it, with everything below it, when it goes.
//
// Ownership: the object owns the path, not an open handle; the Env outlives
// it. dismiss() gives the path up, so nothing is removed (a finished archive
// that must stay). Moving hands the duty on; the moved-from object removes
// nothing.
// Thread safety: one thread at a time.
// Failures: the destructor never throws. A removal that fails is logged at
// priority 3 as "Failed to clean up file(s) at \"<path>\"" and otherwise
// ignored; links below the path are removed, never followed.

#include <string>

#include "framework/env.h"

namespace maint {

class TempFolder {
 public:
  // An empty path owns nothing.
  TempFolder(sys::Env& env, sys::Path path) noexcept;
  ~TempFolder();
  TempFolder(TempFolder&& other) noexcept;
  TempFolder& operator=(TempFolder&&) = delete;
  TempFolder(const TempFolder&) = delete;
  TempFolder& operator=(const TempFolder&) = delete;

  const sys::Path& path() const noexcept { return path_; }
  // Keeps the path: nothing is removed later.
  void dismiss() noexcept { path_.clear(); }
  // Removes the path now (logging a failure as the destructor does) and owns
  // nothing afterwards.
  void cleanUp() noexcept;

 private:
  sys::Env& env_;
  sys::Path path_;
};

}  // namespace maint
