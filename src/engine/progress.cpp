#include "engine/progress.h"

namespace DB {
namespace {

thread_local DBProgressCallback* t_progress = nullptr;

}  // namespace

DBProgressCallback* threadProgress() noexcept { return t_progress; }

void setThreadProgress(DBProgressCallback* callback) noexcept { t_progress = callback; }

}  // namespace DB
