// The service object in-process: a stop may come before, while or after
// runSvc builds its command server, and is never lost.

#include "service/db_svc.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>

#include "client/client.h"
#include "service/config.h"
#include "support/log_capture.h"

namespace {

using namespace std::chrono_literals;
using testing_support::LogCapture;
using testing_support::VerboseLog;

DBConfig anyPort() {
  DBConfig c = DBConfig::inst();
  c.ServerPort = 0;
  return c;
}

TEST(DBSvc, AStopBeforeTheServerExistsIsHonouredWhenItDoes) {
  DBConfig::TestOverride config(anyPort());
  VerboseLog verbose;
  LogCapture log;
  DBServer::DBSvc svc;
  ASSERT_TRUE(svc.prepareSvc());
  svc.stopSvc();
  auto run = std::async(std::launch::async, [&] { svc.runSvc(); });
  ASSERT_EQ(run.wait_for(10s), std::future_status::ready) << "runSvc ignored the early stop";
  run.get();
  EXPECT_TRUE(log.contains(Log::Debug, "Svc stopping..."));
  EXPECT_TRUE(log.contains(Log::Debug, "Svc stopped"));
}

TEST(DBSvc, AStopWhileServingEndsRunSvc) {
  DBConfig::TestOverride config(anyPort());
  LogCapture log;
  DBServer::DBSvc svc;
  auto run = std::async(std::launch::async, [&] { svc.runSvc(); });
  // The server announces its port once it listens.
  std::uint16_t port = 0;
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (port == 0 && std::chrono::steady_clock::now() < deadline) {
    for (const auto& e : log.entries()) {
      const auto at = e.text.find("Listening on port ");
      if (at != std::string::npos) port = static_cast<std::uint16_t>(std::stoi(e.text.substr(at + 18)));
    }
    if (port == 0) std::this_thread::sleep_for(5ms);
  }
  ASSERT_NE(port, 0);
  cvdb::ClientOptions o;
  o.port = port;
  cvdb::Client c(o);
  c.ping();

  svc.stopSvc();
  svc.stopSvc();  // a second request changes nothing
  ASSERT_EQ(run.wait_for(10s), std::future_status::ready);
  run.get();
  EXPECT_THROW(c.ping(), cvdb::ConnectionEnded);
  EXPECT_FALSE(log.contains(Log::Debug, "Svc stopped"));  // verbose logging is off
}

}  // namespace
