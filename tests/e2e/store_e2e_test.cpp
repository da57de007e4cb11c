// Databases, configuration parts and data files end to end: the real
// server over loopback, driven by the client library.

#include <gtest/gtest.h>

#include <algorithm>

#include "e2e_support.h"
#include "support/raw_db.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using namespace e2e;
using Keys = std::vector<std::string>;

fs::path dbRoot(const ServerProcess& server) { return server.home() / "db"; }
json::Object obj(const std::string& text) { return json::strToObject(text); }

TEST(StoreEndToEnd, ConnectOpensCreatesOrOnlySelectsAndKeepsOneBindingPerConnection) {
  ServerProcess server(kServer);
  auto c = clientOf(server);
  const auto missing = c->connect("Foo", 1);
  EXPECT_FALSE(missing);
  EXPECT_EQ(missing.error, "Database Foo does not exist");
  // Bound to the closed store: the command fails there.
  EXPECT_EQ(endedBy([&] { c->getCfg("layout"); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine("Dispatching command GetCfgPart failed with DB Engine error -1010"));
  EXPECT_EQ(server.countLogLines("No database associated"), 0u);

  auto plant = clientOf(server);
  EXPECT_TRUE(plant->connect("Ghost", 2));
  EXPECT_FALSE(fs::exists(dbRoot(server) / "ghost"));
  // Selected, not opened: a later Connect with mode 1 or 0 opens it as asked.
  EXPECT_EQ(plant->connect("Ghost", 1).error, "Database Ghost does not exist");
  EXPECT_TRUE(plant->connect("Ghost", 0));
  plant->setCfg("seen", obj("{}"));
  EXPECT_TRUE(fs::exists(dbRoot(server) / "ghost" / "cvdb.edb"));
  EXPECT_TRUE(plant->connect("Plant\\Line 2"));
  plant->setCfg("where", obj(R"({"db":"line 2"})"));
  // The same key keeps the open store, whatever the mode says.
  EXPECT_TRUE(plant->connect("PLANT\\Line 2\\", 2));
  EXPECT_EQ(plant->getCfg("where"), obj(R"({"db":"line 2"})"));
  EXPECT_TRUE(plant->connect("Other\\Deep"));
  EXPECT_TRUE(plant->getCfg("where").empty());
  testing_support::writeFile(dbRoot(server) / "db.backup" / "old" / "cvdb.edb", "not walked");
  auto names = plant->dbNames();
  std::sort(names.begin(), names.end());
  EXPECT_EQ(names, (Keys{"ghost", "other\\deep", "plant\\line 2"}));
}

TEST(StoreEndToEnd, DatabaseNamesThatWouldLeaveTheRootAreRefusedAndMakeNothing) {
  ServerProcess server(kServer);
  auto c = clientOf(server);
  for (const std::string& name : {std::string(".."), std::string("a\\..\\..\\escape"), std::string("x/../../escape"),
                                  std::string("db.temp\\x"), std::string("a\\\\b"), std::string("nul\0x", 5)}) {
    const auto r = c->connect(name, 0);
    EXPECT_EQ(r.error, "Database name " + name + " is not valid");
  }
  c->ping();  // a refusal is an answer, not the end of the connection
  EXPECT_TRUE(server.waitForLogLine("Connect refused the database name \"a\\..\\..\\escape\""));

  // A name whose component is the place of another database's file or
  // companion would make a folder there: refused, and the other database
  // (open, then closed) opens as before.
  auto owner = clientOf(server, "victim");
  owner->setCfg("k", json::strToObject(R"({"v": 1})"));
  auto other = clientOf(server);
  for (const std::string& name :
       {std::string("victim\\cvdb.edb"), std::string("victim\\cvdb.edb-wal"), std::string("victim\\CVDB.EDB-shm"),
        std::string("v\\cvdb.edb.creating"), std::string("victim\\cvdb.edb.restoring\\deeper")}) {
    EXPECT_EQ(other->connect(name, 0).error, "Database name " + name + " is not valid") << name;
  }
  EXPECT_TRUE(other->connect("victim\\cvdb"));  // a prefix of the file name is no file of it
  owner.reset();
  other = clientOf(server, "victim");
  EXPECT_EQ(other->getCfg("k").dump(), R"({"v":1})");
  EXPECT_FALSE(fs::exists(dbRoot(server) / "victim" / "cvdb.edb-wal" / "cvdb.edb"));

  // A name the file system refuses (a component too long) fails the
  // creation, which takes back every folder it made.
  EXPECT_EQ(endedBy([&] { c->connect("abc\\" + std::string(300, 'x')); }), kTerminating);
  EXPECT_EQ(std::distance(fs::directory_iterator(server.home()), fs::directory_iterator()), 1);   // db/
  EXPECT_EQ(std::distance(fs::directory_iterator(dbRoot(server)), fs::directory_iterator()), 2);  // config.json, victim
}

TEST(StoreEndToEnd, ConfigurationPartsAndAStoredValueThatIsNoObject) {
  ServerProcess server(kServer);
  auto c = clientOf(server, "cfg");
  EXPECT_TRUE(c->getCfg("layout").empty());
  const auto layout = obj(R"({"pages":[1,2],"name":"\u00fc","nested":{"x":null}})");
  c->setCfg("layout", layout);
  EXPECT_EQ(c->getCfg("layout"), layout);
  c->setCfg("empty", json::Object());
  EXPECT_EQ(c->getCfg("empty"), json::Object());  // an empty object is a value
  c->deleteCfg("layout");
  c->deleteCfg("layout");  // deleting a missing part is no error
  EXPECT_TRUE(c->getCfg("layout").empty());
  for (const char* key : {"a", "ab", "abc", "b"}) c->setCfg(key, json::Object());
  EXPECT_EQ(c->cfgIds("ab"), (Keys{"ab", "abc"}));

  // A pack's content shares the table and may hold any bytes.
  EXPECT_EQ(testing_support::RawDb(dbRoot(server) / "cfg" / "cvdb.edb")
                .exec("INSERT INTO meta VALUES(CAST('pack-1' AS BLOB), x'00ff6e6f74')"),
            0);
  auto bystander = clientOf(server, "cfg");
  EXPECT_EQ(endedBy([&] { c->getCfg("pack-1"); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine("Dispatching command GetCfgPart failed with"));
  EXPECT_EQ(bystander->cfgIds("pack"), Keys{"pack-1"});
  EXPECT_EQ(bystander->getCfg("empty"), json::Object());
}

TEST(StoreEndToEnd, DataFilesRoundTripAndNamesCannotReachOtherFiles) {
  ServerProcess server(kServer);
  auto c = clientOf(server, "docs");
  EXPECT_TRUE(c->getData("doc-1", "page.tif").empty());
  std::string content(3 << 20, '\0');
  for (std::size_t i = 0; i < content.size(); ++i) content[i] = static_cast<char>(i * 7 + i / 4093);
  c->setData("doc-1", "page.tif", bytes(content));
  EXPECT_TRUE(c->getData("doc-1", "page.tif").view() == content);

  const std::string config = testing_support::readFile(dbRoot(server) / "config.json");
  for (const auto& idAndFile : std::vector<std::pair<std::string, std::string>>{
           {"..", "config.json"}, {"doc-1", "../../../config.json"}, {"..\\..", "config.json"}}) {
    const std::string& id = idAndFile.first;  // no structured binding: clang 14 cannot capture one
    const std::string& file = idAndFile.second;
    auto attacker = clientOf(server, "docs");
    EXPECT_EQ(endedBy([&] { attacker->setData(id, file, bytes("overwritten")); }), kTerminating);
    attacker = clientOf(server, "docs");
    EXPECT_EQ(endedBy([&] { attacker->getData(id, file); }), kTerminating);
  }
  EXPECT_TRUE(server.waitForLogLine("Dispatching command SetData failed with Data id \"..\" is not valid"));
  EXPECT_EQ(testing_support::readFile(dbRoot(server) / "config.json"), config);
  EXPECT_EQ(std::distance(fs::directory_iterator(dbRoot(server) / "docs" / "d"), fs::directory_iterator()), 1);
}

}  // namespace
