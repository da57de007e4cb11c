#include "settings/config.h"

#include <jansson.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <sstream>

#include "framework/json.h"
#include "framework/log.h"
#include "framework/platform.h"
#include "settings/names.h"
#include "settings/network_path.h"

namespace {

constexpr const char* kConfigFileName = "config.json";
constexpr std::uint64_t kMaxActiveDBsLimit = 1024;
constexpr std::uint64_t kMaxActiveClientsPerDBLimit = 30000;
constexpr std::size_t kPrefixLength = 3;
// 1 TiB: beyond any machine the server runs on, and far from overflowing
// when turned into bytes.
constexpr std::uint64_t kMaxBufferedMiBLimit = std::uint64_t{1} << 20;
constexpr std::uint64_t kReadCacheMiBLimit = std::uint64_t{1} << 20;

// Set while a test installs its own record; inst() must stay a single load
// on the hot path, hence an atomic pointer rather than a lock.
std::atomic<const DBConfig*> g_override{nullptr};

// Reads the whole configuration file. False when it is missing or cannot be
// read (a folder of that name included): the settings then keep their
// defaults without a message, as an absent file does.
bool readConfigFile(sys::Env& env, const std::string& path, std::string& text) {
  try {
    if (env.stat(path, true).type != sys::FileType::Regular) return false;
    text = env.readFile(path);
    return true;
  } catch (const std::system_error&) {
    return false;
  }
}

// The folder keys treat a value of another type as an empty text.
std::string stringOrEmpty(const json::Value& v) { return v.isString() ? v.asString() : std::string(); }

std::uint64_t limited(std::int64_t value, std::uint64_t limit) {
  // Taken as unsigned on purpose: a negative value ends up at the limit.
  return std::min(static_cast<std::uint64_t>(value), limit);
}

// Reads the keys in their fixed order. A key of the wrong type throws
// json::Exc from asInteger/asString; the caller logs it, and every field set
// before it keeps its new value.
void readKeys(const json::Object& obj, DBConfig& c) {
  if (const auto root = stringOrEmpty(obj.get("DBRoot")); !root.empty()) {
    c.DBRoot = normaliseFolder(root);
    c.DBLogRoot = c.DBRoot;
  }
  if (DB::isNetworkPath(c.DBRoot)) {
    Log::Lock(Log::Warning).logStreamLine()
        << "WARNING: Network location specified for base path. Database on remote location is NOT "
           "recommended - use at your own risk! Contact customer support if you need help "
           "configuring the database server.";
  }
  if (const auto logRoot = stringOrEmpty(obj.get("DBLogRoot")); !logRoot.empty()) {
    c.DBLogRoot = normaliseFolder(logRoot);
  }
  if (const auto v = obj.get("BackupFolder"); !v.empty()) c.BackupFolder = stringOrEmpty(v);
  if (const auto v = obj.get("ServerPort"); !v.empty()) {
    c.ServerPort = static_cast<std::uint16_t>(v.asInteger());
  }
  if (const auto v = obj.get("ForceIP4"); !v.empty()) c.ForceIP4 = v.isTrue();
  if (const auto v = obj.get("MaxActiveDBs"); !v.empty()) {
    c.MaxActiveDBs = limited(v.asInteger(), kMaxActiveDBsLimit);
  }
  if (const auto v = obj.get("MaxActiveClientsPerDB"); !v.empty()) {
    c.MaxActiveClientsPerDB = limited(v.asInteger(), kMaxActiveClientsPerDBLimit);
  }
  if (const auto v = obj.get("MaxActiveClients"); !v.empty()) {
    c.MaxActiveClients = static_cast<std::uint64_t>(v.asInteger());
  }
  if (const auto v = obj.get("DBFilesPrefix"); !v.empty()) {
    std::string prefix = v.asString();
    prefix.resize(kPrefixLength, '_');
    c.DBFilesPrefix = std::move(prefix);
  }
  if (const auto v = obj.get("DBFileName"); !v.empty()) c.DBFileName = v.asString();
  if (obj.get("ExtraLog").isTrue()) g_LogVerbose = true;
  if (const auto v = obj.get("MaxWaitMaintenanceOpSecs"); !v.empty()) {
    c.MaxWaitMaintenanceOpSecs = static_cast<std::int32_t>(static_cast<std::uint32_t>(v.asInteger()));
  }
  if (const auto v = obj.get("EnableEngineLogging"); !v.empty()) c.EnableEngineLogging = v.isTrue();
  if (const auto v = obj.get("MaxBufferedMiB"); !v.empty()) {
    c.MaxBufferedMiB = limited(v.asInteger(), kMaxBufferedMiBLimit);
  }
  if (const auto v = obj.get("ReadCacheMiB"); !v.empty()) {
    c.ReadCacheMiB = limited(v.asInteger(), kReadCacheMiBLimit);
  }
  if (const auto v = obj.get("MetricsPort"); !v.empty()) c.MetricsPort = static_cast<std::uint16_t>(v.asInteger());
  if (const auto v = obj.get("MetricsAddress"); !v.empty()) c.MetricsAddress = v.asString();
}

// The TLS keys are read apart from the others, whatever became of those: a
// type error elsewhere must not leave a server that is meant to speak TLS
// in plain TCP. Their own problems go to TlsProblem, which stops the start.
void readTlsKeys(const json::Object& obj, DBConfig& c) {
  try {
    if (const auto v = obj.get("TlsCertFile"); !v.empty()) c.TlsCertFile = v.asString();
    if (const auto v = obj.get("TlsKeyFile"); !v.empty()) c.TlsKeyFile = v.asString();
    if (const auto v = obj.get("TlsClientCAFile"); !v.empty()) c.TlsClientCAFile = v.asString();
  } catch (const json::Exc& e) {
    c.TlsProblem = std::string("a TLS key has the wrong type: ") + e.what();
    return;
  }
  if (c.TlsCertFile.empty() != c.TlsKeyFile.empty()) {
    c.TlsProblem = "TlsCertFile and TlsKeyFile must be set together";
  } else if (!c.TlsClientCAFile.empty() && c.TlsCertFile.empty()) {
    c.TlsProblem = "TlsClientCAFile needs TlsCertFile and TlsKeyFile";
  }
}

// MaintenanceFolders is read apart from the other keys too: a type error
// elsewhere must not leave a server that is meant to confine backup and
// restore accepting any path. A value that is not an array of texts is a
// problem that stops the start (MaintenanceFoldersProblem).
void readMaintenanceFolders(const json::Object& obj, DBConfig& c) {
  const auto v = obj.get("MaintenanceFolders");
  if (v.empty()) return;
  if (!v.isArray()) {
    c.MaintenanceFoldersProblem = std::string("MaintenanceFolders: expected an array of folders, got ") + v.typeName();
    return;
  }
  std::vector<std::string> folders;
  for (std::size_t i = 0; i < json_array_size(v.get()); ++i) {
    const auto entry = json::Value::borrow(json_array_get(v.get(), i));
    if (!entry.isString()) {
      c.MaintenanceFoldersProblem =
          "MaintenanceFolders: entry " + std::to_string(i + 1) + " is " + entry.typeName() + ", not a folder";
      return;
    }
    if (const std::string folder = entry.asString(); !folder.empty()) folders.push_back(normaliseFolder(folder));
  }
  c.MaintenanceFolders = std::move(folders);
}

const DBConfig& loadedRecord() {
  static const DBConfig record = DBConfig::load(DBConfig::defaultRoot(), sys::Env::posix());
  return record;
}

}  // namespace

std::string normaliseFolder(std::string text) {
  std::replace(text.begin(), text.end(), '\\', '/');
  if (!text.empty() && text.back() != '/') text.push_back('/');
  return text;
}

std::string DBConfig::defaultRoot() { return (Platform::inst().corvinaSystemConfigDir() / "db").string() + "/"; }

const DBConfig& DBConfig::inst() {
  if (const DBConfig* o = g_override.load(std::memory_order_acquire)) return *o;
  return loadedRecord();
}

DBConfig DBConfig::load(const std::string& defaultRoot, sys::Env& env, std::string* problem) {
  DBConfig c;
  c.DBRoot = defaultRoot;
  c.DBLogRoot = defaultRoot;
  try {
    std::string text;
    if (readConfigFile(env, defaultRoot + kConfigFileName, text)) {
      const json::Object obj = json::strToObject(text);
      if (obj.size() > 0) {
        readTlsKeys(obj, c);
        readMaintenanceFolders(obj, c);
        readKeys(obj, c);
      }
    } else if (problem) {
      *problem = "no readable " + defaultRoot + kConfigFileName + ": every setting is its default";
    }
  } catch (const std::exception& e) {
    Log::Lock(Log::Error).logStreamLine() << "Configuration initialization error: " << e.what();
    if (problem) *problem = e.what();
  }
  if (c.BackupFolder.empty() || c.BackupFolder == c.DBRoot) {
    c.BackupFolder = c.DBRoot + DB::kBackupSubfolder;
  } else {
    c.BackupFolder = normaliseFolder(c.BackupFolder);
  }
  Log::Lock(Log::Notice).logStreamLine() << c.printout();
  return c;
}

std::string DBConfig::printout() const {
  const auto onOff = [](bool on) { return on ? "enabled" : "disabled"; };
  std::ostringstream out;
  out << "Starting with:\n"
      << "\tversion: " << CVDB_VERSION << '\n'
      << "\tdb root folder: \"" << DBRoot << "\"\n"
      << "\tdb log root folder: \"" << DBLogRoot << "\"\n"
      << "\tdb backup folder: \"" << BackupFolder << "\"\n"
      << "\tTCP listening port: " << ServerPort << '\n'
      << "\tmaximum active dbs: " << MaxActiveDBs << '\n'
      << "\tmaximum active clients per db: " << MaxActiveClientsPerDB << '\n'
      << "\tmaximum total active clients: " << MaxActiveClients << '\n'
      << "\tmeta db files prefix: \"" << DBFilesPrefix << "\"\n"
      << "\tmeta db main file name: \"" << DBFileName << "\"\n"
      << "\textra logging: " << onOff(g_LogVerbose) << '\n'
      << "\trecycle log file size: " << Log::kRecycleLogFileSize << '\n'
      << "\tmaximum wait time maintenance operation: " << MaxWaitMaintenanceOpSecs << '\n'
      << "\tdb engine event logging: " << onOff(EnableEngineLogging) << '\n'
      << "\tmaximum buffered memory (MiB): "
      << (MaxBufferedMiB == 0 ? std::string("unlimited") : std::to_string(MaxBufferedMiB)) << '\n'
      << "\tread cache (MiB): " << (ReadCacheMiB == 0 ? std::string("off") : std::to_string(ReadCacheMiB)) << '\n'
      << "\tclient connections: ";
  const Ipc::TlsFiles tls = tlsFiles();
  if (!TlsProblem.empty()) {
    out << "not usable: " << TlsProblem;
  } else {
    out << tls.modeName();
    if (tls.enabled()) out << ", certificate \"" << TlsCertFile << "\", key \"" << TlsKeyFile << '"';
    if (tls.mutual()) out << ", client CA \"" << TlsClientCAFile << '"';
  }
  out << '\n';
  return out.str();
}

DBConfig::TestOverride::TestOverride(DBConfig config)
    : config_(std::make_unique<DBConfig>(std::move(config))),
      previous_(g_override.exchange(config_.get(), std::memory_order_acq_rel)) {}

DBConfig::TestOverride::~TestOverride() { g_override.store(previous_, std::memory_order_release); }
