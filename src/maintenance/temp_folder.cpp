#include "maintenance/temp_folder.h"

#include <exception>
#include <utility>

#include "framework/log.h"

namespace maint {

TempFolder::TempFolder(sys::Env& env, sys::Path path) noexcept : env_(env), path_(std::move(path)) {}

TempFolder::TempFolder(TempFolder&& other) noexcept : env_(other.env_), path_(std::exchange(other.path_, {})) {}

TempFolder::~TempFolder() { cleanUp(); }

void TempFolder::cleanUp() noexcept {
  if (path_.empty()) return;
  try {
    env_.removeAll(path_);
  } catch (const std::exception&) {
    try {
      Log::Lock(Log::Error).logStreamLine() << "Failed to clean up file(s) at \"" << path_.string() << '"';
    } catch (...) {
    }
  }
  path_.clear();
}

}  // namespace maint
