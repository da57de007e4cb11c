#pragma once
// Ipc::DB::MaintenanceRunner: the threads of the maintenance commands that
// are running (backup, restore, cleanup).
//
// Each operation runs on a thread of its own with a stop token. The
// service's stop asks every running operation to stop at its next safe
// point and waits for them (bounded), before the engine pool is torn down,
// so no operation works on a stopped pool. An operation whose client has
// gone runs to its end (or its failure) all the same and releases its hold.
//
// Ownership: owned by the Listener. A thread holds whatever its work
// function holds (its command, and through it the connection's store); a
// thread still running after the bounded wait is left to end by itself and
// keeps those alive.
// Thread safety: every member may be called from any thread.
// Failures: start() throws std::runtime_error "Server is stopping" once
// stopAll() has begun, and std::system_error when no thread can be made;
// nothing else throws.

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <stop_token>
#include <thread>

namespace Ipc::DB {

class MaintenanceRunner {
 public:
  MaintenanceRunner() = default;
  // Stops and waits as stopAll does, for at most kStopWait.
  ~MaintenanceRunner();
  MaintenanceRunner(const MaintenanceRunner&) = delete;
  MaintenanceRunner& operator=(const MaintenanceRunner&) = delete;

  static constexpr std::chrono::milliseconds kStopWait{20000};

  using Work = std::function<void(std::stop_token)>;
  void start(Work work);

  // Asks every running operation to stop and waits up to limit for all of
  // them. True when none is left running. Later starts are refused.
  bool stopAll(std::chrono::milliseconds limit = kStopWait);

  std::size_t running() const;

 private:
  // Shared with the threads, which may outlive the runner.
  struct State {
    std::mutex mutex;
    std::condition_variable finished;
  };
  struct Job {
    std::jthread thread;
    std::shared_ptr<bool> done = std::make_shared<bool>(false);  // guarded by state_->mutex
  };

  const std::shared_ptr<State> state_ = std::make_shared<State>();
  std::list<Job> jobs_;    // guarded by state_->mutex
  bool stopping_ = false;  // guarded by state_->mutex
};

}  // namespace Ipc::DB
