#pragma once
// The real server as a child process, for end-to-end tests.
//
//   testing_support::ServerProcess server(CVDB_SERVER_PATH);  // waits until it listens
//   cvdb::Client c({.port = server.port()});
//   ...
//   EXPECT_TRUE(server.waitForLogLine("Dispatching command GetData failed"));
//
// The server runs with a temporary home (its database root is home/db/,
// where config.json is written), a log folder of its own and --console; a
// thread collects every line it writes to standard output and error. The
// destructor stops it with SIGTERM and records a test failure unless it
// exits with status 0 (use stop() to check the status yourself).

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "framework/thread_annotations.h"
#include "support/temp_dir.h"

namespace testing_support {

struct ServerOptions {
  // Written to home/db/config.json unless empty.
  std::string configJson = R"({"ServerPort": 0})";
  // Arguments after the standard ones (--home, --log-dir, --console).
  std::vector<std::string> extraArgs;
  // "NAME=value" entries added to the environment.
  std::vector<std::string> env;
  // Wait for "Listening on port N" before the constructor returns.
  bool waitUntilListening = true;
  std::chrono::milliseconds startTimeout{20000};
};

class ServerProcess {
 public:
  // Starts the binary; throws std::runtime_error when it cannot be started
  // or does not listen in time (with the lines it wrote).
  explicit ServerProcess(std::filesystem::path binary, ServerOptions options = {});
  ~ServerProcess();
  ServerProcess(const ServerProcess&) = delete;
  ServerProcess& operator=(const ServerProcess&) = delete;

  std::uint16_t port() const noexcept { return port_; }
  const std::filesystem::path& home() const noexcept { return home_; }
  const std::filesystem::path& logDir() const noexcept { return logDir_; }

  // Waits until a line containing the fragment has been written (also one
  // written before the call). False on timeout.
  bool waitForLogLine(const std::string& fragment, std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // Lines containing the fragment so far.
  std::size_t countLogLines(const std::string& fragment) const;
  std::vector<std::string> lines() const;

  // Sends the signal and waits for the process. Returns the exit status, or
  // 128 + the signal number when a signal ended it; -1 on timeout (the
  // process is then killed).
  int stop(int signal = 15, std::chrono::milliseconds timeout = std::chrono::seconds(20));
  // Waits for the process to end by itself; same result as stop().
  int wait(std::chrono::milliseconds timeout = std::chrono::seconds(20));

  // Runs the binary with the arguments to completion; its exit status and
  // every line it wrote, each ending in "\n".
  struct Result {
    int status = -1;
    std::string output;
  };
  static Result run(const std::filesystem::path& binary, const std::vector<std::string>& args,
                    std::chrono::milliseconds timeout = std::chrono::seconds(20));

 private:
  struct Bare {};
  // Nothing started yet; run() starts the binary with its own arguments.
  explicit ServerProcess(Bare) : home_(dir_ / "home"), logDir_(dir_ / "log") {}
  void start(const std::filesystem::path& binary, const std::vector<std::string>& args,
             const std::vector<std::string>& env);
  void readOutput(int fd);
  void throwStartFailure(const std::string& why) EXCLUDES(mutex_);

  TempDir dir_;
  std::filesystem::path home_;
  std::filesystem::path logDir_;
  pid_t pid_ = -1;
  std::uint16_t port_ = 0;
  std::optional<int> status_;
  std::thread reader_;

  mutable sys::Mutex mutex_;
  std::condition_variable changed_;  // with mutex_: a line came, or the output ended
  std::vector<std::string> lines_ GUARDED_BY(mutex_);
  bool outputEnded_ GUARDED_BY(mutex_) = false;
};

}  // namespace testing_support
