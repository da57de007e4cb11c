#include "framework/service_host.h"

#include <pthread.h>
#include <sys/resource.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <atomic>
#include <csignal>
#include <cstring>
#include <thread>

#include "framework/log.h"
#include "framework/open_files.h"
#include "framework/platform.h"

namespace Service {
namespace {

sigset_t stopSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  return set;
}

// Every thread started afterwards inherits the mask, so the stop signals
// reach only the thread that waits for them.
void blockStopSignals() {
  const sigset_t set = stopSignals();
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
  // A peer that vanishes while we write must not end the process.
  std::signal(SIGPIPE, SIG_IGN);
}

// Many idle client connections each hold a descriptor; the soft limit is
// often far below what the system allows the process.
void raiseFileLimit() {
  const sys::OpenFileLimit limit = sys::raiseOpenFileLimit();
  if (limit.after == limit.before) {
    if (limit.before < limit.hard) {
      Log::Lock(Log::Warning).logStreamLine() << "Cannot raise the open-file limit from " << limit.before;
    }
    return;
  }
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "Open-file limit raised from " << limit.before << " to " << limit.after;
  }
}

const char* signalName(int sig) {
  switch (sig) {
    case SIGTERM:
      return "SIGTERM";
    case SIGINT:
      return "SIGINT";
    default:
      return "a signal";
  }
}

// Waits for the stop signals on a thread of its own and turns each into a
// stop request. end() wakes it with a signal aimed at it alone.
class SignalThread {
 public:
  explicit SignalThread(I& svc) : svc_(svc), thread_([this] { run(); }) {}
  ~SignalThread() { end(); }
  SignalThread(const SignalThread&) = delete;
  SignalThread& operator=(const SignalThread&) = delete;

  void end() {
    if (!thread_.joinable()) return;
    done_ = true;
    pthread_kill(thread_.native_handle(), SIGTERM);
    thread_.join();
  }

 private:
  void run() {
    const sigset_t set = stopSignals();
    for (;;) {
      int sig = 0;
      if (sigwait(&set, &sig) != 0) continue;
      if (done_) return;
      {
        Log::Lock entry(Log::Notice);
        entry.logStreamLine() << "Stop requested by " << signalName(sig);
      }
      try {
        svc_.stopSvc();
      } catch (const std::exception& e) {
        Log::Lock entry(Log::Error);
        entry.logStreamLine() << "Stopping the service failed: " << e.what();
      } catch (...) {
        Log::Lock entry(Log::Error);
        entry.logStreamLine() << "Stopping the service failed with an unknown error";
      }
    }
  }

  I& svc_;
  std::atomic<bool> done_{false};
  std::thread thread_;
};

}  // namespace

bool I::initSvc() { return true; }

int I::checkConfig() { return 0; }

const std::filesystem::path& I::fullPathToSvcExe() const {
  static const std::filesystem::path exe = [] {
    std::error_code ec;
    auto p = std::filesystem::read_symlink("/proc/self/exe", ec);
    return ec ? std::filesystem::path() : p;
  }();
  return exe;
}

I::~I() = default;

std::string versionText() { return std::string("cvdbserver ") + CVDB_VERSION; }

Host& inst() {
  static Host host;
  return host;
}

std::optional<int> Host::prepare(int argc, char** argv) {
  if (prepared_) return prepareResult_;
  prepared_ = true;
  blockStopSignals();

  CLI::App app("Corvina database server: keeps the databases of document-pack clients and serves them over TCP.",
               "cvdbserver");
  app.set_version_flag("--version", versionText(), "Print the version and exit");
  std::string home;
  std::string logDir;
  bool console = false;
  app.add_option("--home", home, "Folder for the server's data (the database root is its subfolder db/)")
      ->type_name("DIR");
  app.add_option("--log-dir", logDir, "Folder for the log files (they go to its subfolder svc/)")->type_name("DIR");
  app.add_flag("--console", console, "Log to standard error as well");
  app.add_flag("--check-config", checkConfig_,
               "Read config.json, print the settings in effect and exit: 0 when the file was read whole, 1 when the "
               "server would fall back to defaults for any of it");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    // --help and --version end here with 0; a bad command line with 2.
    prepareResult_ = app.exit(e) == 0 ? 0 : 2;
    return prepareResult_;
  }
  if (!home.empty()) Platform::inst().changeSystemConfigDir(std::filesystem::absolute(home));
  if (!logDir.empty()) Platform::inst().changeLogDir(std::filesystem::absolute(logDir));
  Log::setConsole(console);
  return prepareResult_;
}

int Host::main(int argc, char** argv, std::unique_ptr<I> svc) {
  if (auto code = prepare(argc, argv)) return *code;
  if (!svc) return 1;
  if (checkConfig_) {
    try {
      return svc->checkConfig();
    } catch (const std::exception& e) {
      Log::Lock(Log::Error).logStreamLine() << "Checking the configuration failed: " << e.what();
      return 1;
    }
  }
  raiseFileLimit();
  {
    Log::Lock entry(Log::Notice);
    entry.logStreamLine() << "Starting " << versionText() << " (pid " << ::getpid() << ")";
  }
  int code = 0;
  try {
    if (!svc->prepareSvc()) {
      Log::Lock entry(Log::Error);
      entry.logStreamLine() << "Service " << svc->svcName() << " could not be prepared";
      code = 1;
    } else if (!svc->initSvc()) {
      Log::Lock entry(Log::Error);
      entry.logStreamLine() << "Service " << svc->svcName() << " could not be initialised";
      code = 1;
    } else {
      SignalThread signals(*svc);
      try {
        svc->runSvc();
      } catch (...) {
        // The service logs what failed; the exit code tells whoever started us.
        Log::Lock entry(Log::Error);
        entry.logStreamLine() << "Service " << svc->svcName() << " ended with a failure";
        code = 1;
      }
      signals.end();
    }
  } catch (const std::exception& e) {
    Log::Lock entry(Log::Error);
    entry.logStreamLine() << "Service host failed: " << e.what();
    code = 1;
  }
  svc.reset();
  {
    Log::Lock entry(Log::Notice);
    entry.logStreamLine() << (code == 0 ? "Stopped" : "Stopped after a failure");
  }
  Log::flush();
  return code;
}

}  // namespace Service
