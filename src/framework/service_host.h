#pragma once
// The service host: runs a service object in the foreground of the process
// until a stop is requested.
//
//   int main(int argc, char** argv) {
//     auto& host = Service::inst();
//     if (auto code = host.prepare(argc, argv)) return *code;  // --help, --version, bad options
//     ...                                                       // the folders are final from here on
//     return host.main(argc, argv, std::make_unique<MySvc>());
//   }
//
// Command line: --help, --version, --home DIR (the platform's system
// configuration folder), --log-dir DIR (the platform's log folder),
// --console (log entries go to standard error too), --check-config (main()
// runs the service's checkConfig() instead of the service and returns its
// result).
// main() raises the open-file limit to its hard limit, turns SIGTERM and
// SIGINT into stopSvc() (taken by a dedicated thread with sigwait, never in
// a signal handler), calls prepareSvc, initSvc and runSvc, and returns 0
// after a clean stop, 1 when the service failed (prepareSvc or initSvc
// returned false, runSvc threw).
//
// Ownership: main() owns the service object and destroys it before it
// returns. Thread safety: inst() is process-wide; prepare() and main() are
// called once, from the process's main thread, before any other thread is
// started (so that every thread inherits the blocked stop signals).

#include <filesystem>
#include <memory>
#include <optional>
#include <string>

namespace Service {

// A service that the host runs.
class I {
 public:
  // Loads what the service needs before it runs; false ends the process.
  virtual bool prepareSvc() = 0;
  // Second preparation step; the base does nothing and returns true.
  virtual bool initSvc();
  // Runs the service; blocks until it is stopped. May throw.
  virtual void runSvc() = 0;
  // Asks runSvc to return. Called from another thread, possibly before
  // runSvc has started, possibly more than once.
  virtual void stopSvc() = 0;
  virtual const std::string& svcName() const = 0;
  virtual const std::string& svcDisplayName() const = 0;
  // Checks the service's settings, says what they are on standard output
  // and returns the process's exit code; the base has nothing to check.
  virtual int checkConfig();
  // The running executable; the base reads it from the system.
  virtual const std::filesystem::path& fullPathToSvcExe() const;
  virtual ~I();
};

class Host {
 public:
  // Parses and applies the command line. Returns the exit code when the
  // process is to end at once (--help and --version: 0; a bad option: its
  // non-zero code), else nothing. Later calls repeat the first outcome.
  std::optional<int> prepare(int argc, char** argv);

  // Runs the service until it stops and returns the process's exit code.
  // Calls prepare() first when the entry point has not.
  int main(int argc, char** argv, std::unique_ptr<I> svc);

 private:
  bool prepared_ = false;
  bool checkConfig_ = false;
  std::optional<int> prepareResult_;
};

Host& inst();

// The program name and version, as --version prints them.
std::string versionText();

}  // namespace Service
