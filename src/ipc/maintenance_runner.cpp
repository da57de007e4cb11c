#include "ipc/maintenance_runner.h"

#include <stdexcept>

#include "framework/log.h"

namespace Ipc::DB {
namespace {

// The last owner of the runner may go on one of its own threads (a
// command that outlived the server): that thread is not joined by itself.
template <typename Job>
void detachSelf(std::list<Job>& jobs) noexcept {
  for (Job& j : jobs) {
    if (j.thread.get_id() == std::this_thread::get_id()) j.thread.detach();
  }
}

}  // namespace

MaintenanceRunner::~MaintenanceRunner() { stopAll(); }

void MaintenanceRunner::start(Work work) {
  std::lock_guard lock(state_->mutex);
  if (stopping_) throw std::runtime_error("Server is stopping");
  // Threads that have ended are joined here, so the list stays short.
  detachSelf(jobs_);
  jobs_.remove_if([](const Job& j) { return *j.done; });
  Job& job = jobs_.emplace_back();
  try {
    job.thread = std::jthread([state = state_, done = job.done, work = std::move(work)](std::stop_token stop) {
      try {
        work(stop);
      } catch (...) {
        // The work reports its own failures; nothing may escape a thread.
      }
      std::lock_guard ended(state->mutex);
      *done = true;
      state->finished.notify_all();
    });
  } catch (...) {
    jobs_.pop_back();
    throw;
  }
}

bool MaintenanceRunner::stopAll(std::chrono::milliseconds limit) {
  std::unique_lock lock(state_->mutex);
  stopping_ = true;
  for (Job& j : jobs_) j.thread.request_stop();
  const bool allEnded = state_->finished.wait_for(lock, limit, [this] {
    for (const Job& j : jobs_) {
      if (!*j.done) return false;
    }
    return true;
  });
  std::list<Job> ended;
  for (auto it = jobs_.begin(); it != jobs_.end();) {
    if (*it->done) {
      ended.splice(ended.end(), jobs_, it++);
    } else {
      // Left to end by itself; what it uses, it holds.
      it->thread.detach();
      it = jobs_.erase(it);
    }
  }
  lock.unlock();
  detachSelf(ended);
  if (!allEnded) {
    Log::Lock(Log::Warning).logStreamLine()
        << "Maintenance operations still running after " << limit.count() << " ms are left to end by themselves";
  }
  return allEnded;  // ended threads are joined as the list goes
}

std::size_t MaintenanceRunner::running() const {
  std::lock_guard lock(state_->mutex);
  std::size_t n = 0;
  for (const Job& j : jobs_) n += *j.done ? 0 : 1;
  return n;
}

}  // namespace Ipc::DB
