// The cvdb tool against the real server: what it prints and which exit
// status it gives, for every command, for the server's refusals and for a
// server that cannot be reached.

#include <gtest/gtest.h>

#include "e2e_support.h"
#include "support/temp_dir.h"

namespace {

using namespace e2e;
using testing_support::readFile;
using testing_support::writeFile;

TEST(CvdbTool, PingsAndListsDatabases) {
  ServerProcess server(kServer);
  const Tool cvdb = toolOf(server);
  EXPECT_TRUE(has(ok(cvdb({"ping"})), "pong from 127.0.0.1:" + std::to_string(server.port())));
  EXPECT_TRUE(ok(cvdb({"--json", "ping"})).starts_with("{\"ok\":true,\"ms\":"));
  EXPECT_EQ(ok(cvdb({"--json", "dbs"})), "[]\n");
}

TEST(CvdbTool, ConfigurationPartsAndDataFilesFromFilesAndBack) {
  ServerProcess server(kServer);
  const Tool cvdb = toolOf(server, {"--db", "Plant\\Line 2"});
  testing_support::TempDir dir;
  std::string content(300000, '\0');
  for (std::size_t i = 0; i < content.size(); ++i) content[i] = static_cast<char>(i * 7 + 3);
  writeFile(dir / "in.bin", content);
  writeFile(dir / "part.json", R"({"columns": ["id", "name"], "width": 3})");

  ok(cvdb({"cfg", "set", "layout", "--file", (dir / "part.json").string()}));
  ok(cvdb({"cfg", "set", "other", R"({"a": 1})"}));
  EXPECT_EQ(ok(cvdb({"--json", "cfg", "get", "layout"})), "{\"columns\":[\"id\",\"name\"],\"width\":3}\n");
  EXPECT_EQ(ok(cvdb({"--json", "cfg", "ls", "lay"})), "[\"layout\"]\n");
  ok(cvdb({"cfg", "rm", "layout"}));
  EXPECT_EQ(ok(cvdb({"--json", "cfg", "get", "layout"})), "null\n");

  ok(cvdb({"data", "put", "doc-1", "scan.bin", (dir / "in.bin").string()}));
  ok(cvdb({"data", "get", "doc-1", "scan.bin", "-o", (dir / "out.bin").string()}));
  EXPECT_EQ(readFile(dir / "out.bin"), content);
  EXPECT_EQ(ok(toolOf(server)({"--json", "dbs"})), "[\"plant\\\\line 2\"]\n");
}

TEST(CvdbTool, EveryPackCommand) {
  ServerProcess server(kServer);
  const Tool cvdb = toolOf(server, {"--db", "Tool"});
  testing_support::TempDir dir;
  writeFile(dir / "content.bin", "pack bytes");

  EXPECT_TRUE(has(ok(cvdb({"pack", "save", "P1", "--folder", "inbox", "--status", "3", "--name", "March", "--content",
                           (dir / "content.bin").string()})),
                  "saved \"P1\" with 10 bytes"));
  ok(cvdb({"pack", "save", "P2", "--folder", "inbox", "--status", "1", "--content", (dir / "content.bin").string()}));

  const std::string table = ok(cvdb({"pack", "ls", "inbox"}));
  EXPECT_TRUE(has(table, "ID")) << table;
  EXPECT_LT(table.find("P2"), table.find("P1")) << table;  // status order
  EXPECT_TRUE(has(table, "March")) << table;
  EXPECT_TRUE(json::strToValue(ok(cvdb({"--json", "pack", "ls"}))).isArray());
  EXPECT_EQ(json::strToValue(ok(cvdb({"--json", "pack", "ls", "nowhere"}))).dump(), "[]");

  const json::Object info = json::strToObject(ok(cvdb({"--json", "pack", "info", "P1"})));
  EXPECT_EQ(info.get("folder"), json::Value::string("inbox"));
  EXPECT_EQ(info.get("status"), json::Value::integer(3));
  EXPECT_EQ(ok(cvdb({"--json", "pack", "info", "none"})), "null\n");
  const json::Object updated = json::strToObject(ok(cvdb({"--json", "pack", "update", "P1", "--status", "8"})));
  EXPECT_EQ(updated.get("status"), json::Value::integer(8));

  // Fetch into a file while opening for edit; the record goes to standard
  // output then.
  const std::string opened = ok(cvdb({"--json", "pack", "get", "P1", "--open-for-edit", "--host", "ws-7", "--process",
                                      "77", "-o", (dir / "out.bin").string()}));
  EXPECT_EQ(readFile(dir / "out.bin"), "pack bytes");
  EXPECT_TRUE(has(opened, "\"host\":\"ws-7\"")) << opened;
  EXPECT_TRUE(has(opened, "\"process\":77")) << opened;
  EXPECT_TRUE(has(ok(cvdb({"pack", "get", "P2"})), "pack bytes"));

  EXPECT_TRUE(has(ok(cvdb({"pack", "lock", "P1", "--host", "scan-1"})), "locked \"P1\" for host \"scan-1\""));
  EXPECT_EQ(cvdb({"pack", "lock", "P1", "--host", "scan-2"}).status, 1);
  EXPECT_TRUE(has(ok(cvdb({"pack", "info", "P1"})), "LockForUpload host \"scan-1\""));
  EXPECT_TRUE(has(ok(cvdb({"pack", "unlock", "P1", "--host", "scan-1"})), "unlocked \"P1\" for host \"scan-1\""));
  EXPECT_EQ(cvdb({"pack", "unlock", "P1", "--host", "scan-1"}).status, 1);
  ok(cvdb({"pack", "get", "P1", "--close", "--host", "ws-7", "--process", "77", "-o", (dir / "out.bin").string()}));
  EXPECT_TRUE(has(ok(cvdb({"pack", "info", "P1"})), "uses:      none"));

  ok(cvdb({"data", "put", "doc-1", "a.txt", (dir / "content.bin").string()}));
  EXPECT_TRUE(has(ok(cvdb({"pack", "change-id", "doc-1", "doc-2"})), "copied the data of \"doc-1\" to \"doc-2\""));
  ok(cvdb({"data", "get", "doc-2", "a.txt", "-o", (dir / "copied.bin").string()}));
  EXPECT_EQ(readFile(dir / "copied.bin"), "pack bytes");

  EXPECT_TRUE(has(ok(cvdb({"pack", "rm", "P1"})), "erased \"P1\""));
  EXPECT_TRUE(has(ok(cvdb({"pack", "info", "P1"})), "no pack \"P1\""));
}

// 1: the server refused or ended the connection; 2: a local mistake, found
// before the server is contacted; 3: no server.
// Cleanup end to end: progress lines (or JSON lines), the used ids from the
// command line and from a file, old unused data gone and the rest kept; a
// connection without a database gets the failure as its stream's last
// message and exit status 1.
TEST(CvdbTool, CleanupRemovesOldUnusedDataWithProgress) {
  ServerProcess server(kServer);
  const Tool cvdb = toolOf(server, {"--db", "docs"});
  testing_support::TempDir dir;
  writeFile(dir / "page", "p");
  for (const char* id : {"old", "kept-by-option", "kept-by-file", "young"}) {
    ok(cvdb({"data", "put", id, "page", (dir / "page").string()}));
  }
  const auto data = server.home() / "db" / "docs" / "d";
  const auto old = std::filesystem::file_time_type::clock::now() - std::chrono::hours(7);
  for (const char* id : {"old", "kept-by-option", "kept-by-file"}) std::filesystem::last_write_time(data / id, old);
  writeFile(dir / "used.txt", "kept-by-file\n");

  const std::string out = ok(cvdb({"cleanup", "--used", "kept-by-option", "--used-file", (dir / "used.txt").string()}));
  EXPECT_TRUE(has(out, "Starting Database Cleanup...")) << out;
  EXPECT_TRUE(has(out, "Erasing unused data...")) << out;
  EXPECT_TRUE(has(out, "Removing data chunks 100% complete (4/4), 1 erased")) << out;
  EXPECT_FALSE(std::filesystem::exists(data / "old"));
  for (const char* id : {"kept-by-option", "kept-by-file", "young"})
    EXPECT_TRUE(std::filesystem::exists(data / id)) << id;
  EXPECT_TRUE(
      server.waitForLogLine("Database \"docs\" cleaned. 1 unused ids deleted, 1 unused ids too recent to clean"));
  EXPECT_TRUE(has(ok(cvdb({"--json", "cleanup"})), "{\"percent\":0,\"text\":\"Erasing unused data...\"}"));

  auto unbound = clientOf(server);
  std::vector<std::string> seen;
  try {
    unbound->cleanup({}, [&](std::uint32_t, const std::string& text) { seen.push_back(text); });
    ADD_FAILURE() << "a cleanup without a database succeeded";
  } catch (const cvdb::OperationFailed& e) {
    EXPECT_EQ(
        e.reason(),
        "DB operation failed with error: No database associated with current connection. Connect command failed?");
  }
  EXPECT_EQ(seen.front(), "Starting Database Cleanup...");
  EXPECT_TRUE(server.waitForLogLine("Async command Cleanup failed with No database associated"));
}

// Backup end to end: the archive of one database, and of every database,
// in the backup folder, readable by a standard tool.
TEST(CvdbTool, BackupWritesArchivesThatStandardToolsRead) {
  ServerProcess server(kServer);
  const Tool cvdb = toolOf(server, {"--db", "Plant\\Line 2"});
  testing_support::TempDir dir;
  writeFile(dir / "page", "scanned page");
  ok(cvdb({"cfg", "set", "layout", R"({"a": 1})"}));
  ok(cvdb({"data", "put", "doc-1", "page", (dir / "page").string()}));
  ok(toolOf(server, {"--db", "other"})({"cfg", "set", "x", "{}"}));

  const std::string out = ok(cvdb({"backup"}));
  EXPECT_TRUE(has(out, "Starting Database Backup...")) << out;
  EXPECT_TRUE(has(out, "Compressing binaries 100% complete (1/1)")) << out;
  const auto folder = server.home() / "db" / "db.backup";
  const auto archive = folder / "plant_line 2.cvbak";
  ASSERT_TRUE(std::filesystem::exists(archive)) << out;
  const auto test = ServerProcess::run("/usr/bin/unzip", {"-t", archive.string()});
  EXPECT_EQ(test.status, 0) << test.output;
  EXPECT_TRUE(has(test.output, "d\\doc-1\\page")) << test.output;

  ok(cvdb({"backup", (dir / "all").string(), "--all"}));
  EXPECT_TRUE(std::filesystem::exists(dir / "all" / "plant_line 2.cvbak"));
  EXPECT_TRUE(std::filesystem::exists(dir / "all" / "other.cvbak"));
}

// Restore end to end: one database from its default archive, every
// archive of a folder into the database each names, and a Connect to a
// database while it is being restored.
TEST(CvdbTool, RestoreBringsBackWhatTheArchivesHold) {
  ServerProcess server(kServer);
  const Tool cvdb = toolOf(server, {"--db", "Plant\\Line 2"});
  const Tool other = toolOf(server, {"--db", "other"});
  testing_support::TempDir dir;
  writeFile(dir / "page", "scanned page");
  writeFile(dir / "changed", "changed page");
  ok(cvdb({"cfg", "set", "layout", R"({"a": 1})"}));
  ok(cvdb({"data", "put", "doc-1", "page", (dir / "page").string()}));
  ok(other({"cfg", "set", "x", R"({"v": 1})"}));
  ok(cvdb({"backup"}));
  ok(cvdb({"backup", (dir / "all").string(), "--all"}));

  ok(cvdb({"cfg", "set", "layout", R"({"a": 2})"}));
  ok(cvdb({"data", "put", "doc-1", "page", (dir / "changed").string()}));
  ok(other({"cfg", "set", "x", R"({"v": 2})"}));

  const std::string out = ok(cvdb({"restore"}));
  EXPECT_TRUE(has(out, "Starting Database Restore...")) << out;
  EXPECT_TRUE(has(out, "Replacing binaries...")) << out;
  EXPECT_EQ(ok(cvdb({"--json", "cfg", "get", "layout"})), "{\"a\":1}\n");
  ok(cvdb({"data", "get", "doc-1", "page", "-o", (dir / "back").string()}));
  EXPECT_EQ(readFile(dir / "back"), "scanned page");
  EXPECT_EQ(ok(other({"--json", "cfg", "get", "x"})), "{\"v\":2}\n");  // untouched

  ok(cvdb({"cfg", "set", "layout", R"({"a": 3})"}));
  ok(cvdb({"restore", (dir / "all").string(), "--all"}));
  EXPECT_EQ(ok(cvdb({"--json", "cfg", "get", "layout"})), "{\"a\":1}\n");
  EXPECT_EQ(ok(other({"--json", "cfg", "get", "x"})), "{\"v\":1}\n");
  EXPECT_TRUE(server.waitForLogLine("Database restored for \"other\""));

  // A restore long enough to be caught in the act: a Connect to the
  // database meanwhile ends that connection, and the restore goes on.
  std::string big(8 << 20, '\0');
  std::uint32_t x = 1;
  for (char& c : big) c = static_cast<char>((x = x * 1103515245 + 12345) >> 24);
  writeFile(dir / "big", big);
  for (int i = 0; i < 6; ++i) ok(cvdb({"data", "put", "big", "f" + std::to_string(i), (dir / "big").string()}));
  ok(cvdb({"backup"}));
  auto restorer = clientOf(server, "Plant\\Line 2");
  std::string reason;
  restorer->restore("", false, [&](std::uint32_t, const std::string& text) {
    if (text == "Starting decompression ..." && reason.empty()) {
      auto late = clientOf(server);
      reason = endedBy([&] { late->connect("Plant\\Line 2"); });
    }
  });
  EXPECT_EQ(reason, kTerminating);
  EXPECT_TRUE(server.waitForLogLine("Database not accessible! Possible restore operation in progress."));
  EXPECT_EQ(ok(cvdb({"--json", "cfg", "get", "layout"})), "{\"a\":1}\n");
}

TEST(CvdbTool, RefusalsLocalMistakesAndAnUnreachableServerHaveTheirOwnStatus) {
  std::uint16_t port;
  {
    ServerProcess server(kServer);
    port = server.port();
    const Tool cvdb = toolOf(server);
    const std::vector<std::tuple<std::vector<std::string>, int, std::string>> cases = {
        {{"--db", "nowhere", "--open-mode", "1", "cfg", "ls"}, 1, "cvdb: Database nowhere does not exist"},
        {{"--db", "..", "cfg", "ls"}, 1, "Database name .. is not valid"},
        // Bound to a database without opening it: the command fails on the
        // server, which ends the connection.
        {{"--db", "demo", "--open-mode", "2", "cfg", "get", "layout"},
         1,
         "cvdb: the server ended the connection: Terminating client connection due to processing error"},
        {{"pack", "info", "P1"}, 2, "needs --db NAME"},
        {{"--db", "demo", "cfg", "set", "k", "[1,2]"}, 2, ""},
        {{"no-such-subcommand"}, 2, ""},
    };
    for (const auto& [args, status, text] : cases) {
      const auto r = cvdb(args);
      EXPECT_EQ(r.status, status) << r.output;
      EXPECT_TRUE(has(r.output, text)) << r.output;
    }
    EXPECT_TRUE(server.waitForLogLine("Dispatching command "));
  }
  const auto r = Tool{{"--port", std::to_string(port)}}({"ping"});
  EXPECT_EQ(r.status, 3) << r.output;
  EXPECT_TRUE(has(r.output, "cannot connect")) << r.output;
}

}  // namespace

// With MaintenanceFolders set, a client can name no path outside them (or
// the backup folder) for a backup or a restore: refused before anything is
// read or written.
TEST(CvdbTool, MaintenanceFoldersConfineBackupsAndRestores) {
  testing_support::TempDir dir;
  const auto allowed = dir.path() / "allowed";
  const auto outside = dir.path() / "outside";
  std::filesystem::create_directories(allowed);
  std::filesystem::create_directories(outside);
  testing_support::ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "MaintenanceFolders": [")" + allowed.string() + R"("]})";
  ServerProcess server(kServer, o);
  EXPECT_TRUE(server.waitForLogLine("Backup and restore are confined to"));
  const Tool cvdb = toolOf(server, {"--db", "docs"});
  ok(cvdb({"cfg", "set", "layout", R"({"v": 1})"}));

  const auto refusedBy = [&](const std::vector<std::string>& args) {
    const auto r = cvdb(args);
    EXPECT_EQ(r.status, 1) << r.output;
    return has(r.output, "lies outside the folders that MaintenanceFolders allows");
  };
  EXPECT_TRUE(refusedBy({"backup", (outside / "docs.cvbak").string()}));
  EXPECT_TRUE(refusedBy({"backup", (allowed / ".." / "outside" / "docs.cvbak").string()}));
  EXPECT_TRUE(refusedBy({"backup", outside.string() + "/", "--all"}));
  EXPECT_TRUE(std::filesystem::is_empty(outside));

  ok(cvdb({"backup", (allowed / "docs.cvbak").string()}));
  ok(cvdb({"backup"}));  // the backup folder is always allowed
  ok(cvdb({"cfg", "set", "layout", R"({"v": 2})"}));
  std::filesystem::copy_file(allowed / "docs.cvbak", outside / "docs.cvbak");
  EXPECT_TRUE(refusedBy({"restore", (outside / "docs.cvbak").string()}));
  EXPECT_TRUE(refusedBy({"restore", outside.string(), "--all"}));
  EXPECT_TRUE(has(ok(cvdb({"cfg", "get", "layout"})), "2"));
  ok(cvdb({"restore", (allowed / "docs.cvbak").string()}));
  EXPECT_TRUE(has(ok(cvdb({"cfg", "get", "layout"})), "1"));
}

TEST(CvdbTool, AServerWithoutMaintenanceFoldersSaysThatAnyPathIsAccepted) {
  ServerProcess server(kServer);
  EXPECT_TRUE(server.waitForLogLine("Backup and restore accept any path on the server: MaintenanceFolders is not set"));
}

// A MaintenanceFolders that cannot be used stops the start instead of
// leaving every path open.
TEST(CvdbTool, AnUnusableMaintenanceFoldersStopsTheStart) {
  testing_support::ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "MaintenanceFolders": "/srv/backups"})";
  o.waitUntilListening = false;
  ServerProcess server(kServer, o);
  EXPECT_EQ(server.wait(), 1);
  EXPECT_TRUE(server.waitForLogLine(
      "Cannot confine backup and restore: MaintenanceFolders: expected an array of folders, got string"));
  EXPECT_EQ(server.countLogLines("Listening on port"), 0u);
}
