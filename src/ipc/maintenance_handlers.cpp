// Handlers of the maintenance commands (backup, restore, cleanup). They
// answer with a progress stream: the start text at once, then whatever the
// operation reports from a thread of its own, and the stream's end.

#include <chrono>
#include <memory>
#include <stdexcept>

#include "framework/log.h"
#include "ipc/listener.h"

namespace Ipc::DB {
namespace {

constexpr const char* kFailurePrefix = "DB operation failed with error: ";
constexpr const char* kTerminating = "Terminating client connection due to processing error";

// Forwards what an operation reports to its command's client. The
// maintenance thread holds the command for as long as this exists.
class ProgressCB final : public ::DB::DBProgressCallback {
 public:
  explicit ProgressCB(ProgressCmdsBase& cmd) : cmd_(&cmd) {}
  void onProgress(std::uint32_t percent, const std::string& text) override { cmd_->sendMoreProgress(percent, text); }

 private:
  ProgressCmdsBase* cmd_;
};

// Ends the stream however the thread's body is left.
class EndOfStream {
 public:
  explicit EndOfStream(ProgressCmdsBase& cmd) : cmd_(cmd) {}
  ~EndOfStream() {
    try {
      cmd_.sendNoMoreProgress();
    } catch (...) {
      // The client is gone; nothing is left to tell.
    }
  }
  EndOfStream(const EndOfStream&) = delete;
  EndOfStream& operator=(const EndOfStream&) = delete;

 private:
  ProgressCmdsBase& cmd_;
};

// The end of a failed operation: its one failure message at 100, the end
// of the stream, then the end of the connection (sends after the Bye would
// be dropped, so the stream ends first), with no request behind the
// command taken in between.
void reportFailure(ProgressCmdsBase& cmd, const std::string& what) noexcept {
  try {
    Log::Lock(Log::Error).logStreamLine() << "Async command " << cmd.name() << " failed with " << what;
    cmd.sendMoreProgress(100, kFailurePrefix + what);
    cmd.endStreamAndConnection(kTerminating);
  } catch (...) {
    // Out of memory for the messages: the connection ends with its socket.
  }
}

}  // namespace

void Listener::runAsync(ProgressCmdsBase& cmd, const std::string& startText, MaintenanceWork work) {
  cmd.firstProgressMsg(startText);
  auto self = std::static_pointer_cast<ProgressCmdsBase>(cmd.shared_from_this());
  try {
    maintenance_.start([self, stats = stats_, work = std::move(work)](std::stop_token stop) {
      // Counted before the stream ends, so that a client that saw the end
      // finds its operation on the metrics page.
      const auto started = std::chrono::steady_clock::now();
      const auto count = [&](bool succeeded) {
        stats->recordOperation(self->tag(), self->name(), std::chrono::steady_clock::now() - started, succeeded);
      };
      EndOfStream end(*self);
      try {
        ::DB::DBLocal& db = dbOfConn(*self);
        work(db, std::make_unique<ProgressCB>(*self), std::move(stop));
        count(true);
      } catch (const std::exception& e) {
        count(false);
        reportFailure(*self, e.what());
      }
    });
  } catch (const std::exception& e) {
    // No thread for it (the server is stopping, or threads ran out).
    reportFailure(cmd, e.what());
  }
}

void Listener::stopMaintenance() { maintenance_.stopAll(); }

void Listener::process(Backup& cmd) {
  runAsync(cmd, "Starting Database Backup...",
           [target = cmd.pth(), all = cmd.all()](::DB::DBLocal& db, std::unique_ptr<::DB::DBProgressCallback> callback,
                                                 std::stop_token stop) {
             db.backup(target, all, std::move(callback), std::move(stop));
           });
}

void Listener::process(Restore& cmd) {
  runAsync(cmd, "Starting Database Restore...",
           [target = cmd.pth(), all = cmd.all()](::DB::DBLocal& db, std::unique_ptr<::DB::DBProgressCallback> callback,
                                                 std::stop_token stop) {
             db.restore(target, all, std::move(callback), std::move(stop));
           });
}

void Listener::process(Cleanup& cmd) {
  runAsync(
      cmd, "Starting Database Cleanup...",
      [usedIds = cmd.usedIds()](::DB::DBLocal& db, std::unique_ptr<::DB::DBProgressCallback> callback,
                                std::stop_token stop) { db.cleanUp(usedIds, std::move(callback), std::move(stop)); });
}

}  // namespace Ipc::DB
