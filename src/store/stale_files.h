#pragma once
// DB::removeStaleTempFiles: the temporary files of data-file writes that a
// crash interrupted.
//
// A data file is written as a temporary file (DBLocal::kTempPrefix) in its
// id's folder and renamed over the real name; a crash before the rename
// leaves the temporary file behind for good. At the start the server walks
// the data folders of every database and removes the temporary files that
// an earlier process left: those without this process's own prefix
// (processTempPrefix) that were last written before it started. The prefix
// tells this process's running writes apart however soon after a crash
// the start comes; the time leaves alone a file that another process
// wrote after the start.
//
// Thread safety: any thread; runs beside the clients (they never read a
// temporary file, and their own are younger than `before`).
// Logs one line at its end: how many files it removed, or that there were
// none (not when a stop ended it early).
// Failures: none escape; a folder or file that cannot be listed or removed
// is skipped (logged when verbose). Ends early when stop is requested.

#include <cstdint>
#include <stop_token>
#include <string>

#include "framework/env.h"
#include "settings/paths.h"

namespace DB {

// The prefix of the temporary files of this process's data-file writes:
// DBLocal::kTempPrefix followed by a tag drawn at random once per process
// and a dot.
const std::string& processTempPrefix();

struct StaleFilesReport {
  std::uint64_t removed = 0;
  std::uint64_t bytes = 0;
};

StaleFilesReport removeStaleTempFiles(sys::Env& env, const Paths& paths, sys::WallClock::time_point before,
                                      std::stop_token stop = {});

}  // namespace DB
