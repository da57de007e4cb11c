#pragma once
// Progress reporting shared by the engine, the maintenance operations and
// the commands that forward progress to a client.
//
// - DB::DBProgressCallback: what a long operation reports to (percent 0 to
//   100 and a text). An operation receives it as an owning pointer and
//   destroys it when it ends; the maintenance wait only borrows it.
// - The thread's progress slot: one pointer per thread, null at first, that
//   never owns the callback. Backup and restore set it around the engine's
//   calls so that a status handler without context can find the callback of
//   the operation running on its thread.
// - engine::StatusNotification / StatusCallback: what the engine's online
//   backup and restore report while they copy (begin, progress in pages,
//   complete). The callback runs on the thread that called the engine; an
//   exception thrown from it aborts the copy and passes to that caller.

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

namespace DB {

class DBProgressCallback {
 public:
  virtual void onProgress(std::uint32_t percent, const std::string& text) = 0;
  virtual ~DBProgressCallback() = default;
};

// The calling thread's slot. Set it with a callback that outlives the
// setting; clear it with nullptr.
DBProgressCallback* threadProgress() noexcept;
void setThreadProgress(DBProgressCallback* callback) noexcept;

}  // namespace DB

namespace engine {

enum class SnapshotOperation : int { Restore = 8, Backup = 9 };
enum class StatusKind : int { Progress = 0, Begin = 5, Complete = 6 };

struct StatusNotification {
  SnapshotOperation operation;
  StatusKind kind;
  // Only with kind Progress: pages copied and pages in all.
  std::optional<std::uint32_t> done;
  std::optional<std::uint32_t> total;
};

using StatusCallback = std::function<void(const StatusNotification&)>;

}  // namespace engine
