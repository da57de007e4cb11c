// Editors and upload locks of a pack: every transition and refusal, the
// stored form of the list, the age limit that ends a crashed client's
// entries, and the log lines.

#include <gtest/gtest.h>

#include "engine/db_exc.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

using Ipc::PackInfo;
using Ipc::UseInfo;
using store_testing::complete;
using store_testing::storedRecord;
using store_testing::storedText;
using store_testing::StoreTest;
using store_testing::useRequest;
using testing_support::LogCapture;
using testing_support::RawDb;
using testing_support::VerboseLog;

constexpr const char* kLocked = "Attept to lock for upload a pack which is already locked from another host.";
constexpr const char* kNotUnlocked = "Failed unlock for upload";
constexpr std::int64_t kT0 = 1800000000;

// The stored list as (state, host, process) triples, in list order.
using Entry = std::tuple<int, std::string, std::uint32_t>;
std::vector<Entry> usesOf(DB::DBLocal& db, const std::string& id) {
  std::vector<Entry> out;
  const auto info = db.infoFor(id);
  for (const UseInfo& u : info->uses) out.emplace_back(u.state, u.host, u.process);
  return out;
}

std::string refusal(const std::function<void()>& op) {
  try {
    op();
  } catch (const DB::DBExc& e) {
    return e.what();
  }
  return "(accepted)";
}

class PackUse : public StoreTest {
 protected:
  PackUse() {
    env_.useManualClock(sys::WallClock::time_point(std::chrono::seconds(kT0)));
    db = open("u");
    db->savePackMeta(complete("P", "f", 1), "content", 7);
  }
  std::unique_ptr<DB::DBLocal> db;

  Ipc::PackInfoPtr fetch(UseInfo::State state, const std::string& host, std::uint32_t process = 7) {
    return db->packMetadata(useRequest("P", state, host, process)).info;
  }
};

TEST_F(PackUse, EditorsArePerHostAndProcessAndTheKeyGoesWithTheLastOne) {
  using E = std::vector<Entry>;
  fetch(UseInfo::OpenForEdit, "ws-1", 10);
  fetch(UseInfo::OpenForEdit, "ws-1", 11);
  const auto third = fetch(UseInfo::OpenForEdit, "ws-1", 10);  // not merged
  // A fetch with a use entry answers the complete record with the new list.
  ASSERT_NE(third, nullptr);
  EXPECT_TRUE(third->allValid());
  EXPECT_EQ(third->uses.size(), 3u);
  EXPECT_EQ(third->uses[0].time, kT0);
  EXPECT_EQ(usesOf(*db, "P"), (E{{0, "ws-1", 10}, {0, "ws-1", 11}, {0, "ws-1", 10}}));

  fetch(UseInfo::CloseEdit, "ws-1", 10);
  EXPECT_EQ(usesOf(*db, "P"), (E{{0, "ws-1", 11}, {0, "ws-1", 10}}));
  // Nobody of that host and process, or another host: no change, no fault.
  fetch(UseInfo::CloseEdit, "ws-1", 12);
  fetch(UseInfo::CloseEdit, "ws-2", 11);
  EXPECT_EQ(usesOf(*db, "P"), (E{{0, "ws-1", 11}, {0, "ws-1", 10}}));

  RawDb raw(db->dbFile());
  EXPECT_TRUE(storedRecord(raw, "P").has("uses"));
  fetch(UseInfo::CloseEdit, "ws-1", 10);
  fetch(UseInfo::CloseEdit, "ws-1", 11);
  EXPECT_TRUE(usesOf(*db, "P").empty());
  EXPECT_FALSE(storedRecord(raw, "P").has("uses"));
  EXPECT_EQ(db->infoFor("P")->name, "name");
}

// Keys this version does not know, in the list's object and in its
// entries, are kept as long as their entry is (a newer client's fields).
TEST_F(PackUse, UnknownKeysOfTheListAndOfItsEntriesAreKept) {
  RawDb raw(db->dbFile());
  const std::string t = std::to_string(kT0);
  ASSERT_EQ(raw.exec("UPDATE info SET blob = CAST('{\"name\":\"name\",\"owner\":\"o\",\"created\":1,\"modified\":2,"
                     "\"docCount\":3,\"uses\":{\"v\":2,\"entries\":[{\"state\":0,\"host\":\"a\",\"user\":\"u\","
                     "\"process\":1,\"time\":" +
                     t +
                     ",\"seat\":\"x1\"},{\"state\":0,\"host\":\"b\",\"user\":\"u\","
                     "\"process\":2,\"time\":" +
                     t + ",\"seat\":\"x2\"}]}}' AS BLOB) WHERE id = CAST('P' AS BLOB)"),
            0);
  fetch(UseInfo::OpenForEdit, "c", 3);
  fetch(UseInfo::CloseEdit, "a", 1);
  const auto uses = storedRecord(raw, "P").get("uses");
  EXPECT_EQ(uses.dump(),
            "{\"v\":2,\"entries\":[{\"state\":0,\"host\":\"b\",\"user\":\"u\",\"process\":2,\"time\":" + t +
                ",\"seat\":\"x2\"},{\"state\":0,\"host\":\"c\",\"user\":\"u\",\"process\":3,\"time\":" + t + "}]}");
  fetch(UseInfo::CloseEdit, "b", 2);
  fetch(UseInfo::CloseEdit, "c", 3);
  EXPECT_EQ(storedRecord(raw, "P").get("uses").dump(), "{\"v\":2}");
}

TEST_F(PackUse, TheUploadLockBelongsToOneHostAndARefusalLeavesNoTrace) {
  using E = std::vector<Entry>;
  fetch(UseInfo::OpenForEdit, "ws-9", 1);
  fetch(UseInfo::LockForUpload, "scan-A", 5);
  EXPECT_EQ(usesOf(*db, "P"), (E{{0, "ws-9", 1}, {2, "scan-A", 5}}));

  // Host B's save, with new fields and content, is refused whole.
  PackInfo fromB = complete("P", "other", 8, "by B");
  fromB.uses.append(UseInfo(UseInfo::LockForUpload, "scan-B", "b", 6));
  RawDb raw(db->dbFile());
  const auto before = storedText(raw, "P");
  EXPECT_EQ(refusal([&] { db->savePackMeta(fromB, "B's", 3); }), kLocked);
  EXPECT_EQ(refusal([&] { db->updateInfo(fromB); }), kLocked);
  EXPECT_EQ(refusal([&] { fetch(UseInfo::LockForUpload, "scan-B"); }), kLocked);
  EXPECT_EQ(refusal([&] { fetch(UseInfo::LockForUpload, "SCAN-A"); }), kLocked);  // hosts are exact bytes
  EXPECT_EQ(storedText(raw, "P"), before);
  EXPECT_EQ(db->packMetadata(PackInfo("P")).content.view(), "content");
  EXPECT_EQ(db->infoFor("P")->folder(), "f");

  // The same host renews the lock: one entry, the later time; another
  // process of that host takes it over.
  env_.advance(std::chrono::seconds(60));
  fetch(UseInfo::LockForUpload, "scan-A", 9);
  const auto list = db->infoFor("P")->uses;
  EXPECT_EQ(usesOf(*db, "P"), (E{{0, "ws-9", 1}, {2, "scan-A", 9}}));
  EXPECT_EQ(list[1].time, kT0 + 60);

  // Only the holder's host releases it; a release without lock is refused.
  EXPECT_EQ(refusal([&] { fetch(UseInfo::EndUpload, "scan-B"); }), kNotUnlocked);
  EXPECT_EQ(usesOf(*db, "P"), (E{{0, "ws-9", 1}, {2, "scan-A", 9}}));
  fetch(UseInfo::EndUpload, "scan-A", 1234);
  EXPECT_EQ(usesOf(*db, "P"), (E{{0, "ws-9", 1}}));
  EXPECT_EQ(refusal([&] { fetch(UseInfo::EndUpload, "scan-A"); }), kNotUnlocked);
  // Now B may.
  fetch(UseInfo::LockForUpload, "scan-B");
  EXPECT_EQ(usesOf(*db, "P"), (E{{0, "ws-9", 1}, {2, "scan-B", 7}}));
}

TEST_F(PackUse, ALockOlderThanSevenHoursNoLongerBlocksAnotherHost) {
  fetch(UseInfo::LockForUpload, "crashed");
  fetch(UseInfo::OpenForEdit, "crashed", 3);
  env_.advance(std::chrono::seconds(Ipc::kUseLimitSeconds));
  // Exactly at the limit the entries still count.
  EXPECT_EQ(refusal([&] { fetch(UseInfo::LockForUpload, "scan-B"); }), kLocked);
  EXPECT_EQ(db->infoFor("P")->uses.size(), 2u);

  env_.advance(std::chrono::seconds(1));
  EXPECT_TRUE(db->infoFor("P")->uses.empty());  // every read applies the limit
  const auto taken = fetch(UseInfo::LockForUpload, "scan-B");
  ASSERT_EQ(taken->uses.size(), 1u);
  EXPECT_EQ(taken->uses[0].host, "scan-B");
  // The old entries are gone from the stored list too.
  RawDb raw(db->dbFile());
  EXPECT_EQ(storedRecord(raw, "P").get("uses").dump().find("crashed"), std::string::npos);
}

TEST_F(PackUse, AnUpdateAnswersTheListOnlyWhenItOpenedOrLocked) {
  PackInfo open = useRequest("P", UseInfo::OpenForEdit, "ws-1");
  open.setStatus(3);
  const auto opened = db->updateInfo(open);
  EXPECT_EQ(opened->status(), 3);
  EXPECT_FALSE(opened->folderValid());
  EXPECT_EQ(opened->name, Ipc::PackInfoPartial::STR_INVALID);
  ASSERT_EQ(opened->uses.size(), 1u);
  EXPECT_EQ(opened->uses[0].host, "ws-1");

  const auto closed = db->updateInfo(useRequest("P", UseInfo::CloseEdit, "ws-1"));
  EXPECT_EQ(closed->status(), 3);
  EXPECT_TRUE(closed->uses.empty());

  // A state that asks for nothing changes nothing, on every path.
  fetch(UseInfo::OpenForEdit, "ws-2");
  const auto odd = db->packMetadata(useRequest("P", static_cast<UseInfo::State>(1), "ws-3")).info;
  ASSERT_EQ(odd->uses.size(), 1u);
  EXPECT_EQ(odd->uses[0].host, "ws-2");
  EXPECT_TRUE(db->updateInfo(useRequest("P", static_cast<UseInfo::State>(55), "ws-3"))->uses.empty());
  EXPECT_EQ(db->infoFor("P")->uses.size(), 1u);
}

TEST_F(PackUse, OperationsAndEveryUseTransitionAreLoggedWhenVerbose) {
  {
    LogCapture quiet;
    db->savePackMeta(complete("Q", "f", 1), "c", 1);
    EXPECT_TRUE(quiet.entries().empty());
  }
  VerboseLog verbose;
  LogCapture log;
  const auto session = " S:" + std::to_string(db->sessionId());
  db->updateInfo(complete("P1", "f", 1));
  PackInfo partial("P1");
  partial.setStatus(3);
  db->updateInfo(partial);
  db->savePackMeta(partial, "content", 7);
  db->infoFor("P1");
  db->infoFor("none");
  db->infos("f");
  db->packMetadata(PackInfo("P1"));
  db->removePack("P1");
  db->removePack("none");
  for (const std::string& line : std::vector<std::string>{
           "DB:updateInfo" + session + " Info for P1 fully updated",
           "DB:updateInfo" + session + " Info for P1 updated",
           "DB:savePackMeta" + session + " Stored pack metadata for P1",
           "DB:infoFor" + session + " Returning full info for P1",
           "DB:infoFor" + session + " Can not find info for none",
           "DB:infos" + session + " Returning 3 item(s) for folder \"f\"",
           "DB:packMetadata" + session + " Returning pack metadata for P1",
           "DB:removePack" + session + " Deleted pack metadata for P1",
       }) {
    EXPECT_TRUE(log.contains(Log::Debug, line)) << line;
  }
  EXPECT_EQ(log.count("DB:removePack"), 1u);

  const auto s = "DB:updateUseInfo" + session + " Pack P ";
  db->packMetadata(useRequest("P", UseInfo::OpenForEdit, "ws-1", 0, ""));  // the server's own tools
  fetch(UseInfo::OpenForEdit, "ws-1", 42);
  fetch(UseInfo::CloseEdit, "ws-1", 42);
  fetch(UseInfo::CloseEdit, "ws-1", 43);
  fetch(UseInfo::LockForUpload, "A", 1);
  fetch(UseInfo::LockForUpload, "A", 2);
  refusal([&] { fetch(UseInfo::LockForUpload, "B", 3); });
  refusal([&] { fetch(UseInfo::EndUpload, "B", 4); });
  fetch(UseInfo::EndUpload, "A", 5);
  const std::vector<std::string> expected = {
      s + "opened for edit host \"ws-1\" CVSvc",
      s + "opened for edit host \"ws-1\" user \"u\" process 42",
      s + "closed host \"ws-1\" user \"u\" process 42",
      s + "close requested but lock not found host \"ws-1\" user \"u\" process 43",
      s + "sheduled for upload by host \"A\" user \"u\" process 1",
      s + "updating old upload lock by host \"A\" user \"u\" process 1",
      s + "sheduled for upload by host \"A\" user \"u\" process 2",
      s + "upload request denied - already uploading host \"B\" user \"u\" process 3",
      s + "failed to end upload host \"B\" user \"u\" process 4",
      s + "ended upload host \"A\" user \"u\" process 5",
  };
  std::vector<std::string> seen;
  for (const auto& e : log.entries()) {
    if (e.text.find("DB:updateUseInfo") == std::string::npos) continue;
    EXPECT_EQ(e.priority, Log::Debug);
    seen.push_back(e.text.substr(e.text.find("DB:updateUseInfo")));
  }
  EXPECT_EQ(seen, expected);
  EXPECT_TRUE(
      log.contains(Log::Debug, "DB:packMetadata" + session + " Returning pack metadata for P. Pack use updated"));
}

}  // namespace
