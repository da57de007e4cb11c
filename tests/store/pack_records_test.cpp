// Pack records and contents in the store: what a complete and a partial
// record write, what survives an update, the order and ranges of listings
// (and that they come from the index), contents, erasure, and that a
// refused or failed request leaves nothing behind.

#include <gtest/gtest.h>

#include <random>

#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "store_fixture.h"
#include "support/log_capture.h"

namespace {

using Ipc::PackInfo;
using Ipc::PackInfoPartial;
using store_testing::complete;
using store_testing::storedRecord;
using store_testing::StoreTest;
using store_testing::useRequest;
using testing_support::LogCapture;
using testing_support::RawDb;
using testing_support::VerboseLog;

std::string contentOf(DB::DBLocal& db, const std::string& id) {
  return std::string(db.packMetadata(PackInfo(id)).content.view());
}

void save(DB::DBLocal& db, const PackInfo& p, const std::string& content) {
  db.savePackMeta(p, content.data(), content.size());
}

std::vector<std::string> idsOf(const Ipc::PackInfos& list) {
  std::vector<std::string> ids;
  for (const auto& p : list) ids.push_back(p.id());
  return ids;
}

std::string missingRecord(const std::string& id) {
  return "Pack information update attempted for missing record. Id:" + id;
}

using PackRecords = StoreTest;

TEST_F(PackRecords, ACompleteRecordCreatesAPackAndAPartialOneChangesOnlyItsFields) {
  auto db = open("p");
  const PackInfo full = complete("P1", "inbox", 4, "March");
  const auto written = db->updateInfo(full);
  // The answer of a plain update: the id and the status as written.
  ASSERT_NE(written, nullptr);
  EXPECT_EQ(*written, [] {
    PackInfo p("P1");
    p.setStatus(4);
    return p;
  }());
  const auto read = db->infoFor("P1");
  ASSERT_NE(read, nullptr);
  EXPECT_EQ(*read, full);

  // Only the status: folder and every other field keep their values, the
  // answer carries the new status and nothing else.
  PackInfo statusOnly("P1");
  statusOnly.setStatus(9);
  const auto afterStatus = db->updateInfo(statusOnly);
  EXPECT_EQ(afterStatus->status(), 9);
  EXPECT_FALSE(afterStatus->folderValid());
  EXPECT_EQ(afterStatus->name, PackInfoPartial::STR_INVALID);
  PackInfo expected = full;
  expected.setStatus(9);
  EXPECT_EQ(*db->infoFor("P1"), expected);

  // Only the name and the folder: the answer has the stored status.
  PackInfo renamed("P1");
  renamed.name = "April";
  renamed.setFolder("done");
  EXPECT_EQ(db->updateInfo(renamed)->status(), 9);
  expected.name = "April";
  expected.setFolder("done");
  EXPECT_EQ(*db->infoFor("P1"), expected);
  EXPECT_TRUE(db->infos("inbox")->empty());
  EXPECT_EQ(idsOf(*db->infos("done")), std::vector<std::string>{"P1"});

  // Another session sees the committed record.
  EXPECT_EQ(*open("p")->infoFor("P1"), expected);
}

TEST_F(PackRecords, KeysTheStoredObjectDoesNotKnowSurviveUpdatesAndUseChanges) {
  auto db = open("p");
  db->updateInfo(complete("P1", "f", 1));
  RawDb raw(db->dbFile());
  json::Object stored = storedRecord(raw, "P1");
  stored.set("reviewer", json::Value::string("bo"));        // written by a later version
  stored.set("created", json::Value::string("yesterday"));  // of the wrong type
  raw.value("UPDATE info SET blob = ?2 WHERE id = ?1", {"P1", stored.dump()});

  EXPECT_EQ(db->infoFor("P1")->created, PackInfoPartial::TIME_INVALID);
  PackInfo partial("P1");
  partial.docCount = 12;
  db->updateInfo(partial);
  db->packMetadata(useRequest("P1", Ipc::UseInfo::OpenForEdit, "ws-1"));
  db->packMetadata(useRequest("P1", Ipc::UseInfo::CloseEdit, "ws-1"));

  const json::Object after = storedRecord(raw, "P1");
  EXPECT_EQ(after.get("reviewer"), json::Value::string("bo"));
  EXPECT_EQ(after.get("created"), json::Value::string("yesterday"));
  EXPECT_EQ(after.get("docCount"), json::Value::integer(12));
  EXPECT_EQ(after.get("name"), json::Value::string("name"));
}

TEST_F(PackRecords, AMissingPackIsCreatedOnlyByACompleteRecordAndAClosingOfItChangesNothing) {
  auto db = open("p");
  PackInfo partial = complete("P2", "f", 1);
  partial.docCount = PackInfoPartial::LONG_INVALID;  // one field short
  try {
    db->updateInfo(partial);
    FAIL() << "accepted";
  } catch (const DB::DBExc& e) {
    EXPECT_STREQ(e.what(), missingRecord("P2").c_str());
    EXPECT_EQ(e.code(), DB::DBExc::kTextCode);
  }
  EXPECT_THROW(save(*db, partial, "content"), DB::DBExc);
  // An open needs a record as well.
  EXPECT_THROW(db->packMetadata(useRequest("P2", Ipc::UseInfo::OpenForEdit, "ws-1")), DB::DBExc);
  EXPECT_EQ(db->infoFor("P2"), nullptr);
  EXPECT_TRUE(db->infos("")->empty());
  EXPECT_TRUE(db->loadMetaBlob("P2").empty());

  // Closing a missing pack is accepted and changes nothing: a
  // configuration part under the same key must neither be overwritten nor
  // handed out as a pack's content.
  const std::string part = R"({"kept":true})";
  db->saveMetaBlob(part.data(), part.size(), "P3");
  const auto close = useRequest("P3", Ipc::UseInfo::CloseEdit, "ws-1");
  EXPECT_EQ(db->updateInfo(close), nullptr);
  const auto fetched = db->packMetadata(close);
  EXPECT_EQ(fetched.info, nullptr);
  EXPECT_TRUE(fetched.content.empty());
  save(*db, close, "would be lost");
  EXPECT_EQ(db->infoFor("P3"), nullptr);
  EXPECT_EQ(db->loadMetaBlob("P3").view(), part);
  EXPECT_TRUE(db->packMetadata(PackInfo("P3")).content.empty());
}

TEST_F(PackRecords, ListingsComeInFolderStatusIdOrderAndAFolderIsExact) {
  auto db = open("p");
  // Inserted out of order; folders that share a prefix, a non-ASCII
  // folder (bytes above 0x7f sort last), the empty folder, negative
  // statuses.
  const std::vector<std::tuple<std::string, std::string, std::int32_t>> rows = {
      {"c", "A", 2}, {"a", "AB", 0}, {"b", "A", -5}, {"e", "\xC3\xA4", 1}, {"d", "A", 2},
      {"f", "", 7},  {"g", "B", 3},  {"h", "A", 1},  {"i", "Ab", 0},
  };
  for (const auto& [id, folder, status] : rows) db->updateInfo(complete(id, folder, status));

  EXPECT_EQ(idsOf(*db->infos("A")), (std::vector<std::string>{"b", "h", "c", "d"}));
  EXPECT_EQ(idsOf(*db->infos("")), (std::vector<std::string>{"f", "b", "h", "c", "d", "a", "i", "g", "e"}));
  EXPECT_EQ(idsOf(*db->infos("\xC3\xA4")), std::vector<std::string>{"e"});
  EXPECT_TRUE(db->infos("C")->empty());
  EXPECT_TRUE(db->infos("a")->empty());  // folders compare as bytes, case included
  const auto all = db->infos("");
  for (const auto& p : *all) EXPECT_TRUE(p.allValid()) << p.id();
}

TEST_F(PackRecords, ContentsAreReplacedWholeAndErasedWithTheirRecord) {
  auto db = open("p");
  // Both sides of the limit between bound and streamed values.
  std::string big(static_cast<std::size_t>(DB::DBLocal::kInlineValueBytes) * 3 + 17, '\0');
  std::mt19937 gen(5);
  for (auto& c : big) c = static_cast<char>(gen());
  save(*db, complete("P1", "f", 1), big);
  EXPECT_EQ(contentOf(*db, "P1"), big);
  PackInfo statusOnly("P1");
  statusOnly.setStatus(2);
  save(*db, statusOnly, "second");
  EXPECT_EQ(contentOf(*db, "P1"), "second");
  save(*db, statusOnly, big);
  const auto fetched = db->packMetadata(PackInfo("P1"));
  ASSERT_NE(fetched.info, nullptr);
  EXPECT_EQ(fetched.info->status(), 2);
  EXPECT_TRUE(fetched.info->allValid());
  EXPECT_EQ(fetched.content.view(), big);

  // A record without content fetches as the record and no bytes.
  db->updateInfo(complete("P2", "f", 1));
  const auto bare = db->packMetadata(PackInfo("P2"));
  ASSERT_NE(bare.info, nullptr);
  EXPECT_TRUE(bare.content.empty());

  db->removePack("P1");
  const auto gone = db->packMetadata(PackInfo("P1"));
  EXPECT_EQ(gone.info, nullptr);
  EXPECT_TRUE(gone.content.empty());
  EXPECT_TRUE(db->loadMetaBlob("P1").empty());
  EXPECT_EQ(idsOf(*db->infos("")), std::vector<std::string>{"P2"});

  // Erasing what has no record is silent and leaves a value of that key.
  db->saveMetaBlob("x", 1, "cfg");
  EXPECT_NO_THROW(db->removePack("cfg"));
  EXPECT_NO_THROW(db->removePack("P1"));
  EXPECT_EQ(db->loadMetaBlob("cfg").view(), "x");
}

TEST_F(PackRecords, AWriteTheEngineRefusesLeavesRecordAndContentAsTheyWere) {
  auto db = open("p");
  const PackInfo first = complete("P1", "f", 1);
  save(*db, first, "first");
  PackInfo changed("P1");
  changed.setStatus(5);
  changed.name = "changed";

  // The content is written after the record: a refused content must take
  // the record's new fields back with it.
  RawDb raw(db->dbFile());
  raw.exec(
      "CREATE TRIGGER no_update BEFORE UPDATE ON meta BEGIN SELECT RAISE(ABORT, 'refused'); END;"
      "CREATE TRIGGER no_insert BEFORE INSERT ON meta BEGIN SELECT RAISE(ABORT, 'refused'); END");
  EXPECT_THROW(save(*db, changed, "second"), DB::DBExc);
  raw.exec("DROP TRIGGER no_update; DROP TRIGGER no_insert");
  EXPECT_EQ(*db->infoFor("P1"), first);
  EXPECT_EQ(contentOf(*db, "P1"), "first");

  // Values beyond the columns' limits.
  PackInfo longFolder = changed;
  longFolder.setFolder(std::string(51, 'x'));
  try {
    save(*db, longFolder, "second");
    FAIL() << "accepted";
  } catch (const DB::DBExc& e) {
    EXPECT_EQ(e.code(), DB::err::kInvalidParameter);
  }
  EXPECT_THROW(save(*db, complete(std::string(51, 'i'), "f", 1), "c"), DB::DBExc);
  EXPECT_EQ(*db->infoFor("P1"), first);
  EXPECT_EQ(contentOf(*db, "P1"), "first");
  EXPECT_EQ(db->infos("")->size(), 1u);

  // The session is usable afterwards.
  save(*db, changed, "third");
  EXPECT_EQ(db->infoFor("P1")->name, "changed");
  EXPECT_EQ(contentOf(*db, "P1"), "third");
}

}  // namespace
