// Databases, configuration parts and data files end to end: the real
// server over loopback, driven by the client library and the cvdb tool.

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/mount.h>

#include <algorithm>
#include <random>
#include <thread>

#include "client/client.h"
#include "support/server_process.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using testing_support::ServerOptions;
using testing_support::ServerProcess;
using Keys = std::vector<std::string>;

const char* const kServer = CVDB_SERVER_PATH;
const char* const kTool = CVDB_TOOL_PATH;
constexpr const char* kTerminating = "Terminating client connection due to processing error";

ServerOptions verbose() {
  ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "ExtraLog": true})";
  return o;
}

std::unique_ptr<cvdb::Client> clientOf(const ServerProcess& server) {
  cvdb::ClientOptions o;
  o.port = server.port();
  o.ioTimeout = 20s;
  return std::make_unique<cvdb::Client>(o);
}

std::unique_ptr<cvdb::Client> connectedTo(const ServerProcess& server, const std::string& db) {
  auto c = clientOf(server);
  EXPECT_TRUE(c->connect(db)) << db;
  return c;
}

fs::path dbRoot(const ServerProcess& server) { return server.home() / "db"; }

json::Object objectOf(const std::string& text) { return json::strToObject(text); }

// Runs op, which must end the connection; returns the server's reason.
std::string endedBy(const std::function<void()>& op) {
  try {
    op();
  } catch (const cvdb::ConnectionEnded& e) {
    return e.reason();
  }
  return "(not ended)";
}

SharedMemBuffer bytes(const std::string& text) { return SharedMemBuffer(MemBuffer::copyOf(text)); }

std::string randomBytes(std::size_t n) {
  std::mt19937 gen(42);
  std::string out(n, '\0');
  for (auto& c : out) c = static_cast<char>(gen());
  return out;
}

std::vector<std::string> entriesOf(const fs::path& folder) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& e : fs::directory_iterator(folder, ec)) names.push_back(e.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

TEST(StoreEndToEnd, ConnectOpensCreatesOrOnlySelectsAndKeepsOneBindingPerConnection) {
  ServerProcess server(kServer, verbose());
  auto c = clientOf(server);

  // Open only an existing one: refused in the answer; the connection then
  // reaches the closed store, which fails the command.
  const auto missing = c->connect("Foo", 1);
  EXPECT_FALSE(missing);
  EXPECT_EQ(missing.error, "Database Foo does not exist");
  EXPECT_EQ(endedBy([&] { c->getCfg("layout"); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine("Dispatching command GetCfgPart failed with DB Engine error -1010"));
  EXPECT_EQ(server.countLogLines("No database associated"), 0u);

  // Select without opening: success, and nothing is made.
  auto selecting = clientOf(server);
  EXPECT_TRUE(selecting->connect("Ghost", 2));
  EXPECT_FALSE(fs::exists(dbRoot(server) / "ghost"));
  EXPECT_FALSE(fs::exists(dbRoot(server) / "foo"));

  // Open or create; the same key again is answered at once. Lines of one
  // connection come in order, so a later line of it shows that all of its
  // earlier ones have been read.
  auto plant = clientOf(server);
  EXPECT_TRUE(plant->connect("Plant\\Line 2"));
  EXPECT_TRUE(fs::is_regular_file(dbRoot(server) / "plant" / "line 2" / "cvdb.edb"));
  EXPECT_TRUE(server.waitForLogLine("New database created in \"plant\\line 2\""));
  ASSERT_TRUE(server.waitForLogLine("Opened database"));
  const auto opened = server.countLogLines("DB:exists");
  EXPECT_TRUE(plant->connect("PLANT\\Line 2\\", 1));
  EXPECT_TRUE(plant->connect("plant\\line 2", 0));
  plant->setCfg("where", objectOf(R"({"db":"line 2"})"));
  ASSERT_TRUE(server.waitForLogLine("Stored metadata for key where"));
  EXPECT_EQ(server.countLogLines("DB:exists"), opened);
  EXPECT_EQ(server.countLogLines("DB:disconnect"), 0u);

  // Another database replaces the binding and gives the old session back.
  EXPECT_TRUE(plant->connect("Other"));
  EXPECT_TRUE(plant->getCfg("where").empty());
  ASSERT_TRUE(server.waitForLogLine("No metadata for key where"));
  EXPECT_EQ(server.countLogLines("DB:disconnect"), 1u);
  EXPECT_TRUE(plant->connect("plant\\line 2"));
  EXPECT_EQ(plant->getCfg("where"), objectOf(R"({"db":"line 2"})"));
}

TEST(StoreEndToEnd, DatabaseNamesThatWouldLeaveTheRootAreRefusedAndMakeNothing) {
  ServerProcess server(kServer);
  const auto before = entriesOf(server.home());
  const auto rootBefore = entriesOf(dbRoot(server));
  auto c = clientOf(server);
  const std::vector<std::string> names = {"..",      "..\\..\\escape", "a\\..\\..\\escape", "x/../../escape",
                                          "db.backup\\x", "db.temp", "a\\\\b", "\\lead", std::string("nul\0x", 5)};
  for (const auto& name : names) {
    for (const std::uint32_t mode : {0u, 1u, 2u}) {
      const auto r = c->connect(name, mode);
      EXPECT_FALSE(r) << name;
      EXPECT_EQ(r.error, "Database name " + name + " is not valid");
    }
  }
  c->ping();  // a refusal is an answer, not the end of the connection
  EXPECT_EQ(entriesOf(server.home()), before);
  EXPECT_EQ(entriesOf(dbRoot(server)), rootBefore);
  EXPECT_TRUE(c->dbNames().empty());
  // Still unbound: a database command fails as before any Connect.
  EXPECT_EQ(endedBy([&] { c->cfgIds(); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine("No database associated with current connection"));
}

TEST(StoreEndToEnd, ConfigurationPartsAreStoredListedAndDeleted) {
  ServerProcess server(kServer);
  auto c = connectedTo(server, "cfg");
  EXPECT_TRUE(c->getCfg("layout").empty());
  const auto layout = objectOf(R"({"pages":[1,2,3],"name":"Zeilen \u00fc","nested":{"x":null}})");
  c->setCfg("layout", layout);
  EXPECT_EQ(c->getCfg("layout"), layout);
  c->setCfg("empty", json::Object());
  const auto empty = c->getCfg("empty");
  ASSERT_FALSE(empty.empty());  // an empty object is a value
  EXPECT_TRUE(empty.isObject());
  EXPECT_EQ(json::Object(empty).size(), 0u);

  c->deleteCfg("layout");
  EXPECT_TRUE(c->getCfg("layout").empty());
  c->deleteCfg("layout");  // deleting a missing part is no error

  for (const char* key : {"a", "ab", "abc", "b", "a%", "a_"}) c->setCfg(key, json::Object());
  EXPECT_EQ(c->cfgIds("ab"), (Keys{"ab", "abc"}));
  EXPECT_EQ(c->cfgIds("a%"), Keys{"a%"});
  EXPECT_EQ(c->cfgIds(""), (Keys{"a", "a%", "a_", "ab", "abc", "b", "empty"}));
  EXPECT_EQ(c->cfgIds("zz"), Keys{});
}

TEST(StoreEndToEnd, AValueThatIsNotAJsonObjectEndsOnlyTheConnectionThatAsksForIt) {
  ServerProcess server(kServer);
  auto reader = connectedTo(server, "shared");
  auto bystander = connectedTo(server, "shared");
  bystander->setCfg("layout", objectOf(R"({"a":1})"));
  // A pack's content shares the table and may hold any bytes.
  const std::string content("\x00\xffnot json", 10);
  {
    sqlite3* raw = nullptr;
    ASSERT_EQ(sqlite3_open((dbRoot(server) / "shared" / "cvdb.edb").c_str(), &raw), SQLITE_OK);
    sqlite3_busy_timeout(raw, 10000);
    sqlite3_stmt* put = nullptr;
    ASSERT_EQ(sqlite3_prepare_v2(raw, "INSERT INTO meta VALUES(CAST('pack-1' AS BLOB), ?1)", -1, &put, nullptr),
              SQLITE_OK);
    sqlite3_bind_blob(put, 1, content.data(), static_cast<int>(content.size()), SQLITE_STATIC);
    EXPECT_EQ(sqlite3_step(put), SQLITE_DONE);
    sqlite3_finalize(put);
    sqlite3_close(raw);
  }
  EXPECT_EQ(reader->cfgIds("pack"), Keys{"pack-1"});
  EXPECT_EQ(endedBy([&] { reader->getCfg("pack-1"); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine("Dispatching command GetCfgPart failed with"));

  EXPECT_EQ(bystander->getCfg("layout"), objectOf(R"({"a":1})"));
  auto again = connectedTo(server, "shared");
  EXPECT_EQ(again->cfgIds(""), (Keys{"layout", "pack-1"}));
  bystander->setCfg("pack-2", objectOf(R"({"b":2})"));
  EXPECT_EQ(again->getCfg("pack-2"), objectOf(R"({"b":2})"));
}

TEST(StoreEndToEnd, DataFilesRoundTripAndNamesCannotReachOtherFiles) {
  ServerProcess server(kServer);
  auto c = connectedTo(server, "docs");
  EXPECT_TRUE(c->getData("doc-1", "page.tif").empty());
  const std::string content = randomBytes(3 << 20);
  c->setData("doc-1", "page.tif", bytes(content));
  EXPECT_EQ(c->getData("doc-1", "page.tif").view(), content);
  EXPECT_EQ(testing_support::readFile(dbRoot(server) / "docs" / "d" / "doc-1" / "page.tif"), content);
  c->setData("doc-1", "page.tif", bytes(""));
  EXPECT_TRUE(c->getData("doc-1", "page.tif").empty());

  const std::string config = testing_support::readFile(dbRoot(server) / "config.json");
  const auto homeBefore = entriesOf(server.home());
  const std::vector<std::pair<std::string, std::string>> attempts = {
      {"..", "config.json"},      {"../..", "escape"}, {"doc-1", "../../../config.json"},
      {"..\\..", "config.json"}, {"doc-1", ".."},     {"", "x"},
      {"doc-1", ".cvtmp.x"}};
  for (const auto& [id, file] : attempts) {
    auto attacker = connectedTo(server, "docs");
    EXPECT_EQ(endedBy([&] { attacker->setData(id, file, bytes("overwritten")); }), kTerminating) << id << " " << file;
    auto reader = connectedTo(server, "docs");
    EXPECT_EQ(endedBy([&] { reader->getData(id, file); }), kTerminating) << id << " " << file;
  }
  EXPECT_TRUE(server.waitForLogLine("Dispatching command SetData failed with Data id \"..\" is not valid"));
  EXPECT_EQ(testing_support::readFile(dbRoot(server) / "config.json"), config);
  EXPECT_EQ(entriesOf(server.home()), homeBefore);
  EXPECT_EQ(entriesOf(dbRoot(server) / "docs" / "d"), Keys{"doc-1"});
  EXPECT_EQ(entriesOf(dbRoot(server) / "docs" / "d" / "doc-1"), Keys{"page.tif"});
}

// A small file system mounted over one data folder, so that a write runs
// out of space half-way. Mounting needs privileges the test may not have.
class SmallFileSystem {
 public:
  explicit SmallFileSystem(const fs::path& at) : at_(at) {
    fs::create_directories(at);
    mounted_ = ::mount("tmpfs", at.c_str(), "tmpfs", 0, "size=1m") == 0;
  }
  ~SmallFileSystem() {
    if (mounted_) ::umount2(at_.c_str(), MNT_DETACH);
  }
  bool mounted() const { return mounted_; }

 private:
  fs::path at_;
  bool mounted_ = false;
};

TEST(StoreEndToEnd, AWriteThatRunsOutOfSpaceKeepsThePreviousContent) {
  ServerProcess server(kServer);
  auto c = connectedTo(server, "full");
  SmallFileSystem small(dbRoot(server) / "full" / "d" / "scan");
  if (!small.mounted()) GTEST_SKIP() << "no permission to mount a small file system here";
  const std::string old = randomBytes(300 << 10);
  c->setData("scan", "page", bytes(old));
  EXPECT_EQ(endedBy([&] { c->setData("scan", "page", bytes(std::string(900 << 10, 'n'))); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine("Dispatching command SetData failed with Error writing to database file: "));
  EXPECT_TRUE(server.waitForLogLine("No space left on device"));
  auto after = connectedTo(server, "full");
  EXPECT_EQ(after->getData("scan", "page").view(), old);
  EXPECT_EQ(entriesOf(dbRoot(server) / "full" / "d" / "scan"), Keys{"page"});
}

TEST(StoreEndToEnd, TwoConnectionsWritingTheSameKeyLoseNothing) {
  ServerProcess server(kServer);
  constexpr int kRounds = 30;
  const auto writer = [&](const std::string& who, std::string* failure) {
    try {
      auto c = connectedTo(server, "busy");
      for (int i = 0; i < kRounds; ++i) {
        c->setCfg("shared", objectOf(R"({"who":")" + who + R"(","n":)" + std::to_string(i) + "}"));
        c->setCfg(who + "-" + std::to_string(i), objectOf(R"({"n":)" + std::to_string(i) + "}"));
      }
    } catch (const std::exception& e) {
      *failure = e.what();
    }
  };
  std::string failA, failB;
  std::thread a(writer, "a", &failA);
  std::thread b(writer, "b", &failB);
  a.join();
  b.join();
  EXPECT_EQ(failA, "");
  EXPECT_EQ(failB, "");
  auto c = connectedTo(server, "busy");
  EXPECT_EQ(c->cfgIds("a-").size(), static_cast<std::size_t>(kRounds));
  EXPECT_EQ(c->cfgIds("b-").size(), static_cast<std::size_t>(kRounds));
  const std::string last = c->getCfg("shared").dump();
  EXPECT_TRUE(last == R"({"who":"a","n":29})" || last == R"({"who":"b","n":29})") << last;
}

TEST(StoreEndToEnd, TheDatabaseListWalksNestedFoldersButNotTheServersOwn) {
  ServerProcess server(kServer);
  for (const char* name : {"Plant\\Line 2", "Plant", "Other\\Deep\\Er"}) connectedTo(server, name);
  for (const char* own : {"db.backup/old", "db.temp/work"}) {
    testing_support::writeFile(dbRoot(server) / own / "cvdb.edb", "not walked");
  }
  auto c = clientOf(server);
  auto names = c->dbNames();
  std::sort(names.begin(), names.end());
  EXPECT_EQ(names, (Keys{"other\\deep\\er", "plant", "plant\\line 2"}));
}

TEST(StoreEndToEnd, TheCvdbToolCoversEveryCommand) {
  ServerProcess server(kServer);
  const auto cvdb = [&](std::vector<std::string> args) {
    args.insert(args.begin(), {"--port", std::to_string(server.port())});
    return ServerProcess::run(kTool, args);
  };
  const auto ok = [](const ServerProcess::Result& r) { return r.status == 0; };
  EXPECT_TRUE(ok(cvdb({"--db", "Tool", "cfg", "set", "layout", R"({"a":[1,2]})"})));
  auto r = cvdb({"--json", "--db", "Tool", "cfg", "get", "layout"});
  EXPECT_EQ(r.output, "{\"a\":[1,2]}\n");
  r = cvdb({"--json", "--db", "Tool", "cfg", "ls", "lay"});
  EXPECT_EQ(r.output, "[\"layout\"]\n");
  EXPECT_TRUE(ok(cvdb({"--db", "Tool", "cfg", "rm", "layout"})));
  r = cvdb({"--json", "--db", "Tool", "cfg", "get", "layout"});
  EXPECT_EQ(r.output, "null\n");

  testing_support::TempDir local;
  testing_support::writeFile(local / "in", "file content");
  EXPECT_TRUE(ok(cvdb({"--db", "Tool", "data", "put", "doc", "page", (local / "in").string()})));
  EXPECT_TRUE(ok(cvdb({"--db", "Tool", "data", "get", "doc", "page", "-o", (local / "out").string()})));
  EXPECT_EQ(testing_support::readFile(local / "out"), "file content");

  r = cvdb({"--json", "dbs"});
  EXPECT_EQ(r.output, "[\"tool\"]\n");
  r = cvdb({"--db", "Missing", "--open-mode", "1", "cfg", "ls"});
  EXPECT_EQ(r.status, 1);
  EXPECT_NE(r.output.find("Database Missing does not exist"), std::string::npos) << r.output;
  r = cvdb({"--db", "..\\x", "cfg", "ls"});
  EXPECT_EQ(r.status, 1);
  EXPECT_NE(r.output.find("Database name ..\\x is not valid"), std::string::npos) << r.output;
}

}  // namespace
