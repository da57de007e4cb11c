#pragma once
// maint::engineStatus: the engine's backup and restore notifications as the
// texts a maintenance command shows its client: "Metadata <op> started...",
// "Metadata <op>: N% completed (done/total)" in pages, "Metadata <op>
// finished", with <op> "backup" or "restore".
//
// The callback borrows progress, which must outlive it.

#include "engine/progress.h"

namespace maint {

engine::StatusCallback engineStatus(DB::DBProgressCallback& progress);

}  // namespace maint
