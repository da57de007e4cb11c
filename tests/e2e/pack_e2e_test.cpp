// Pack commands end to end: the real server over loopback, driven by the
// client library and by the cvdb tool.

#include <gtest/gtest.h>

#include <random>

#include "client/client.h"
#include "support/server_process.h"
#include "support/temp_dir.h"

namespace {

using namespace std::chrono_literals;
using Ipc::PackInfo;
using Ipc::UseInfo;
using testing_support::ServerProcess;

const char* const kServer = CVDB_SERVER_PATH;
const char* const kTool = CVDB_TOOL_PATH;
constexpr const char* kTerminating = "Terminating client connection due to processing error";

std::unique_ptr<cvdb::Client> connectedTo(const ServerProcess& server, const std::string& db) {
  cvdb::ClientOptions o;
  o.port = server.port();
  o.ioTimeout = 20s;
  auto c = std::make_unique<cvdb::Client>(o);
  EXPECT_TRUE(c->connect(db));
  return c;
}

std::string endedBy(const std::function<void()>& op) {
  try {
    op();
  } catch (const cvdb::ConnectionEnded& e) {
    return e.reason();
  }
  return "(not ended)";
}

SharedMemBuffer bytes(const std::string& text) { return SharedMemBuffer(MemBuffer::copyOf(text)); }

PackInfo complete(const std::string& id, const std::string& folder, std::int32_t status, const std::string& name) {
  Ipc::PackInfoPartial p;
  p.name = name;
  p.owner = "anna";
  p.created = 1700000000;
  p.modified = 1700000100;
  p.docCount = 2;
  return PackInfo(id, folder, status, p);
}

UseInfo use(UseInfo::State state, const std::string& host, std::uint32_t process = 1) {
  return UseInfo(state, host, "user", process);
}

// What the store tests cannot show: the answers as they cross the wire
// (null records, a long content handed over as the frame's tail, the use
// list of a fetch), ChangeDocId, and a refusal ending only its connection.
TEST(PackEndToEnd, PackCommandsThroughTheClientLibrary) {
  ServerProcess server(kServer);
  auto c = connectedTo(server, "Packs");
  EXPECT_EQ(c->packInfo("P1"), nullptr);
  EXPECT_TRUE(c->packInfos().empty());
  const auto none = c->getPack("P1");
  EXPECT_EQ(none.info, nullptr);
  EXPECT_TRUE(none.content.empty());

  std::string big(300000, '\0');
  std::mt19937 gen(3);
  for (auto& ch : big) ch = static_cast<char>(gen());
  const PackInfo p1 = complete("P1", "inbox", 2, "first");
  c->savePack(p1, bytes(big));
  c->savePack(complete("P2", "inbox", 1, "second"), {});
  EXPECT_EQ(*c->packInfo("P1"), p1);
  EXPECT_EQ(c->packInfos("inbox").size(), 2u);
  const auto fetched = c->getPack("P1");
  EXPECT_EQ(*fetched.info, p1);
  EXPECT_EQ(fetched.content.view(), big);
  EXPECT_TRUE(c->getPack("P2").content.empty());

  PackInfo status("P1");
  status.setStatus(7);
  const auto updated = c->updatePackInfo(status);
  EXPECT_EQ(updated->status(), 7);
  EXPECT_FALSE(updated->folderValid());

  const auto opened = c->getPack("P1", use(UseInfo::OpenForEdit, "ws-1", 40));
  ASSERT_EQ(opened.info->uses.size(), 1u);
  EXPECT_EQ(opened.info->uses[0].host, "ws-1");
  EXPECT_NE(opened.info->uses[0].time, UseInfo::TIME_INVALID);
  EXPECT_EQ(opened.info->status(), 7);
  EXPECT_EQ(opened.content.view(), big);
  EXPECT_EQ(c->getPack("gone", use(UseInfo::CloseEdit, "ws-1", 40)).info, nullptr);

  c->erasePack("P1");
  c->erasePack("P1");
  EXPECT_EQ(c->packInfo("P1"), nullptr);

  c->setData("doc-1", "page.tif", bytes("tiff"));
  c->changeDocId("doc-1", "doc-2");
  EXPECT_EQ(c->getData("doc-2", "page.tif").view(), "tiff");

  // A refusal ends its own connection and no other.
  auto other = connectedTo(server, "Packs");
  PackInfo partial("new");
  partial.setStatus(1);
  EXPECT_EQ(endedBy([&] { other->updatePackInfo(partial); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine(
      "Dispatching command UpdatePackInfo failed with Pack information update attempted for missing record. Id:new"));
  EXPECT_EQ(endedBy([&] { c->changeDocId("no-such-doc", "doc-3"); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine("Dispatching command ChangeDocId failed with Error renaming data folder no-such-doc"));
  EXPECT_EQ(connectedTo(server, "Packs")->packInfos().size(), 1u);
}

struct Tool {
  std::uint16_t port;
  ServerProcess::Result operator()(std::vector<std::string> args) const {
    args.insert(args.begin(), {"--port", std::to_string(port), "--db", "Tool"});
    return ServerProcess::run(kTool, args);
  }
};

std::string ok(const ServerProcess::Result& r) {
  EXPECT_EQ(r.status, 0) << r.output;
  return r.output;
}

bool has(const std::string& output, const std::string& text) { return output.find(text) != std::string::npos; }

TEST(PackEndToEnd, EveryPackCommandThroughTheTool) {
  ServerProcess server(kServer);
  const Tool cvdb{server.port()};
  testing_support::TempDir dir;
  testing_support::writeFile(dir / "content.bin", "pack bytes");

  EXPECT_TRUE(has(ok(cvdb({"pack", "save", "P1", "--folder", "inbox", "--status", "3", "--name", "March", "--content",
                           (dir / "content.bin").string()})),
                  "saved \"P1\" with 10 bytes"));
  ok(cvdb({"pack", "save", "P2", "--folder", "inbox", "--status", "1", "--content", (dir / "content.bin").string()}));

  const std::string table = ok(cvdb({"pack", "ls", "inbox"}));
  EXPECT_TRUE(has(table, "ID")) << table;
  EXPECT_LT(table.find("P2"), table.find("P1")) << table;  // status order
  EXPECT_TRUE(has(table, "March")) << table;
  const json::Value listed = json::strToValue(ok(cvdb({"--json", "pack", "ls"})));
  ASSERT_TRUE(listed.isArray());
  EXPECT_EQ(json::strToValue(ok(cvdb({"--json", "pack", "ls", "nowhere"}))).dump(), "[]");

  const json::Object info = json::strToObject(ok(cvdb({"--json", "pack", "info", "P1"})));
  EXPECT_EQ(info.get("folder"), json::Value::string("inbox"));
  EXPECT_EQ(info.get("status"), json::Value::integer(3));
  EXPECT_EQ(ok(cvdb({"--json", "pack", "info", "none"})), "null\n");

  const json::Object updated = json::strToObject(ok(cvdb({"--json", "pack", "update", "P1", "--status", "8"})));
  EXPECT_EQ(updated.get("status"), json::Value::integer(8));

  // Fetch into a file while opening for edit; the record goes to standard
  // output then.
  const std::string opened = ok(cvdb({"--json", "pack", "get", "P1", "--open-for-edit", "--host", "ws-7", "--process",
                                      "77", "-o", (dir / "out.bin").string()}));
  EXPECT_EQ(testing_support::readFile(dir / "out.bin"), "pack bytes");
  EXPECT_TRUE(has(opened, "\"host\":\"ws-7\"")) << opened;
  EXPECT_TRUE(has(opened, "\"process\":77")) << opened;
  EXPECT_TRUE(has(ok(cvdb({"pack", "get", "P2"})), "pack bytes"));

  EXPECT_TRUE(has(ok(cvdb({"pack", "lock", "P1", "--host", "scan-1"})), "locked \"P1\" for host \"scan-1\""));
  const auto refused = cvdb({"pack", "lock", "P1", "--host", "scan-2"});
  EXPECT_EQ(refused.status, 1) << refused.output;
  EXPECT_TRUE(has(ok(cvdb({"pack", "info", "P1"})), "LockForUpload host \"scan-1\""));
  EXPECT_TRUE(has(ok(cvdb({"pack", "unlock", "P1", "--host", "scan-1"})), "unlocked \"P1\" for host \"scan-1\""));
  EXPECT_EQ(cvdb({"pack", "unlock", "P1", "--host", "scan-1"}).status, 1);
  ok(cvdb({"pack", "get", "P1", "--close", "--host", "ws-7", "--process", "77", "-o", (dir / "out.bin").string()}));
  EXPECT_TRUE(has(ok(cvdb({"pack", "info", "P1"})), "uses:      none"));

  ok(cvdb({"data", "put", "doc-1", "a.txt", (dir / "content.bin").string()}));
  EXPECT_TRUE(has(ok(cvdb({"pack", "change-id", "doc-1", "doc-2"})), "copied the data of \"doc-1\" to \"doc-2\""));
  ok(cvdb({"data", "get", "doc-2", "a.txt", "-o", (dir / "copied.bin").string()}));
  EXPECT_EQ(testing_support::readFile(dir / "copied.bin"), "pack bytes");

  EXPECT_TRUE(has(ok(cvdb({"pack", "rm", "P1"})), "erased \"P1\""));
  EXPECT_TRUE(has(ok(cvdb({"pack", "info", "P1"})), "no pack \"P1\""));
}

}  // namespace
