#include "support/server_process.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <regex>
#include <stdexcept>

extern char** environ;

namespace testing_support {
namespace {

struct Pipe {
  int read = -1;
  int write = -1;
  Pipe() {
    int fds[2];
    if (::pipe2(fds, O_CLOEXEC) != 0) throw std::runtime_error(std::string("pipe: ") + std::strerror(errno));
    read = fds[0];
    write = fds[1];
  }
  ~Pipe() {
    if (read >= 0) ::close(read);
    if (write >= 0) ::close(write);
  }
};

// Starts the binary with standard output and error going to out.
pid_t spawn(const std::filesystem::path& binary, const std::vector<std::string>& args,
            const std::vector<std::string>& extraEnv, int out) {
  std::vector<std::string> argStore{binary.string()};
  argStore.insert(argStore.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (auto& a : argStore) argv.push_back(a.data());
  argv.push_back(nullptr);

  std::vector<std::string> envStore;
  for (char** e = environ; *e; ++e) envStore.emplace_back(*e);
  envStore.insert(envStore.end(), extraEnv.begin(), extraEnv.end());
  std::vector<char*> envp;
  for (auto& e : envStore) envp.push_back(e.data());
  envp.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, out, 1);
  posix_spawn_file_actions_adddup2(&actions, out, 2);
  posix_spawnattr_t attr;
  posix_spawnattr_init(&attr);
  // The child starts with default signal handling and nothing blocked,
  // whatever the test process does.
  sigset_t none;
  sigemptyset(&none);
  sigset_t all;
  sigfillset(&all);
  posix_spawnattr_setsigmask(&attr, &none);
  posix_spawnattr_setsigdefault(&attr, &all);
  posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  pid_t pid = -1;
  const int rc = ::posix_spawn(&pid, argv[0], &actions, &attr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attr);
  if (rc != 0) throw std::runtime_error("cannot start " + binary.string() + ": " + std::strerror(rc));
  return pid;
}

int decode(int status) {
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return -1;
}

// Waits for the child up to the deadline; nothing on timeout.
std::optional<int> waitFor(pid_t pid, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  // A process descriptor becomes readable when the child ends.
  const int pidfd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
  for (;;) {
    int status = 0;
    const pid_t r = ::waitpid(pid, &status, WNOHANG);
    if (r == pid) {
      if (pidfd >= 0) ::close(pidfd);
      return decode(status);
    }
    if (r < 0 && errno != EINTR) {
      if (pidfd >= 0) ::close(pidfd);
      return -1;
    }
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()).count();
    if (left <= 0) {
      if (pidfd >= 0) ::close(pidfd);
      return std::nullopt;
    }
    if (pidfd >= 0) {
      pollfd p{pidfd, POLLIN, 0};
      ::poll(&p, 1, static_cast<int>(left));
    } else {
      // Kernels without process descriptors: look again shortly.
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
  }
}

}  // namespace

ServerProcess::ServerProcess(std::filesystem::path binary, ServerOptions options)
    : home_(dir_ / "home"), logDir_(dir_ / "log") {
  std::filesystem::create_directories(home_ / "db");
  if (!options.configJson.empty()) writeFile(home_ / "db" / "config.json", options.configJson);
  std::vector<std::string> args{"--home", home_.string(), "--log-dir", logDir_.string(), "--console"};
  args.insert(args.end(), options.extraArgs.begin(), options.extraArgs.end());

  start(binary, args, options.env);
  if (!options.waitUntilListening) return;
  static const std::regex listening("Listening on port ([0-9]+)");
  sys::MutexLock lock(mutex_);
  std::smatch m;
  const bool found = changed_.wait_for(lock.native(), options.startTimeout, [&]() REQUIRES(mutex_) {
    for (const auto& line : lines_) {
      if (std::regex_search(line, m, listening)) return true;
    }
    return outputEnded_;
  });
  if (found && !m.empty()) {
    port_ = static_cast<std::uint16_t>(std::stoi(m[1].str()));
    return;
  }
  lock.unlock();
  throwStartFailure(found ? "the server ended before it listened" : "the server did not listen in time");
}

void ServerProcess::start(const std::filesystem::path& binary, const std::vector<std::string>& args,
                          const std::vector<std::string>& env) {
  Pipe out;
  pid_ = spawn(binary, args, env, out.write);
  ::close(out.write);
  out.write = -1;
  const int readFd = out.read;
  out.read = -1;
  reader_ = std::thread([this, readFd] { readOutput(readFd); });
}

void ServerProcess::throwStartFailure(const std::string& why) {
  stop(SIGKILL);
  if (reader_.joinable()) reader_.join();  // a joinable thread left to a throwing constructor ends the process
  std::string text = why + "; its output:\n";
  for (const auto& l : lines()) text += l + "\n";
  throw std::runtime_error(text);
}

ServerProcess::~ServerProcess() {
  if (!status_ && pid_ > 0) {  // never a signal to pid -1: that is every process we may signal
    const int status = stop();
    EXPECT_EQ(status, 0) << "the server did not stop cleanly";
  }
  if (reader_.joinable()) reader_.join();
}

void ServerProcess::readOutput(int fd) {
  std::string pending;
  char buf[4096];
  for (;;) {
    const ssize_t n = ::read(fd, buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    pending.append(buf, static_cast<std::size_t>(n));
    std::size_t nl;
    while ((nl = pending.find('\n')) != std::string::npos) {
      sys::MutexLock lock(mutex_);
      lines_.push_back(pending.substr(0, nl));
      pending.erase(0, nl + 1);
      changed_.notify_all();
    }
  }
  ::close(fd);
  sys::MutexLock lock(mutex_);
  if (!pending.empty()) lines_.push_back(pending);
  outputEnded_ = true;
  changed_.notify_all();
}

bool ServerProcess::waitForLogLine(const std::string& fragment, std::chrono::milliseconds timeout) {
  sys::MutexLock lock(mutex_);
  return changed_.wait_for(lock.native(), timeout, [&]() REQUIRES(mutex_) {
    for (const auto& line : lines_) {
      if (line.find(fragment) != std::string::npos) return true;
    }
    return false;
  });
}

std::size_t ServerProcess::countLogLines(const std::string& fragment) const {
  sys::MutexLock lock(mutex_);
  std::size_t n = 0;
  for (const auto& line : lines_) n += line.find(fragment) != std::string::npos;
  return n;
}

std::vector<std::string> ServerProcess::lines() const {
  sys::MutexLock lock(mutex_);
  return lines_;
}

int ServerProcess::stop(int signal, std::chrono::milliseconds timeout) {
  if (status_) return *status_;
  ::kill(pid_, signal);
  return wait(timeout);
}

int ServerProcess::wait(std::chrono::milliseconds timeout) {
  if (status_) return *status_;
  auto status = waitFor(pid_, timeout);
  if (!status) {
    ::kill(pid_, SIGKILL);
    waitFor(pid_, std::chrono::seconds(10));
    status = -1;
  }
  status_ = status;
  // What the process wrote last may still be in the pipe: the lines are
  // complete once the reader has seen the end of its output.
  sys::MutexLock lock(mutex_);
  changed_.wait_for(lock.native(), std::chrono::seconds(10), [this]() REQUIRES(mutex_) { return outputEnded_; });
  return *status_;
}

ServerProcess::Result ServerProcess::run(const std::filesystem::path& binary, const std::vector<std::string>& args,
                                         std::chrono::milliseconds timeout) {
  ServerProcess process(Bare{});
  process.start(binary, args, {});
  Result result;
  result.status = process.wait(timeout);
  for (const auto& line : process.lines()) result.output += line + "\n";
  return result;
}

}  // namespace testing_support
