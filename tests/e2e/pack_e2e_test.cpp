// Pack commands end to end: the real server over loopback, driven by the
// client library.

#include <gtest/gtest.h>

#include <random>

#include "e2e_support.h"

namespace {

using namespace e2e;
using Ipc::PackInfo;
using Ipc::UseInfo;

// What neither the store tests nor the tool's test show: whole records and
// a long content as the real server answers them through the client
// library, and a refused update ending its own connection only.
TEST(PackEndToEnd, PackCommandsThroughTheClientLibrary) {
  ServerProcess server(kServer);
  auto c = clientOf(server, "Packs");
  const auto none = c->getPack("P1");
  EXPECT_EQ(none.info, nullptr);
  EXPECT_TRUE(none.content.empty());

  std::string big(300000, '\0');
  std::mt19937 gen(3);
  for (auto& ch : big) ch = static_cast<char>(gen());
  const PackInfo p1 = complete("P1", "inbox", 2, "first");
  c->savePack(p1, bytes(big));
  EXPECT_EQ(*c->packInfo("P1"), p1);
  const auto fetched = c->getPack("P1", UseInfo(UseInfo::OpenForEdit, "ws-1", "user", 40));
  ASSERT_NE(fetched.info, nullptr);
  EXPECT_EQ(fetched.info->name, p1.name);
  ASSERT_EQ(fetched.info->uses.size(), 1u);
  EXPECT_NE(fetched.info->uses[0].time, UseInfo::TIME_INVALID);
  EXPECT_EQ(fetched.content.view(), big);

  auto other = clientOf(server, "Packs");
  PackInfo partial("new");
  partial.setStatus(1);
  EXPECT_EQ(endedBy([&] { other->updatePackInfo(partial); }), kTerminating);
  EXPECT_TRUE(server.waitForLogLine(
      "Dispatching command UpdatePackInfo failed with Pack information update attempted for missing record. Id:new"));
  EXPECT_EQ(c->packInfos().size(), 1u);
}

}  // namespace
