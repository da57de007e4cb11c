// The instance pool: sessions, limits, the dormant sweep, maintenance holds
// and the teardown.

#include "engine/db_instances.h"

#include <gtest/gtest.h>

#include <atomic>
#include <barrier>
#include <filesystem>
#include <future>
#include <thread>
#include <vector>

#include "engine/instance_for_maintenance.h"
#include "engine_fixture.h"
#include "settings/names.h"
#include "support/log_capture.h"

namespace {

namespace fs = std::filesystem;
using namespace engine_testing;
using DB::DBInstances;
using DB::InstanceForMaintenance;
using testing_support::LogCapture;
using testing_support::VerboseLog;

constexpr const char* kNotAccessible = "Database not accessible! Possible restore operation in progress.";

class Recorder : public DB::DBProgressCallback {
 public:
  void onProgress(std::uint32_t percent, const std::string& text) override {
    texts.push_back(text);
    percents.push_back(percent);
    if (then) then(texts.size());
  }
  std::vector<std::string> texts;
  std::vector<std::uint32_t> percents;
  std::function<void(std::size_t)> then;
};

class Pool : public EngineTest {
 protected:
  void configure(std::uint64_t maxDbs, std::uint64_t maxClients = 100, std::int32_t maxWait = 10) {
    EngineTest::configure(testSettings(maxDbs, maxClients, maxWait));
  }

  // What the store does for a new instance: attach the file, or create it.
  DBInstances::OnNewInstance opener() {
    return [this](engine::Session& s) {
      ++opened_;
      const fs::path file = paths().mainFile(s.instance()->settings().key);
      if (fs::exists(file)) {
        s.attachDatabase(file);
      } else {
        s.createDatabase(file);
      }
    };
  }

  std::unique_ptr<engine::Session> open(const std::string& key) { return pool()->newSession(key, opener()); }
  void close(const std::string& key, std::unique_ptr<engine::Session> s) { pool()->endSession(key, std::move(s)); }
  std::optional<DBInstances::RecordView> record(const std::string& key) { return pool()->record(key); }

  std::atomic<int> opened_{0};
};

TEST_F(Pool, TheEngineStartIsLoggedAndTwoClientsOfANewDatabaseShareOneInstance) {
  VerboseLog verbose;
  LogCapture log;
  configure(100);  // a pool made while the log is captured
  std::barrier start(2);
  std::unique_ptr<engine::Session> sessions[2];
  std::vector<std::thread> threads;
  for (auto& slot : sessions) {
    threads.emplace_back([&] {
      start.arrive_and_wait();
      slot = open("shared");
      slot->openDatabase();
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(opened_, 1);
  EXPECT_EQ(record("shared")->sessions, 2u);
  EXPECT_EQ(sessions[0]->instance(), sessions[1]->instance());
  EXPECT_TRUE(sessions[1]->isOpen());
  close("shared", std::move(sessions[0]));
  EXPECT_EQ(record("shared")->sessions, 1u);
  const std::string started = "DBInstances: Engine initialized\n\t\"" + root() +
                              "\" is the databases root\n\t100 maximum active databases\n"
                              "\t100 maximum active clients per database\n\t\"cvd\" database file names prefix\n"
                              "\t\"cvdb.edb\" database file name\n";
  EXPECT_EQ(log.count(Log::Debug, started), 1u);
}

// Opening a database (a long log replay) holds up nobody but the callers
// for that database, who get a session once it is open; a failed opening
// lets them start afresh.
TEST_F(Pool, ASlowOpeningHoldsUpOnlyItsOwnDatabase) {
  std::promise<void> entered;
  std::promise<void> release;
  auto released = release.get_future().share();
  auto slow = std::async(std::launch::async, [&] {
    return pool()->newSession("slow", [&](engine::Session& s) {
      entered.set_value();
      released.wait();
      opener()(s);
    });
  });
  entered.get_future().wait();
  // Another database, its end and a hold on it, meanwhile.
  auto other = open("other");
  { InstanceForMaintenance hold(pool(), "other", nullptr, false); }
  close("other", std::move(other));
  EXPECT_EQ(record("slow")->sessions, 1u);
  auto second = std::async(std::launch::async, [&] { return open("slow"); });
  EXPECT_EQ(second.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout);
  release.set_value();
  auto first = slow.get();
  auto next = second.get();
  EXPECT_EQ(first->instance(), next->instance());
  EXPECT_EQ(record("slow")->sessions, 2u);
  close("slow", std::move(first));
  close("slow", std::move(next));

  std::promise<void> opening;
  std::promise<void> failing;
  auto failed = std::async(std::launch::async, [&] {
    return pool()->newSession("broken", [&](engine::Session&) {
      opening.set_value();
      failing.get_future().wait();
      throw DB::DBExc("cannot open");
    });
  });
  // The failing opener must be the first: a waiter that came first would
  // open the database itself, and the failing one would join it.
  opening.get_future().wait();
  auto waiter = std::async(std::launch::async, [&] { return open("broken"); });
  EXPECT_EQ(waiter.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout);
  failing.set_value();
  EXPECT_THROW(failed.get(), DB::DBExc);
  auto fresh = waiter.get();
  EXPECT_TRUE(fresh->isOpen());
  EXPECT_EQ(record("broken")->sessions, 1u);
  close("broken", std::move(fresh));
}

TEST_F(Pool, DormantInstancesAreClosedAtTwoThirdsOfTheLimitOrWhenAsked) {
  configure(3);
  VerboseLog verbose;
  LogCapture log;
  close("a", open("a"));
  close("b", open("b"));
  EXPECT_EQ(pool()->recordCount(), 2u);
  const int before = opened_;
  close("a", open("a"));  // below the threshold the instance stays open
  EXPECT_EQ(opened_, before);
  auto c = open("c");
  EXPECT_FALSE(record("a"));
  EXPECT_FALSE(record("b"));
  EXPECT_TRUE(record("c"));
  EXPECT_EQ(log.count(Log::Debug, "DBInstances: Closing dormant instance I:"), 2u);
  // Reopening a database that was closed attaches it again.
  close("a", open("a"));
  EXPECT_EQ(opened_, before + 2);

  EXPECT_TRUE(pool()->closeIfDormant("never"));
  EXPECT_FALSE(pool()->closeIfDormant("c"));
  close("c", std::move(c));
  EXPECT_TRUE(pool()->closeIfDormant("c"));
  EXPECT_FALSE(record("c"));
}

// The refusals keep the engine's codes and say in their texts (which the
// log shows) which database met which limit.
TEST_F(Pool, InstanceAndSessionLimitsAreTheEnginesAndNameTheirSetting) {
  const auto textOf = [](const auto& f) -> std::string {
    try {
      f();
    } catch (const DB::DBExc& e) {
      return e.what();
    }
    return "(no failure)";
  };
  configure(2, 2);
  auto a1 = open("a");
  auto a2 = open("a");
  EXPECT_EQ(codeOf([&] { open("a"); }), err::kOutOfSessions);
  EXPECT_EQ(textOf([&] { open("a"); }),
            "Database \"a\" refused: 2 clients have it open, the most that MaxActiveClientsPerDB allows (engine "
            "error -1101)");
  EXPECT_EQ(record("a")->sessions, 2u);

  auto b = open("b");
  EXPECT_EQ(codeOf([&] { open("c"); }), err::kTooManyInstances);
  EXPECT_EQ(textOf([&] { open("c"); }),
            "Database \"c\" refused: 2 databases are open, the most that MaxActiveDBs allows (engine error -1214)");
  EXPECT_FALSE(record("c"));
  close("b", std::move(b));
  auto c = open("c");  // b was dormant and is swept
  EXPECT_FALSE(record("b"));
}

TEST_F(Pool, ExclusiveHoldWaitsForTheLastClientRefusesSessionsAtOnceAndLeavesForANewInstance) {
  configure(100, 100, 20);
  auto s = open("r");
  const auto firstInstance = record("r")->instanceId;
  {
    Recorder progress;
    progress.then = [&](std::size_t n) {
      if (n == 3) close("r", std::move(s));
    };
    InstanceForMaintenance hold(pool(), "r", &progress, true);
    ASSERT_EQ(progress.texts.size(), 3u);
    EXPECT_EQ(progress.texts[2], "Waiting for all clients connected to the database to exit (3/20seconds passed)");
    EXPECT_TRUE(record("r")->maintenance);
    EXPECT_FALSE(hold.instance()->state() == engine::Instance::State::Initialised);
    EXPECT_NE(hold.instance()->id(), firstInstance);
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(failureOf([&] { open("r"); }), kNotAccessible);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(1));
    EXPECT_FALSE(pool()->closeIfDormant("r"));
    EXPECT_EQ(record("r")->sessions, 0u);
  }
  EXPECT_FALSE(record("r"));
  const int before = opened_;
  s = open("r");
  EXPECT_EQ(opened_, before + 1);
  EXPECT_TRUE(record("r")->initialised);
}

TEST_F(Pool, SharedHoldNeedsAnOpenInstanceWaitsWithItsMessagesAndLeavesTheInstanceOpen) {
  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(failureOf([&] { InstanceForMaintenance hold(pool(), "nowhere", nullptr, false); }),
            "No instance exist for nowhere");
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(1));

  // With no wait at all, a busy database fails at once and says nothing.
  configure(100, 100, 0);
  {
    auto zero = open("zero");
    InstanceForMaintenance first(pool(), "zero", nullptr, false);
    Recorder none;
    EXPECT_EQ(failureOf([&] { InstanceForMaintenance second(pool(), "zero", &none, false); }), "Operation timeout!");
    EXPECT_TRUE(none.texts.empty());
  }

  configure(100, 100, 12);
  auto s = open("busy");
  const auto id = record("busy")->instanceId;
  {
    InstanceForMaintenance first(pool(), "busy", nullptr, false);
    EXPECT_TRUE(record("busy")->maintenance);
    Recorder progress;
    EXPECT_EQ(failureOf([&] { InstanceForMaintenance second(pool(), "busy", &progress, false); }),
              "Operation timeout!");
    ASSERT_EQ(progress.texts.size(), 10u);  // ticks 1 to 9, then 10
    EXPECT_EQ(progress.texts[0], "Waiting for another database maintenance operation to finish (1/12seconds passed)");
    EXPECT_EQ(progress.texts[9], "Waiting for another database maintenance operation to finish (10/12seconds passed)");
    EXPECT_EQ(progress.percents[0], 0u);
  }
  EXPECT_FALSE(record("busy")->maintenance);
  EXPECT_EQ(record("busy")->instanceId, id);
}

// A restore never runs beside a backup, a cleanup or another restore of the
// same database.
TEST_F(Pool, MaintenanceHoldsExcludeEachOther) {
  configure(100, 100, 2);
  close("m", open("m"));
  {
    InstanceForMaintenance shared(pool(), "m", nullptr, false);
    EXPECT_EQ(failureOf([&] { InstanceForMaintenance exclusive(pool(), "m", nullptr, true); }), "Operation timeout!");
    EXPECT_TRUE(record("m")->initialised);
  }
  {
    InstanceForMaintenance exclusive(pool(), "m", nullptr, true);
    EXPECT_EQ(failureOf([&] { InstanceForMaintenance other(pool(), "m", nullptr, true); }), "Operation timeout!");
    EXPECT_EQ(failureOf([&] { InstanceForMaintenance shared(pool(), "m", nullptr, false); }), "Operation timeout!");
    EXPECT_TRUE(record("m")->maintenance);
  }
  EXPECT_FALSE(record("m"));
}

TEST_F(Pool, FailedFirstSessionOrExclusiveHoldLeavesNothingCounted) {
  const auto live = pool()->liveInstances();
  EXPECT_EQ(
      failureOf([&] { pool()->newSession("f", [](engine::Session&) { throw std::runtime_error("attach failed"); }); }),
      "attach failed");
  EXPECT_FALSE(record("f"));
  EXPECT_EQ(pool()->liveInstances(), live);

  // A creation failure cleans up through discardInstance itself.
  EXPECT_EQ(failureOf([&] {
              pool()->newSession("f", [&](engine::Session& s) {
                s.createDatabase(paths().mainFile("f"));
                pool()->discardInstance("f", s);
                throw std::runtime_error("tables failed");
              });
            }),
            "tables failed");
  EXPECT_FALSE(record("f"));
  EXPECT_EQ(pool()->liveInstances(), live);
  auto s = open("f");
  EXPECT_EQ(record("f")->sessions, 1u);

  // Nor does a failed exclusive hold on a new instance.
  close("f", std::move(s));
  configure(1);
  auto a = open("a");
  EXPECT_EQ(codeOf([&] { InstanceForMaintenance hold(pool(), "b", nullptr, true); }), err::kTooManyInstances);
  EXPECT_FALSE(record("b"));
  EXPECT_EQ(pool()->recordCount(), 1u);
}

TEST_F(Pool, SessionsOfAnInstanceThePoolForgotAreEndedAndReported) {
  LogCapture log;
  auto s = open("gone");
  const auto id = s->id();
  const auto old = pool();
  configure(100);
  // A new pool with a new instance of the same database is not confused by
  // the old session; the stopped pool lets its own sessions end quietly.
  auto fresh = open("gone");
  EXPECT_EQ(codeOf([&] { old->newSession("other", opener()); }), err::kTermInProgress);
  pool()->endSession("gone", std::move(s));
  EXPECT_EQ(log.count(Log::Error,
                      "DBInstances: DB: gone, Session S:" + std::to_string(id) + " released for unknown instance!!!"),
            1u);
  EXPECT_EQ(record("gone")->sessions, 1u);
}

TEST_F(Pool, TeardownInterruptsAWaitingHold) {
  configure(100, 100, 100000);
  auto s = open("w");
  std::promise<void> waiting;
  Recorder progress;
  progress.then = [&](std::size_t n) {
    if (n == 1) waiting.set_value();
  };
  auto hold = std::async(std::launch::async, [&] { InstanceForMaintenance h(pool(), "w", &progress, true); });
  waiting.get_future().wait();
  pool()->stop();
  ASSERT_EQ(hold.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  EXPECT_EQ(codeOf([&] { hold.get(); }), err::kTermInProgress);
}

}  // namespace
