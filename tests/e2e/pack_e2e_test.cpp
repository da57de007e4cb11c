// Pack commands end to end: the real server over loopback, driven by the
// client library and by the cvdb tool.

#include <gtest/gtest.h>

#include <random>

#include "e2e_support.h"

namespace {

using namespace e2e;
using Ipc::PackInfo;
using Ipc::UseInfo;

// What the store tests cannot show: the answers as they cross the wire
// (null records, a long content handed over as the frame's tail, the use
// list of a fetch), ChangeDocId, and a refusal ending only its connection.
TEST(PackEndToEnd, PackCommandsThroughTheClientLibrary) {
  ServerProcess server(kServer);
  auto c = clientOf(server, "Packs");
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

  const auto opened = c->getPack("P1", UseInfo(UseInfo::OpenForEdit, "ws-1", "user", 40));
  ASSERT_EQ(opened.info->uses.size(), 1u);
  EXPECT_EQ(opened.info->uses[0].host, "ws-1");
  EXPECT_NE(opened.info->uses[0].time, UseInfo::TIME_INVALID);
  EXPECT_EQ(opened.info->status(), 7);
  EXPECT_EQ(opened.content.view(), big);
  EXPECT_EQ(c->getPack("gone", UseInfo(UseInfo::CloseEdit, "ws-1", "user", 40)).info, nullptr);

  c->erasePack("P1");
  c->erasePack("P1");
  EXPECT_EQ(c->packInfo("P1"), nullptr);

  c->setData("doc-1", "page.tif", bytes("tiff"));
  c->changeDocId("doc-1", "doc-2");
  EXPECT_EQ(c->getData("doc-2", "page.tif").view(), "tiff");

  // A refusal ends its own connection and no other.
  auto other = clientOf(server, "Packs");
  PackInfo partial("new");
  partial.setStatus(1);
  EXPECT_EQ(endedBy([&] { other->updatePackInfo(partial); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine(
      "Dispatching command UpdatePackInfo failed with Pack information update attempted for missing record. Id:new"));
  EXPECT_EQ(endedBy([&] { c->changeDocId("no-such-doc", "doc-3"); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine("Dispatching command ChangeDocId failed with Error renaming data folder no-such-doc"));
  EXPECT_EQ(clientOf(server, "Packs")->packInfos().size(), 1u);
}

}  // namespace
