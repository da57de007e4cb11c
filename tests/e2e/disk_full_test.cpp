// A full disk under the real server: its database root lies on a small
// tmpfs that the test fills through the server. While it is full, writes
// of configuration parts and data files are refused, nothing acknowledged
// before is lost, reads are served and the server takes new connections;
// once a file is removed from outside, the same server accepts writes
// again. Mounting needs root: the test skips otherwise.

#include <gtest/gtest.h>
#include <sys/mount.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <iostream>
#include <map>

#include "e2e_support.h"
#include "settings/names.h"
#include "support/raw_db.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using namespace e2e;
using testing_support::RawDb;
using testing_support::ServerOptions;
using testing_support::TempDir;

// A tmpfs of the given size mounted on a fresh folder, unmounted again by
// the destructor whatever the test did.
class Tmpfs {
 public:
  explicit Tmpfs(const std::string& size) : mountPoint_(dir_ / "mnt") {
    fs::create_directories(mountPoint_);
    const std::string options = "size=" + size + ",mode=0755";
    if (::mount("tmpfs", mountPoint_.c_str(), "tmpfs", 0, options.c_str()) != 0) {
      error_ = std::strerror(errno);
    }
  }
  ~Tmpfs() {
    if (error_.empty()) ::umount2(mountPoint_.c_str(), MNT_DETACH);
  }
  Tmpfs(const Tmpfs&) = delete;
  Tmpfs& operator=(const Tmpfs&) = delete;

  bool mounted() const { return error_.empty(); }
  const std::string& error() const { return error_; }
  const fs::path& path() const { return mountPoint_; }

 private:
  TempDir dir_;
  fs::path mountPoint_;
  std::string error_;
};

json::Object part(const std::string& text) { return json::strToObject(R"({"v":")" + text + "\"}"); }

// The text a failed request ends with: the connection's end, or a refusal.
std::string failureOf(const std::function<void()>& op) {
  try {
    op();
  } catch (const cvdb::ConnectionEnded& e) {
    return e.what();
  } catch (const cvdb::Error& e) {
    return std::string("refused: ") + e.what();
  }
  return "";
}

std::vector<std::string> temporaryFiles(const fs::path& root) {
  std::vector<std::string> out;
  for (const auto& e : fs::recursive_directory_iterator(root)) {
    if (e.path().filename().string().starts_with(DB::kDataTempPrefix)) out.push_back(e.path().string());
  }
  return out;
}

TEST(DiskFull, WritesAreRefusedWhileTheDiskIsFullAndAcceptedOnceSpaceIsFreed) {
  if (::geteuid() != 0) GTEST_SKIP() << "mounting a tmpfs needs root";
  Tmpfs disk("12m");
  if (!disk.mounted()) GTEST_SKIP() << "cannot mount a tmpfs: " << disk.error();
  const fs::path root = disk.path() / "db";
  fs::create_directories(root);
  ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "DBRoot": ")" + root.string() + R"(/"})";
  ServerProcess server(kServer, o);
  const std::string db = "full\\disk";

  // What must survive: parts, data files and a pack written before.
  std::map<std::string, std::string> parts, files;
  {
    auto c = clientOf(server, db);
    for (int i = 0; i < 20; ++i) {
      parts["part" + std::to_string(i)] = part(std::string(100 + i, 'p')).dump();
      c->setCfg("part" + std::to_string(i), part(std::string(100 + i, 'p')));
      files["doc" + std::to_string(i)] = std::string(20000 + i, static_cast<char>('a' + i));
      c->setData("doc" + std::to_string(i), "page", bytes(files["doc" + std::to_string(i)]));
    }
    c->savePack(complete("P1", "inbox", 1, "kept"), bytes(std::string(30000, 'k')));
  }

  // Filled through the server: data files of shrinking sizes until even
  // the smallest is refused. Each refusal ends its connection, so each
  // try has a client of its own.
  int fillers = 0;
  std::string dataError;
  for (std::size_t size = 1 << 20; size >= 1; size /= 4) {
    for (;;) {
      auto c = clientOf(server, db);
      const std::string error =
          failureOf([&] { c->setData("filler", std::to_string(fillers), bytes(std::string(size, 'f'))); });
      if (!error.empty()) {
        dataError = error;
        break;
      }
      ++fillers;
    }
  }
  ASSERT_GT(fillers, 0);
  std::cout << "[ disk full ] " << fillers << " filler files; a data-file write answers: " << dataError << std::endl;
  EXPECT_EQ(dataError, std::string("the server ended the connection: ") + kTerminating);
  EXPECT_TRUE(server.waitForLogLine("DB:saveDataBlob"));

  // Full: a part too large for what the write-ahead log already holds is
  // refused, and so is a data file; the refused writes leave nothing.
  const std::string bigPart(256 << 10, 'b');
  {
    auto c = clientOf(server, db);
    const std::string cfgError = failureOf([&] { c->setCfg("part0", part(bigPart)); });
    std::cout << "[ disk full ] a configuration part answers: " << cfgError << std::endl;
    EXPECT_EQ(cfgError, std::string("the server ended the connection: ") + kTerminating);
    EXPECT_TRUE(server.waitForLogLine("SetCfgPart failed with DB Engine error -1808 (disk full)"));
  }
  {
    auto c = clientOf(server, db);
    EXPECT_NE(failureOf([&] { c->setData("doc0", "page", bytes(std::string(100000, 'x'))); }), "");
  }
  EXPECT_EQ(temporaryFiles(root), std::vector<std::string>{});
  for (const auto& line : server.lines()) {
    // What the refusals of the part and of the last data file left in the log.
    if (line.find("SetCfgPart failed") != std::string::npos || line.find("/doc0/") != std::string::npos) {
      std::cout << "[ disk full ] the server logs: " << line << std::endl;
    }
  }

  // Reads are served, new connections too, and nothing acknowledged is
  // lost.
  const auto checkKept = [&](cvdb::Client& c) {
    for (const auto& [key, text] : parts) EXPECT_EQ(c.getCfg(key).dump(), text) << key;
    for (const auto& [id, content] : files) EXPECT_EQ(c.getData(id, "page").view(), content) << id;
    const auto pack = c.getPack("P1");
    ASSERT_TRUE(pack.info);
    EXPECT_EQ(pack.info->name, "kept");
    EXPECT_EQ(pack.content.view(), std::string(30000, 'k'));
  };
  {
    auto c = clientOf(server, db);
    checkKept(*c);
    c->ping();
    const auto names = c->dbNames();
    EXPECT_NE(std::find(names.begin(), names.end(), db), names.end());
  }

  // Space freed from outside: the same server writes again.
  fs::remove(root / "full/disk/d/filler/0");
  {
    auto c = clientOf(server, db);
    c->setCfg("part0", part(bigPart));
    c->setData("doc0", "page", bytes(std::string(100000, 'x')));
    parts["part0"] = part(bigPart).dump();
    files["doc0"] = std::string(100000, 'x');
    checkKept(*c);
  }
  EXPECT_EQ(RawDb(root / "full/disk/cvdb.edb").value("PRAGMA integrity_check"), "ok");
  EXPECT_EQ(server.stop(), 0);
}

}  // namespace
