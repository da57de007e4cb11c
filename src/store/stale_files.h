#pragma once
// DB::removeStaleTempFiles: the temporary files of data-file writes that a
// crash interrupted.
//
// A data file is written as a temporary file (DBLocal::kTempPrefix) in its
// id's folder and renamed over the real name; a crash before the rename
// leaves the temporary file behind for good. At the start the server walks
// the data folders of every database and removes the temporary files last
// written before it started: a write of this process began after that, so
// no running write owns such a file.
//
// Thread safety: any thread; runs beside the clients (they never read a
// temporary file, and their own are younger than `before`).
// Failures: none escape; a folder or file that cannot be listed or removed
// is skipped (logged when verbose). Ends early when stop is requested.

#include <cstdint>
#include <stop_token>

#include "framework/env.h"
#include "settings/paths.h"

namespace DB {

struct StaleFilesReport {
  std::uint64_t removed = 0;
  std::uint64_t bytes = 0;
};

StaleFilesReport removeStaleTempFiles(sys::Env& env, const Paths& paths, sys::WallClock::time_point before,
                                      std::stop_token stop = {});

}  // namespace DB
