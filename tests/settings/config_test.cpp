#include "settings/config.h"

#include <gtest/gtest.h>
#include <linux/magic.h>

#include <barrier>
#include <filesystem>
#include <limits>
#include <thread>
#include <vector>

#include "framework/platform.h"
#include "settings/network_path.h"
#include "support/log_capture.h"
#include "support/temp_dir.h"

namespace {

using testing_support::LogCapture;
using testing_support::TempDir;
using testing_support::VerboseLog;

constexpr const char* kInitError = "Configuration initialization error: ";

// A default root in a temporary folder with the given config.json (none
// when text is null).
class ConfigFile {
 public:
  explicit ConfigFile(const char* text) : root_(dir_.path().string() + "/db/") {
    std::filesystem::create_directories(root_);
    if (text) testing_support::writeFile(root_ + "config.json", text);
  }
  const std::string& root() const { return root_; }
  DBConfig load() const { return DBConfig::load(root_, sys::Env::posix()); }

 private:
  TempDir dir_;
  std::string root_;
};

DBConfig loadWith(const char* text) { return ConfigFile(text).load(); }

TEST(Config, MissingFileGivesDefaultsAndPrintsThemAsOneEntry) {
  VerboseLog quiet(false);
  LogCapture log;
  const ConfigFile file(nullptr);
  file.load();
  const std::string& r = file.root();
  const std::string expected = std::string("Starting with:\n") + "\tversion: " + CVDB_VERSION +
                               "\n"
                               "\tdb root folder: \"" +
                               r +
                               "\"\n"
                               "\tdb log root folder: \"" +
                               r +
                               "\"\n"
                               "\tdb backup folder: \"" +
                               r +
                               "db.backup/\"\n"
                               "\tTCP listening port: 45678\n"
                               "\tmaximum active dbs: 100\n"
                               "\tmaximum active clients per db: 100\n"
                               "\tmaximum total active clients: 512\n"
                               "\tmeta db files prefix: \"cvd\"\n"
                               "\tmeta db main file name: \"cvdb.edb\"\n"
                               "\textra logging: disabled\n"
                               "\trecycle log file size: 10485760\n"
                               "\tmaximum wait time maintenance operation: 10\n"
                               "\tdb engine event logging: disabled\n"
                               "\tmaximum buffered memory (MiB): 256\n"
                               "\tread cache (MiB): 64\n"
                               "\tclient connections: plain TCP\n";
  const auto entries = log.entries();
  ASSERT_EQ(entries.size(), 1u);
  EXPECT_EQ(entries[0].priority, Log::Notice);
  EXPECT_EQ(entries[0].text, expected);
  // A local root raises no network warning.
  EXPECT_EQ(log.count(Log::Warning, "Network location"), 0u);
}

TEST(Config, UnusableFilesKeepDefaults) {
  for (const auto& [text, logsError] : std::vector<std::pair<const char*, bool>>{
           {"{}", false}, {"{\"DBRoot\": ", true}, {"", true}, {"[1, 2]", true}, {"{} trailing", true}}) {
    SCOPED_TRACE(text);
    LogCapture log;
    const DBConfig c = loadWith(text);
    EXPECT_EQ(c.ServerPort, 45678);
    EXPECT_EQ(c.MaxActiveDBs, 100u);
    EXPECT_EQ(log.count(Log::Error, kInitError), logsError ? 1u : 0u);
    EXPECT_EQ(log.count(Log::Notice, "Starting with:"), 1u);
  }
  // Unreadable (here a folder in its place) counts as missing: no message.
  LogCapture log;
  const ConfigFile file(nullptr);
  std::filesystem::create_directories(file.root() + "config.json");
  EXPECT_EQ(file.load().ServerPort, 45678);
  EXPECT_EQ(log.count(Log::Error, kInitError), 0u);
}

TEST(Config, WrongTypeStopsReadingInKeyOrderNotFileOrder) {
  LogCapture log;
  // The file lists the late key first: reading follows the fixed key order,
  // so MaxActiveDBs (read after ServerPort) keeps its default.
  const DBConfig c = loadWith(R"({"MaxActiveDBs": 5, "ServerPort": "4000",
      "BackupFolder": "/bak", "DBRoot": "/data", "MaxActiveClients": 9})");
  EXPECT_EQ(c.DBRoot, "/data/");
  EXPECT_EQ(c.BackupFolder, "/bak/");
  EXPECT_EQ(c.ServerPort, 45678);
  EXPECT_EQ(c.MaxActiveDBs, 100u);
  EXPECT_EQ(c.MaxActiveClients, 512u);
  EXPECT_EQ(log.count(Log::Error,
                      "Configuration initialization error: JSON error: Wrong type: string. "
                      "Expected type: integer"),
            1u);

  log.clear();
  const DBConfig d = loadWith(R"({"MaxActiveClients": 9, "DBFilesPrefix": 12, "DBFileName": "x.db"})");
  EXPECT_EQ(d.MaxActiveClients, 9u);
  EXPECT_EQ(d.DBFileName, "cvdb.edb");
  EXPECT_EQ(log.count(Log::Error, "Wrong type: integer. Expected type: string"), 1u);
}

// The TLS keys are read whatever became of the others, and what cannot be
// served as asked is a problem that stops the start, never plain TCP.
TEST(Config, TlsKeysGiveTheModeOrAProblem) {
  struct Case {
    const char* text;
    const char* mode;     // printed after "client connections: "
    const char* problem;  // TlsProblem, empty when none
  };
  for (const Case& c : {
           Case{R"({"TlsCertFile": "", "TlsKeyFile": ""})", "plain TCP", ""},
           Case{R"({"TlsCertFile": "/c.pem", "TlsKeyFile": "/k.pem"})", "TLS, certificate \"/c.pem\", key \"/k.pem\"",
                ""},
           Case{R"({"TlsCertFile": "/c.pem", "TlsKeyFile": "/k.pem", "TlsClientCAFile": "/ca.pem"})",
                "mutual TLS, certificate \"/c.pem\", key \"/k.pem\", client CA \"/ca.pem\"", ""},
           // After a type error that stops the other keys.
           Case{R"({"ServerPort": "x", "TlsCertFile": "/c.pem", "TlsKeyFile": "/k.pem"})",
                "TLS, certificate \"/c.pem\", key \"/k.pem\"", ""},
           Case{R"({"TlsKeyFile": "/k.pem"})", "not usable: TlsCertFile and TlsKeyFile must be set together",
                "TlsCertFile and TlsKeyFile must be set together"},
           Case{R"({"TlsClientCAFile": "/ca.pem"})", "not usable: TlsClientCAFile needs TlsCertFile and TlsKeyFile",
                "TlsClientCAFile needs TlsCertFile and TlsKeyFile"},
           Case{R"({"TlsCertFile": "/c.pem", "TlsKeyFile": true})",
                "not usable: a TLS key has the wrong type: JSON error: Wrong type: boolean. Expected type: string",
                "a TLS key has the wrong type: JSON error: Wrong type: boolean. Expected type: string"},
       }) {
    SCOPED_TRACE(c.text);
    LogCapture log;
    const DBConfig config = loadWith(c.text);
    EXPECT_EQ(config.TlsProblem, c.problem);
    EXPECT_NE(config.printout().find(std::string("\tclient connections: ") + c.mode + "\n"), std::string::npos)
        << config.printout();
  }
}

TEST(Config, LooselyTypedKeysNeverStopReadingAndSwitchesTakeOnlyTheLiteralTrue) {
  {
    LogCapture log;
    VerboseLog quiet(false);
    const DBConfig c = loadWith(R"({"DBRoot": 5, "DBLogRoot": [], "BackupFolder": null,
        "ForceIP4": "yes", "ExtraLog": 1, "EnableEngineLogging": 1, "ServerPort": 1})");
    EXPECT_EQ(log.count(Log::Error, kInitError), 0u);
    EXPECT_EQ(c.ServerPort, 1);
    EXPECT_FALSE(c.ForceIP4);
    EXPECT_FALSE(c.EnableEngineLogging);
    EXPECT_FALSE(g_LogVerbose);
    EXPECT_EQ(c.BackupFolder, c.DBRoot + "db.backup/");
    EXPECT_EQ(c.DBLogRoot, c.DBRoot);
  }
  {
    VerboseLog quiet(false);
    const DBConfig c = loadWith(R"({"ForceIP4": true, "ExtraLog": true, "EnableEngineLogging": true})");
    EXPECT_TRUE(c.ForceIP4);
    EXPECT_TRUE(c.EnableEngineLogging);
    EXPECT_TRUE(g_LogVerbose);
    EXPECT_NE(c.printout().find("\textra logging: enabled\n"), std::string::npos);
    EXPECT_NE(c.printout().find("\tdb engine event logging: enabled\n"), std::string::npos);
  }
  {
    // ExtraLog false leaves a flag that is already on alone.
    VerboseLog verbose(true);
    loadWith(R"({"ExtraLog": false})");
    EXPECT_TRUE(g_LogVerbose);
  }
  for (const char* text : {R"({"ForceIP4": 1})", R"({"ForceIP4": "true"})", R"({"ForceIP4": false})"}) {
    EXPECT_FALSE(loadWith(text).ForceIP4) << text;
  }
}

TEST(Config, NumbersAreLimitedAndTruncatedAsStored) {
  const DBConfig a = loadWith(R"({"ServerPort": 70000, "MaxActiveDBs": 5000,
      "MaxActiveClientsPerDB": 40000, "MaxActiveClients": -1,
      "MaxWaitMaintenanceOpSecs": 4294967306})");
  EXPECT_EQ(a.ServerPort, 4464);
  EXPECT_EQ(a.MaxActiveDBs, 1024u);
  EXPECT_EQ(a.MaxActiveClientsPerDB, 30000u);
  EXPECT_EQ(a.MaxActiveClients, std::numeric_limits<std::uint64_t>::max());
  EXPECT_EQ(a.MaxWaitMaintenanceOpSecs, 10);

  // Negative counts are taken as huge unsigned numbers and so hit the limit.
  const DBConfig b = loadWith(R"({"ServerPort": -1, "MaxActiveDBs": -1,
      "MaxActiveClientsPerDB": -7, "MaxWaitMaintenanceOpSecs": 4294967295})");
  EXPECT_EQ(b.ServerPort, 65535);
  EXPECT_EQ(b.MaxActiveDBs, 1024u);
  EXPECT_EQ(b.MaxActiveClientsPerDB, 30000u);
  EXPECT_EQ(b.MaxWaitMaintenanceOpSecs, -1);
  EXPECT_NE(b.printout().find("\tmaximum wait time maintenance operation: -1\n"), std::string::npos);

  // The memory bound: 256 MiB unless set, 0 switches it off, 1 TiB at most.
  EXPECT_EQ(loadWith("{}").MaxBufferedMiB, 256u);
  const DBConfig off = loadWith(R"({"MaxBufferedMiB": 0})");
  EXPECT_EQ(off.MaxBufferedMiB, 0u);
  EXPECT_NE(off.printout().find("\tmaximum buffered memory (MiB): unlimited\n"), std::string::npos);
  EXPECT_EQ(loadWith(R"({"MaxBufferedMiB": -1})").MaxBufferedMiB, std::uint64_t{1} << 20);
  EXPECT_EQ(loadWith(R"({"MaxBufferedMiB": 64})").MaxBufferedMiB, 64u);

  // The read cache: 64 MiB unless set, 0 switches it off, 1 TiB at most.
  EXPECT_EQ(loadWith("{}").ReadCacheMiB, 64u);
  EXPECT_NE(loadWith("{}").printout().find("\tread cache (MiB): 64\n"), std::string::npos);
  const DBConfig noCache = loadWith(R"({"ReadCacheMiB": 0})");
  EXPECT_EQ(noCache.ReadCacheMiB, 0u);
  EXPECT_NE(noCache.printout().find("\tread cache (MiB): off\n"), std::string::npos);
  EXPECT_EQ(loadWith(R"({"ReadCacheMiB": -1})").ReadCacheMiB, std::uint64_t{1} << 20);
}

TEST(Config, TextsArePaddedCutOrNormalised) {
  // The prefix is cut or padded to three characters, the file name is kept
  // as it is, folders get "/" separators and one trailing "/".
  EXPECT_EQ(loadWith(R"({"DBFilesPrefix": "abcdef"})").DBFilesPrefix, "abc");
  EXPECT_EQ(loadWith(R"({"DBFilesPrefix": "x"})").DBFilesPrefix, "x__");
  EXPECT_EQ(loadWith(R"({"DBFilesPrefix": ""})").DBFilesPrefix, "___");
  EXPECT_EQ(loadWith(R"({"DBFileName": ""})").DBFileName, "");
  EXPECT_EQ(loadWith(R"({"DBFileName": "Main DB.edb"})").DBFileName, "Main DB.edb");

  const DBConfig a = loadWith(R"({"DBRoot": "/srv\\cvdb"})");
  EXPECT_EQ(a.DBRoot, "/srv/cvdb/");
  EXPECT_EQ(a.DBLogRoot, "/srv/cvdb/");
  EXPECT_EQ(a.BackupFolder, "/srv/cvdb/db.backup/");
  const DBConfig b = loadWith(R"({"DBRoot": "/data/", "DBLogRoot": "/logs", "BackupFolder": "/data/"})");
  EXPECT_EQ(b.DBLogRoot, "/logs/");
  EXPECT_EQ(b.BackupFolder, "/data/db.backup/");
  EXPECT_EQ(loadWith(R"({"BackupFolder": "\\mnt\\bak"})").BackupFolder, "/mnt/bak/");
  const ConfigFile empty(R"({"DBRoot": "", "DBLogRoot": "", "BackupFolder": ""})");
  const DBConfig d = empty.load();
  EXPECT_EQ(d.DBRoot, empty.root());
  EXPECT_EQ(d.DBLogRoot, empty.root());
  EXPECT_EQ(d.BackupFolder, empty.root() + "db.backup/");
  // Compared byte for byte before normalising: "/data" is not "/data/", so
  // the backup folder is the root itself, as it always has been.
  EXPECT_EQ(loadWith(R"({"DBRoot": "/data", "BackupFolder": "/data"})").BackupFolder, "/data/");

  // Maintenance folders are normalised like the others; empty entries go.
  const DBConfig m = loadWith(R"({"MaintenanceFolders": ["\\srv\\bak", "/mnt/x/", ""]})");
  EXPECT_EQ(m.MaintenanceFolders, (std::vector<std::string>{"/srv/bak/", "/mnt/x/"}));
  // A value that cannot be used is a problem that stops the start, never
  // a quiet "any path"; a type error in another key does not lose it.
  EXPECT_TRUE(m.MaintenanceFoldersProblem.empty());
  const DBConfig notArray = loadWith(R"({"MaintenanceFolders": "/srv/bak"})");
  EXPECT_TRUE(notArray.MaintenanceFolders.empty());
  EXPECT_EQ(notArray.MaintenanceFoldersProblem, "MaintenanceFolders: expected an array of folders, got string");
  EXPECT_EQ(loadWith(R"({"MaintenanceFolders": ["/a", 7]})").MaintenanceFoldersProblem,
            "MaintenanceFolders: entry 2 is integer, not a folder");
  const DBConfig afterTypeError = loadWith(R"({"ServerPort": "x", "MaintenanceFolders": ["/srv/bak"]})");
  EXPECT_EQ(afterTypeError.MaintenanceFolders, (std::vector<std::string>{"/srv/bak/"}));
}

TEST(NetworkPath, RemoteFileSystemsAreRecognised) {
  EXPECT_TRUE(DB::isNetworkFileSystem(NFS_SUPER_MAGIC, ""));
  EXPECT_TRUE(DB::isNetworkFileSystem(SMB2_SUPER_MAGIC, ""));
  EXPECT_TRUE(DB::isNetworkFileSystem(FUSE_SUPER_MAGIC, "fuse.sshfs"));
  EXPECT_FALSE(DB::isNetworkFileSystem(FUSE_SUPER_MAGIC, "fuse.ntfs-3g"));
  EXPECT_FALSE(DB::isNetworkFileSystem(EXT4_SUPER_MAGIC, "fuse.sshfs"));
  EXPECT_FALSE(DB::isNetworkPath(""));
}

// The only test that loads the process-wide record: it must happen once,
// whichever thread comes first.
TEST(Config, InstLoadsOnceForConcurrentFirstCallers) {
  LogCapture log;
  constexpr int kThreads = 8;
  std::vector<const DBConfig*> seen(kThreads);
  std::barrier start(kThreads);
  {
    std::vector<std::jthread> threads;
    for (int i = 0; i < kThreads; ++i) {
      threads.emplace_back([&, i] {
        start.arrive_and_wait();
        seen[static_cast<std::size_t>(i)] = &DBConfig::inst();
      });
    }
  }
  for (const auto* p : seen) EXPECT_EQ(p, seen[0]);
  EXPECT_EQ(log.count(Log::Notice, "Starting with:"), 1u);
  EXPECT_EQ(seen[0]->DBRoot, (Platform::inst().corvinaSystemConfigDir() / "db").string() + "/");
}

}  // namespace
