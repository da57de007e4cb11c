#include "maintenance/engine_status.h"

#include <string>

namespace maint {

engine::StatusCallback engineStatus(DB::DBProgressCallback& progress) {
  return [&progress](const engine::StatusNotification& n) {
    const std::string word = n.operation == engine::SnapshotOperation::Backup ? "backup" : "restore";
    switch (n.kind) {
      case engine::StatusKind::Begin:
        progress.onProgress(0, "Metadata " + word + " started...");
        break;
      case engine::StatusKind::Complete:
        progress.onProgress(100, "Metadata " + word + " finished");
        break;
      case engine::StatusKind::Progress:
        if (n.done && n.total) {
          const std::uint32_t percent =
              *n.done < *n.total ? static_cast<std::uint32_t>(std::uint64_t{*n.done} * 100 / *n.total) : 100;
          progress.onProgress(percent, "Metadata " + word + ": " + std::to_string(percent) + "% completed (" +
                                           std::to_string(*n.done) + "/" + std::to_string(*n.total) + ")");
        } else {
          progress.onProgress(0, "Metadata " + word + " in progress...");
        }
        break;
    }
  };
}

}  // namespace maint
