// Cleanup of unused data: what it removes and keeps, what it reports, how
// it fails, and that it never removes a write acknowledged meanwhile.

#include <gtest/gtest.h>

#include <future>
#include <stop_token>

#include "engine/instance_for_maintenance.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using store_testing::entries;
using store_testing::StoreTest;
using testing_support::FaultEnv;
using testing_support::LogCapture;
using testing_support::readFile;
using testing_support::writeFile;

struct Report {
  std::uint32_t percent;
  std::string text;
};

class Recorder : public DB::DBProgressCallback {
 public:
  explicit Recorder(std::vector<Report>& out, std::function<void(const std::string&)> then = {})
      : out_(out), then_(std::move(then)) {}
  void onProgress(std::uint32_t percent, const std::string& text) override {
    out_.push_back({percent, text});
    if (then_) then_(text);
  }

 private:
  std::vector<Report>& out_;
  std::function<void(const std::string&)> then_;
};

class Cleanup : public StoreTest {
 protected:
  // An entry of the data folder last written hours ago.
  void entry(const std::string& id, int hours) {
    db->saveDataBlob("x", 1, id, "file");
    env_.setModified(root() + "c/d/" + id, sys::WallClock::now() - std::chrono::hours(hours));
  }
  std::vector<Report> run(const std::set<std::string>& used, std::function<void(const std::string&)> then = {}) {
    std::vector<Report> reports;
    db->cleanUp(used, std::make_unique<Recorder>(reports, std::move(then)));
    return reports;
  }
  std::unique_ptr<DB::DBLocal> db = open("c");
};

TEST_F(Cleanup, WithoutADataFolderThereIsNothingToDo) {
  LogCapture log;
  const auto reports = run({});
  ASSERT_EQ(reports.size(), 2u);
  EXPECT_EQ(reports[0].text, "Erasing unused data...");
  EXPECT_EQ(reports[1].percent, 100u);
  EXPECT_EQ(reports[1].text, "No data found");
  EXPECT_EQ(log.count("cleaned"), 0u);
}

// Old unused entries go with everything below them, whatever they are; a
// link goes as a link. Young ones, used ones and used ids without an entry
// change nothing. Plain files count as processed but not in the total, and
// the percent still never passes 100.
TEST_F(Cleanup, OldUnusedEntriesGoAndEverythingElseStays) {
  LogCapture log;
  writeFile(root() + "c/d/old/deep/er", "nested");
  entry("old", 7);
  entry("young", 5);
  entry("used", 7);
  writeFile(root() + "c/d/loose", "a plain file");
  env_.setModified(root() + "c/d/loose", sys::WallClock::now() - 7h);
  writeFile(dir_ / "outside", "never touched");
  fs::create_symlink(dir_ / "outside", root() + "c/d/link");
  env_.setModified(root() + "c/d/link", sys::WallClock::now() - 7h);

  const auto reports = run({"used", "ghost"});
  EXPECT_EQ(entries(root() + "c/d"), (std::vector<std::string>{"used", "young"}));
  EXPECT_EQ(readFile(dir_ / "outside"), "never touched");
  EXPECT_TRUE(
      log.contains(Log::Notice, "Database \"c\" cleaned. 3 unused ids deleted, 1 unused ids too recent to clean"));
  ASSERT_GE(reports.size(), 2u);
  for (const auto& r : reports) EXPECT_LE(r.percent, 100u) << r.text;
  EXPECT_EQ(reports.back().percent, 100u);
  EXPECT_TRUE(reports.back().text.starts_with("Removing data chunks 100% complete (")) << reports.back().text;
}

TEST_F(Cleanup, ProgressIsReportedEveryFivePoints) {
  for (int i = 0; i < 200; ++i) entry("id" + std::to_string(i), 7);
  const auto reports = run({});
  ASSERT_EQ(reports.size(), 22u);
  EXPECT_EQ(reports[1].text, "Removing data chunks 0% complete (1/200), 1 erased");
  EXPECT_EQ(reports[2].text, "Removing data chunks 5% complete (10/200), 10 erased");
  for (std::size_t i = 1; i < reports.size(); ++i) EXPECT_EQ(reports[i].percent, (i - 1) * 5);
  EXPECT_TRUE(entries(root() + "c/d").empty());
}

TEST_F(Cleanup, AFailedRemovalEndsItWithThePathAndTheReason) {
  LogCapture log;
  entry("a", 7);
  entry("b", 7);
  env_.failOnPath(FaultEnv::Op::RemoveAll, "/d/b", EACCES);
  try {
    run({});
    FAIL() << "no failure";
  } catch (const std::system_error& e) {
    EXPECT_NE(std::string(e.what()).find(root() + "c/d/b"), std::string::npos) << e.what();
    EXPECT_NE(std::string(e.what()).find("Permission denied"), std::string::npos) << e.what();
  }
  EXPECT_EQ(log.count("cleaned"), 0u);
  EXPECT_FALSE(pool()->record("c")->maintenance);  // the hold is released
  std::stop_source stopped;
  stopped.request_stop();
  std::vector<Report> reports;
  EXPECT_THROW(db->cleanUp({}, std::make_unique<Recorder>(reports), stopped.get_token()), std::runtime_error);
}

// A client writes into an old, unused id at the moment the cleanup is
// about to remove it. The write must either wait for the removal and make
// the id anew, or make it young first: a write acknowledged to its client
// is never lost.
TEST_F(Cleanup, AWriteIntoAnIdBeingRemovedIsNeverLost) {
  entry("victim", 7);
  auto writer = std::make_unique<DB::DBLocal>(pool(), "c");
  std::future<void> write;
  env_.setCallHook([&](FaultEnv::Op op, const sys::Path& path) {
    if (op != FaultEnv::Op::RemoveAll || path.filename() != "victim" || write.valid()) return;
    write = std::async(std::launch::async, [&] { writer->saveDataBlob("kept", 4, "victim", "new"); });
    // Time for the write to get through, if nothing holds it back.
    write.wait_for(300ms);
  });
  run({});
  env_.setCallHook({});
  ASSERT_TRUE(write.valid());
  write.get();  // acknowledged
  EXPECT_EQ(db->loadDataBlob("victim", "new").view(), "kept");
}

TEST_F(Cleanup, ItWaitsForAnotherMaintenanceOperationOfTheDatabase) {
  entry("a", 7);
  auto backup = std::make_unique<DB::InstanceForMaintenance>(pool(), "c", nullptr, false);
  const auto reports = run({}, [&](const std::string& text) {
    if (text.starts_with("Waiting for another database maintenance operation to finish (2/")) backup.reset();
  });
  ASSERT_GE(reports.size(), 4u);
  EXPECT_EQ(reports[0].text, "Waiting for another database maintenance operation to finish (1/10seconds passed)");
  EXPECT_EQ(reports[2].text, "Erasing unused data...");
  EXPECT_TRUE(entries(root() + "c/d").empty());
}

}  // namespace
