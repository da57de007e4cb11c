// Instances, sessions, the database file's identity, statements and long
// values on the engine layer.

#include <gtest/gtest.h>

#include <filesystem>
#include <numeric>
#include <vector>

#include "engine/blob_io.h"
#include "engine/database_file.h"
#include "engine_fixture.h"
#include "support/raw_db.h"

namespace {

namespace fs = std::filesystem;
using namespace engine_testing;
using testing_support::readFile;
using testing_support::writeFile;

// Writes a SQLite file with the given identity, in rollback-journal mode.
void writeSqliteFile(const fs::path& file, int applicationId, int version) {
  fs::create_directories(file.parent_path());
  testing_support::RawDb(file, true)
      .exec("PRAGMA application_id=" + std::to_string(applicationId) +
            "; PRAGMA user_version=" + std::to_string(version) + "; CREATE TABLE t(x); INSERT INTO t VALUES(42);");
}

using Sessions = EngineTest;

TEST_F(Sessions, CreatedDatabaseIsDurableAndAttachedByTheNextInstance) {
  const fs::path file = root() + "a/cvdb.edb";
  {
    auto instance = makeInstance("a");
    auto session = makeDatabase(instance);
    {
      // Connections log ahead and sync fully.
      auto mode = session->prepare("PRAGMA journal_mode");
      ASSERT_TRUE(mode.step());
      EXPECT_EQ(mode.columnText(0), "wal");
      auto sync = session->prepare("PRAGMA synchronous");
      ASSERT_TRUE(sync.step());
      EXPECT_EQ(sync.columnInt64(0), 2);
    }
    DB::runInTransaction(*session, [&] { session->prepare("UPDATE counter SET value = 7").run(); });
    EXPECT_EQ(instance->attachedDatabase(), file);
  }
  // The last connection has gone: its write-ahead log is folded in.
  EXPECT_FALSE(fs::exists(engine::walFile(file)));

  auto instance = makeInstance("a");
  auto first = instance->beginSession();
  EXPECT_EQ(first->attachDatabase(file), err::kSuccess);
  auto second = instance->beginSession();
  EXPECT_EQ(second->attachDatabase(file), err::kWrnDatabaseAttached);
  second->openDatabase();
  EXPECT_EQ(counter(*second), 7);
  EXPECT_EQ(codeOf([&] { second->attachDatabase(root() + "other/cvdb.edb"); }), err::kTooManyAttachedDatabases);
}

TEST_F(Sessions, CreationNeverReplacesAFileAndIgnoresLeftovers) {
  auto instance = makeInstance("dup");
  const fs::path file = root() + "dup/cvdb.edb";
  writeFile(file, "precious");
  auto session = instance->beginSession();
  EXPECT_EQ(codeOf([&] { session->createDatabase(file); }), err::kDatabaseDuplicate);
  EXPECT_EQ(readFile(file), "precious");
  EXPECT_FALSE(session->isOpen());

  // What an interrupted creation left behind does not stop the next one.
  const fs::path fresh = root() + "dup2/cvdb.edb";
  writeFile(fresh.string() + ".creating", "half-made");
  auto other = makeInstance("dup2")->beginSession();
  other->createDatabase(fresh);
  EXPECT_FALSE(fs::exists(fresh.string() + ".creating"));
  EXPECT_TRUE(other->isOpen());
  other->execute("CREATE TABLE t(x); INSERT INTO t VALUES(7);");
  other.reset();

  // A creation killed between its link and its unlink leaves a second name
  // of the live file, one killed earlier its half-made files: the next
  // first attach removes them and leaves the database whole.
  fs::create_hard_link(fresh, fresh.string() + ".creating");
  writeFile(fresh.string() + ".creating-wal", "half-made");
  auto reopened = makeInstance("dup2")->beginSession();
  reopened->attachDatabase(fresh);
  EXPECT_FALSE(fs::exists(fresh.string() + ".creating"));
  EXPECT_FALSE(fs::exists(fresh.string() + ".creating-wal"));
  auto row = reopened->prepare("SELECT x FROM t");
  ASSERT_TRUE(row.step());
  EXPECT_EQ(row.columnInt64(0), 7);
}

// Files that are not databases of this server are refused with their own
// code, and are left exactly as they were.
TEST_F(Sessions, ForeignFilesAreRefusedUntouched) {
  struct Case {
    const char* name;
    std::function<void(const fs::path&)> make;
    int code;
  };
  const std::vector<Case> cases{
      {"text", [](const fs::path& f) { writeFile(f, std::string(8192, 'x')); }, err::kInvalidDatabase},
      {"empty", [](const fs::path& f) { writeFile(f, ""); }, err::kInvalidDatabase},
      {"other application", [](const fs::path& f) { writeSqliteFile(f, 0, 3); }, err::kInvalidDatabase},
      {"newer format",
       [](const fs::path& f) { writeSqliteFile(f, engine::kApplicationId, engine::kFormatVersion + 1); },
       err::kInvalidDatabaseVersion},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string key = std::string("foreign") + std::to_string(&c - cases.data());
    const fs::path file = root() + key + "/cvdb.edb";
    c.make(file);
    const auto before = readFile(file);
    auto instance = makeInstance(key);
    auto session = instance->beginSession();
    EXPECT_EQ(codeOf([&] { session->attachDatabase(file); }), c.code);
    EXPECT_FALSE(instance->attachedDatabase());
    EXPECT_FALSE(session->isOpen());
    session.reset();
    EXPECT_TRUE(readFile(file) == before) << "the file was changed";
    EXPECT_FALSE(fs::exists(engine::walFile(file)));
  }
  auto session = makeInstance("none")->beginSession();
  EXPECT_EQ(codeOf([&] { session->attachDatabase(root() + "none/cvdb.edb"); }), err::kFileNotFound);
  EXPECT_EQ(codeOf([&] { session->openDatabase(); }), err::kDatabaseNotFound);
}

TEST_F(Sessions, InstanceStatesAndLimits) {
  engine::InstanceSettings settings = settingsFor("limits");
  settings.maxSessions = 2;
  auto instance = engine::Instance::create(settings);
  EXPECT_EQ(codeOf([&] { instance->beginSession(); }), err::kNotInitialized);
  EXPECT_FALSE(fs::exists(settings.logFolder));

  instance->init();
  EXPECT_TRUE(fs::is_directory(settings.instanceFolder));
  EXPECT_TRUE(fs::is_directory(settings.logFolder));
  auto one = instance->beginSession();
  auto two = instance->beginSession();
  EXPECT_EQ(codeOf([&] { instance->beginSession(); }), err::kOutOfSessions);
  EXPECT_EQ(instance->openSessions(), 2u);
  two.reset();
  auto three = instance->beginSession();
  EXPECT_NE(three->id(), one->id());

  instance->term();
  EXPECT_EQ(codeOf([&] { instance->beginSession(); }), err::kTermInProgress);
  EXPECT_EQ(codeOf([&] { one->createDatabase(root() + "limits/cvdb.edb"); }), err::kTermInProgress);
}

TEST_F(Sessions, StatementsAreResetAfterUseAndNestedUsesAreIndependent) {
  auto instance = makeInstance("stmts");
  auto writer = makeDatabase(instance);
  auto reader = openSession(instance);
  {
    DB::runInTransaction(*writer, [&] { writer->prepare("INSERT INTO counter VALUES(2, 20), (3, 30)").run(); });
    auto outer = reader->prepare("SELECT id FROM counter ORDER BY id");
    ASSERT_TRUE(outer.step());
    EXPECT_EQ(outer.columnInt64(0), 1);
    auto inner = reader->prepare("SELECT id FROM counter ORDER BY id");
    ASSERT_TRUE(inner.step());
    ASSERT_TRUE(inner.step());
    EXPECT_EQ(inner.columnInt64(0), 2);
    ASSERT_TRUE(outer.step());
    EXPECT_EQ(outer.columnInt64(0), 2);
  }
  // No statement of the reader kept its snapshot: it sees the next commit.
  DB::runInTransaction(*writer, [&] { writer->prepare("UPDATE counter SET value = 99 WHERE id = 1").run(); });
  EXPECT_EQ(counter(*reader), 99);
}

TEST_F(Sessions, LongValuesGoThroughBlobIoInChunks) {
  auto instance = makeInstance("blobs");
  auto session = makeDatabase(instance);
  std::vector<std::byte> value(2 * engine::kBlobChunkBytes + 12345);
  for (std::size_t i = 0; i < value.size(); ++i) value[i] = static_cast<std::byte>((i * 131) ^ (i >> 11));

  const std::int64_t rowid = DB::runInTransaction(*session, [&] {
    auto insert = session->prepare("INSERT INTO blobs(id, blob) VALUES(?, ?)");
    insert.bindBlob(1, std::string_view("big")).bindZeroBlob(2, static_cast<std::int64_t>(value.size())).run();
    const auto id = engine::findRowid(*session, "blobs", "id", "big");
    EXPECT_TRUE(id.has_value());
    engine::writeBlob(*session, "blobs", "blob", *id, value);
    return *id;
  });

  auto reader = openSession(instance);
  EXPECT_EQ(engine::findRowid(*reader, "blobs", "id", "big"), rowid);
  EXPECT_FALSE(engine::findRowid(*reader, "blobs", "id", "small"));
  EXPECT_EQ(engine::blobSize(*reader, "blobs", "blob", rowid), static_cast<std::int64_t>(value.size()));
  std::vector<std::byte> back(value.size());
  engine::readBlob(*reader, "blobs", "blob", rowid, back);
  EXPECT_EQ(back, value);

  std::vector<std::byte> part(10);
  engine::BlobStream stream(*reader, "blobs", "blob", rowid, false);
  stream.read(static_cast<std::int64_t>(value.size() - 10), part);
  EXPECT_TRUE(std::equal(part.begin(), part.end(), value.end() - 10));
  EXPECT_EQ(codeOf([&] { stream.read(static_cast<std::int64_t>(value.size() - 5), part); }), err::kInvalidParameter);

  std::vector<std::byte> wrongSize(5);
  EXPECT_EQ(codeOf([&] { engine::readBlob(*reader, "blobs", "blob", rowid, wrongSize); }), err::kInvalidParameter);
  EXPECT_EQ(codeOf([&] { engine::readBlob(*reader, "blobs", "blob", rowid + 100, wrongSize); }), err::kRecordNotFound);
  EXPECT_EQ(codeOf([&] { engine::findRowid(*reader, "blobs; DROP TABLE blobs", "id", "x"); }), err::kInvalidParameter);
  // Longer than SQLite stores in a row.
  EXPECT_EQ(
      codeOf([&] { session->prepare("INSERT INTO blobs(id, blob) VALUES(x'01', ?)").bindZeroBlob(1, 1'000'000'001); }),
      err::kColumnTooBig);
}

}  // namespace
