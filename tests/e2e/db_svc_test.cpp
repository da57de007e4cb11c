// The service object in-process: a stop that comes before runSvc has built
// its command server is not lost (a stop while serving is tested on the
// real executable).

#include "service/db_svc.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>

#include "settings/config.h"
#include "support/log_capture.h"

namespace {

TEST(DBSvc, AStopBeforeTheServerExistsIsHonouredWhenItDoes) {
  DBConfig c = DBConfig::inst();
  c.ServerPort = 0;
  DBConfig::TestOverride config(c);
  testing_support::VerboseLog verbose;
  testing_support::LogCapture log;
  DBServer::DBSvc svc;
  ASSERT_TRUE(svc.prepareSvc());
  svc.stopSvc();
  auto run = std::async(std::launch::async, [&] { svc.runSvc(); });
  ASSERT_EQ(run.wait_for(std::chrono::seconds(10)), std::future_status::ready) << "runSvc ignored the early stop";
  run.get();
  EXPECT_TRUE(log.contains(Log::Debug, "Svc stopping..."));
  EXPECT_TRUE(log.contains(Log::Debug, "Svc stopped"));
}

}  // namespace
