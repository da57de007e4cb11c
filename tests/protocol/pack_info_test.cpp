#include "protocol/pack_info.h"

#include <gtest/gtest.h>

namespace {

using Ipc::PackInfoPartial;
using Ipc::UseInfo;
using Ipc::UseInfos;

constexpr std::int64_t kNow = 1'700'000'000;

TEST(PackInfo, ValuesOfTheWrongTypeReadAsAbsentAndSurviveUpdates) {
  json::Object stored = json::strToObject(
      R"({"name": 5, "owner": null, "created": "yesterday", "modified": 1.5, "docCount": 99999999999,
          "uses": "garbage"})");
  const PackInfoPartial p(stored, Ipc::kUseLimitSeconds, kNow);
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
  UseInfos list;
  list.append(UseInfo(UseInfo::OpenForEdit, "h", "u", 1, kNow - 25200));    // exactly at the limit
  list.append(UseInfo(UseInfo::LockForUpload, "h", "u", 2, kNow - 25201));  // one second too old
  list.append(UseInfo(UseInfo::OpenForEdit, "h", "u", 3, kNow + 60));       // clock skew: kept
  json::Object obj;
  list.serialize(obj);

  const UseInfos limited(obj, Ipc::kUseLimitSeconds, kNow);
  ASSERT_EQ(limited.size(), 2u);
  EXPECT_EQ(limited[0].process, 1u);
  EXPECT_EQ(limited[1].process, 3u);
  EXPECT_EQ(limited.findUploadInf(), nullptr);  // the crashed uploader's lock is gone

  EXPECT_EQ(UseInfos(obj, 0, kNow).size(), 3u);  // no limit

  EXPECT_EQ(UseInfos(obj, Ipc::kUseLimitSeconds, kNow + 1).size(), 1u);  // a second later
}

TEST(UseInfos, MalformedStoredEntriesAreDropped) {
  const json::Object obj = json::strToObject(R"({"entries": [
      {"state": 0, "host": "ok", "user": "u", "process": 1, "time": 1700000000},
      {"state": 0, "host": 7, "time": 1700000000},
      {"state": "open", "host": "h", "time": 1700000000},
      {"state": 0, "host": "h"},
      {"state": 0, "host": "h", "process": -1, "time": 1700000000},
      {"state": 2, "host": "nouser", "time": 1700000000},
      17 ]})");
  const UseInfos list(obj, Ipc::kUseLimitSeconds, kNow);
  ASSERT_EQ(list.size(), 2u);
  EXPECT_EQ(list[0].host, "ok");
  EXPECT_EQ(list[1], UseInfo(UseInfo::LockForUpload, "nouser", "", 0, kNow));
  EXPECT_TRUE(UseInfos(json::Value(), Ipc::kUseLimitSeconds, kNow).empty());
}

}  // namespace
