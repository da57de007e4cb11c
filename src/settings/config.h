#pragma once
// The server's settings, read once from config.json in the default
// database root and printed to the log.
//
// DBConfig::inst() loads the record on its first call (from whichever
// thread; concurrent first callers wait) and returns the same read-only
// record afterwards. A missing file, a file that is not JSON or a value of
// the wrong type never stops the server: the record always ends up
// complete, with defaults where the file gave nothing usable.
//
// Folder texts use "/" as separator and always end with one "/".

#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "framework/env.h"
#include "framework/tls_files.h"

class DBConfig {
 public:
  std::string DBRoot;
  std::string DBLogRoot;
  std::string BackupFolder;
  std::uint16_t ServerPort = 45678;
  bool ForceIP4 = false;
  std::uint64_t MaxActiveDBs = 100;
  std::uint64_t MaxActiveClientsPerDB = 100;
  std::uint64_t MaxActiveClients = 512;
  std::string DBFilesPrefix = "cvd";
  std::string DBFileName = "cvdb.edb";
  std::int32_t MaxWaitMaintenanceOpSecs = 10;
  bool EnableEngineLogging = false;
  // Memory that connections may hold in buffers, all together, in MiB
  // (answers queued for clients, large requests); 0: no limit.
  std::uint64_t MaxBufferedMiB = 256;
  // The byte budget, in MiB, of what the server keeps of configuration
  // parts and pack records read (every database together); 0: nothing.
  std::uint64_t ReadCacheMiB = 64;
  // Folders that backup targets and restore sources must lie in (with the
  // backup folder, always allowed); empty allows any path.
  std::vector<std::string> MaintenanceFolders;
  // Why MaintenanceFolders cannot be used as given (not an array of
  // folders); empty when it can. The server does not start with a problem
  // here rather than accept any path.
  std::string MaintenanceFoldersProblem;
  // The HTTP port of /metrics and /healthz (0: none), and its address.
  std::uint16_t MetricsPort = 0;
  std::string MetricsAddress = "127.0.0.1";
  // TLS of the client port: with the certificate and key set, TLS only;
  // with the client CA too, mutual TLS. All empty: plain TCP.
  std::string TlsCertFile;
  std::string TlsKeyFile;
  std::string TlsClientCAFile;
  // Why the TLS keys cannot be used as given (a key of the wrong type, a
  // certificate without its key, ...); empty when they can. The server does
  // not start with a problem here rather than serve in plain TCP.
  std::string TlsProblem;

  Ipc::TlsFiles tlsFiles() const { return {TlsCertFile, TlsKeyFile, TlsClientCAFile}; }

  // The process-wide record; loads and prints it on the first call.
  static const DBConfig& inst();

  // Loads a record from defaultRoot + "config.json", read through env,
  // without touching the process-wide one: every rule of the load
  // (defaults, key order, type errors, limits, the backup-folder rule)
  // applies, and the printout is logged. defaultRoot must end with "/".
  // With problem given, it receives why the file was not taken whole (no
  // file, not a JSON object, a value of the wrong type), or stays empty.
  static DBConfig load(const std::string& defaultRoot, sys::Env& env, std::string* problem = nullptr);

  // The default database root: the platform's system configuration folder
  // joined with "db", followed by "/".
  static std::string defaultRoot();

  // The seventeen-line settings printout, without the log entry around it.
  std::string printout() const;

  // For tests: makes inst() return the given record while the object lives.
  // Not for concurrent use with other overrides.
  class TestOverride {
   public:
    explicit TestOverride(DBConfig config);
    ~TestOverride();
    TestOverride(const TestOverride&) = delete;
    TestOverride& operator=(const TestOverride&) = delete;

   private:
    std::unique_ptr<DBConfig> config_;
    const DBConfig* previous_;
  };
};

// Every "\" becomes "/"; a non-empty text gets one trailing "/" unless it
// already ends with one. An empty text stays empty.
std::string normaliseFolder(std::string text);
