#include "protocol/pack_info.h"

#include <gtest/gtest.h>

namespace {

using Ipc::PackInfo;
using Ipc::PackInfoPartial;
using Ipc::UseInfo;
using Ipc::UseInfos;

constexpr std::int64_t kNow = 1'700'000'000;

PackInfo completeRecord() {
  PackInfoPartial p;
  p.name = "Invoices March";
  p.owner = "anna";
  p.created = kNow - 100;
  p.modified = kNow;
  p.docCount = 42;
  p.uses.append(UseInfo(UseInfo::OpenForEdit, "host-a", "anna", 17, kNow - 10));
  p.uses.append(UseInfo(UseInfo::LockForUpload, "host-b", "", 0, kNow - 5));
  return PackInfo("P1", "2024/03", 3, p);
}

// Writes a record the way the store does: its fields, then its use list
// under the use key.
json::Object store(const PackInfo& p, json::Object obj = json::Object()) {
  p.serializeDBUpdate(obj);
  json::Object uses;
  p.uses.serialize(uses);
  obj.set(PackInfoPartial::USE_FIELD_NAME, uses);
  return obj;
}

TEST(PackInfo, StoredObjectSurvivesAWriteAndARead) {
  Ipc::FixedUseClock clock(kNow);
  const PackInfo original = completeRecord();
  const json::Object stored = json::strToObject(store(original).dump());

  const PackInfo back(original.id(), original.folder(), original.status(),
                      PackInfoPartial(stored, Ipc::kUseLimitSeconds));
  EXPECT_EQ(back, original);
  EXPECT_TRUE(back.allValid());
}

TEST(PackInfo, PresenceOfFields) {
  PackInfo p("P1");
  EXPECT_FALSE(p.folderValid());
  EXPECT_FALSE(p.statusValid());
  EXPECT_FALSE(p.allValid());
  p.setFolder("");  // an empty folder is a present folder
  EXPECT_TRUE(p.folderValid());

  PackInfo almost = completeRecord();
  almost.docCount = PackInfoPartial::LONG_INVALID;
  EXPECT_FALSE(almost.allValid());
  almost = completeRecord();
  almost.setStatus(PackInfoPartial::LONG_INVALID);
  EXPECT_FALSE(almost.allValid());
}

TEST(PackInfo, PartialUpdateWritesOnlyPresentFieldsAndKeepsForeignKeys) {
  json::Object stored = store(completeRecord());
  stored.set("futureField", json::Value::string("kept"));
  stored.set("created", json::Value::integer(kNow - 100));

  PackInfo update("P1");
  update.name = "Renamed";
  update.docCount = 0;
  update.uses.append(UseInfo(UseInfo::CloseEdit, "host-a", "anna", 17));
  update.serializeDBUpdate(stored);

  EXPECT_EQ(stored.get("name").asString(), "Renamed");
  EXPECT_EQ(stored.get("docCount").asInteger(), 0);
  EXPECT_EQ(stored.get("owner").asString(), "anna");
  EXPECT_EQ(stored.get("modified").asInteger(), kNow);
  EXPECT_EQ(stored.get("futureField").asString(), "kept");
  // The use list is the store's to change, not serializeDBUpdate's.
  Ipc::FixedUseClock clock(kNow);
  EXPECT_EQ(UseInfos(stored.get(PackInfoPartial::USE_FIELD_NAME), 0).size(), 2u);
  // Columns are not part of the object.
  EXPECT_FALSE(stored.has("id"));
  EXPECT_FALSE(stored.has("folder"));
  EXPECT_FALSE(stored.has("status"));
}

TEST(PackInfo, ValuesOfTheWrongTypeReadAsAbsentAndSurviveUpdates) {
  json::Object stored = json::strToObject(
      R"({"name": 5, "owner": null, "created": "yesterday", "modified": 1.5, "docCount": 99999999999,
          "uses": "garbage"})");
  const PackInfoPartial p(stored, Ipc::kUseLimitSeconds);
  EXPECT_EQ(p.name, PackInfoPartial::STR_INVALID);
  EXPECT_EQ(p.owner, PackInfoPartial::STR_INVALID);
  EXPECT_EQ(p.created, PackInfoPartial::TIME_INVALID);
  EXPECT_EQ(p.modified, PackInfoPartial::TIME_INVALID);
  EXPECT_EQ(p.docCount, PackInfoPartial::LONG_INVALID);
  EXPECT_TRUE(p.uses.empty());

  const std::string before = stored.dump();
  p.serializeDBUpdate(stored);
  EXPECT_EQ(stored.dump(), before);
}

TEST(UseInfos, ReadingDropsEntriesOlderThanTheLimit) {
  Ipc::FixedUseClock clock(kNow);
  UseInfos list;
  list.append(UseInfo(UseInfo::OpenForEdit, "h", "u", 1, kNow - 25200));      // exactly at the limit
  list.append(UseInfo(UseInfo::LockForUpload, "h", "u", 2, kNow - 25201));    // one second too old
  list.append(UseInfo(UseInfo::OpenForEdit, "h", "u", 3, kNow + 60));         // clock skew: kept
  json::Object obj;
  list.serialize(obj);

  const UseInfos limited(obj, Ipc::kUseLimitSeconds);
  ASSERT_EQ(limited.size(), 2u);
  EXPECT_EQ(limited[0].process, 1u);
  EXPECT_EQ(limited[1].process, 3u);
  EXPECT_EQ(limited.findUploadInf(), nullptr);  // the crashed uploader's lock is gone

  EXPECT_EQ(UseInfos(obj, 0).size(), 3u);  // no limit

  clock.advance(1);
  EXPECT_EQ(UseInfos(obj, Ipc::kUseLimitSeconds).size(), 1u);
}

TEST(UseInfos, MalformedStoredEntriesAreDropped) {
  Ipc::FixedUseClock clock(kNow);
  const json::Object obj = json::strToObject(R"({"entries": [
      {"state": 0, "host": "ok", "user": "u", "process": 1, "time": 1700000000},
      {"state": 0, "host": 7, "time": 1700000000},
      {"state": "open", "host": "h", "time": 1700000000},
      {"state": 0, "host": "h"},
      {"state": 0, "host": "h", "process": -1, "time": 1700000000},
      {"state": 2, "host": "nouser", "time": 1700000000},
      17 ]})");
  const UseInfos list(obj, Ipc::kUseLimitSeconds);
  ASSERT_EQ(list.size(), 2u);
  EXPECT_EQ(list[0].host, "ok");
  EXPECT_EQ(list[1], UseInfo(UseInfo::LockForUpload, "nouser", "", 0, kNow));
  EXPECT_TRUE(UseInfos(json::Value(), Ipc::kUseLimitSeconds).empty());
}

TEST(UseInfos, FindRemoveAndUploadLock) {
  UseInfos list;
  list.append(UseInfo(UseInfo::OpenForEdit, "a", "u", 1, kNow));
  list.append(UseInfo(UseInfo::OpenForEdit, "a", "u", 1, kNow + 1));  // same process twice
  list.append(UseInfo(UseInfo::LockForUpload, "b", "u", 9, kNow));
  list.append(UseInfo(UseInfo::OpenForEdit, "A", "u", 1, kNow));

  const UseInfo* e = list.find("a", 1, UseInfo::OpenForEdit);
  ASSERT_NE(e, nullptr);
  EXPECT_EQ(e->time, kNow);
  EXPECT_EQ(list.find("a", 2, UseInfo::OpenForEdit), nullptr);
  EXPECT_EQ(list.find("b", 9, UseInfo::OpenForEdit), nullptr);
  ASSERT_NE(list.findUploadInf(), nullptr);
  EXPECT_EQ(list.findUploadInf()->host, "b");

  EXPECT_TRUE(list.remove(e));
  ASSERT_EQ(list.size(), 3u);
  EXPECT_EQ(list.find("a", 1, UseInfo::OpenForEdit)->time, kNow + 1);  // one close removes one entry
  EXPECT_TRUE(list.remove(list.findUploadInf()));
  EXPECT_EQ(list.findUploadInf(), nullptr);

  const UseInfo stranger;
  EXPECT_FALSE(list.remove(&stranger));
  EXPECT_EQ(list.size(), 2u);

  const UseInfo stamped(UseInfo(UseInfo::OpenForEdit, "h", "u", 3), kNow);
  EXPECT_EQ(stamped.time, kNow);
  EXPECT_EQ(stamped.host, "h");
}

}  // namespace
