// Backup against the real server, in the situations that matter in
// service: other clients writing all along, a client that leaves while its
// backup runs, requests sent behind a backup on the same connection, and a
// stop in the middle of a backup.
//
// A backup must overlap what it is tested against, so the databases carry
// ballast: tens of MiB of random data files (random bytes are what deflate
// takes longest over). The ballast is written straight into the database's
// data folder, which is where SetData puts it; sending it through the
// server would only add a sync per file.

#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <future>
#include <latch>
#include <mutex>
#include <optional>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "e2e_support.h"
#include "maintenance/archive_reader.h"
#include "protocol/commands.h"
#include "support/raw_db.h"

namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using namespace e2e;
using testing_support::readFile;
using testing_support::ServerOptions;
using testing_support::TempDir;
using testing_support::writeFile;

constexpr std::size_t kKiB = 1024;
constexpr std::size_t kMiB = 1024 * kKiB;

std::uint64_t fnv1a(std::string_view bytes) {
  std::uint64_t h = 14695981039346656037ull;
  for (const char c : bytes) {
    h ^= static_cast<unsigned char>(c);
    h *= 1099511628211ull;
  }
  return h;
}

// Bytes of a xorshift generator: incompressible, and the same for the same
// seed.
void fillRandom(char* out, std::size_t size, std::uint64_t seed) {
  std::uint64_t x = seed * 0x9E3779B97F4A7C15ull + 1;
  for (std::size_t i = 0; i < size; i += 8) {
    x ^= x << 13;
    x ^= x >> 7;
    x ^= x << 17;
    for (std::size_t b = 0; b < 8 && i + b < size; ++b) out[i + b] = static_cast<char>(x >> (8 * b));
  }
}

void put32(std::string& s, std::size_t at, std::uint32_t v) {
  for (int i = 0; i < 4; ++i) s[at + i] = static_cast<char>(v >> (8 * i));
}
std::uint32_t get32(const std::string& s, std::size_t at) {
  std::uint32_t v = 0;
  for (int i = 0; i < 4; ++i) v |= std::uint32_t{static_cast<unsigned char>(s[at + i])} << (8 * i);
  return v;
}

// One write of a writer's data file. Its content says which write it is and
// how long it is, and ends with a checksum of everything before it; sizes
// differ from write to write and span one to three of the archive's 1 MiB
// compression chunks, so a file read partly before and partly after a
// replacement cannot pass for either write.
struct Version {
  std::uint32_t writer = 0;
  std::uint32_t file = 0;
  std::uint32_t seq = 0;
};

constexpr std::size_t kHead = 20;  // "CVBK", writer, file, seq, length
constexpr std::size_t kTail = 8;   // FNV-1a of the bytes before it

std::string contentOf(const Version& v) {
  const std::uint64_t seed = (std::uint64_t{v.writer} << 40) ^ (std::uint64_t{v.file} << 32) ^ v.seq;
  const std::size_t size = 200 * kKiB + (seed * 2654435761u % 11) * 256 * kKiB;
  std::string s(size, '\0');
  s.replace(0, 4, "CVBK");
  put32(s, 4, v.writer);
  put32(s, 8, v.file);
  put32(s, 12, v.seq);
  put32(s, 16, static_cast<std::uint32_t>(size));
  fillRandom(s.data() + kHead, size - kHead - kTail, seed);
  const std::uint64_t sum = fnv1a(std::string_view(s).substr(0, size - kTail));
  put32(s, size - kTail, static_cast<std::uint32_t>(sum));
  put32(s, size - 4, static_cast<std::uint32_t>(sum >> 32));
  return s;
}

// The write a file holds, or why it holds none (a cut or mixed file).
std::optional<Version> versionIn(const std::string& s, std::string& why) {
  if (s.size() < kHead + kTail || s.compare(0, 4, "CVBK") != 0) {
    why = "no header (" + std::to_string(s.size()) + " bytes)";
    return std::nullopt;
  }
  if (get32(s, 16) != s.size()) {
    why = "says " + std::to_string(get32(s, 16)) + " bytes, has " + std::to_string(s.size());
    return std::nullopt;
  }
  const std::uint64_t sum = fnv1a(std::string_view(s).substr(0, s.size() - kTail));
  if (get32(s, s.size() - kTail) != static_cast<std::uint32_t>(sum) ||
      get32(s, s.size() - 4) != static_cast<std::uint32_t>(sum >> 32)) {
    why = "checksum mismatch";
    return std::nullopt;
  }
  const Version v{get32(s, 4), get32(s, 8), get32(s, 12)};
  if (contentOf(v) != s) {
    why = "not the bytes of write " + std::to_string(v.seq);
    return std::nullopt;
  }
  return v;
}

// Random files written into the database's data folder, under id.
std::vector<std::pair<fs::path, std::string>> putBallast(const ServerProcess& server, const std::string& dbKey,
                                                         const std::string& id, int files, std::size_t each) {
  std::vector<std::pair<fs::path, std::string>> out;
  std::string content(each, '\0');
  for (int i = 0; i < files; ++i) {
    fillRandom(content.data(), content.size(), 1000 + static_cast<std::uint64_t>(i));
    const fs::path file = server.home() / "db" / dbKey / "d" / id / ("b" + std::to_string(i));
    writeFile(file, content);
    out.emplace_back(file, "d\\" + id + "\\b" + std::to_string(i));
  }
  return out;
}

json::Object part(std::uint32_t seq, std::size_t pad = 0) {
  return json::strToObject("{\"seq\":" + std::to_string(seq) + ",\"pad\":\"" + std::string(pad, 'p') + "\"}");
}

// The "seq" of a stored configuration part; -1 when there is none.
long long seqIn(const std::optional<std::string>& stored) {
  static const std::regex seq("\"seq\":\\s*([0-9]+)");
  std::smatch m;
  if (!stored || !std::regex_search(*stored, m, seq)) return -1;
  return std::stoll(m[1].str());
}

std::optional<std::string> storedPart(const testing_support::RawDb& db, const std::string& key) {
  return db.value("SELECT blob FROM meta WHERE id = CAST(? AS BLOB)", {key});
}

std::vector<std::string> entriesOf(const fs::path& folder) {
  std::vector<std::string> out;
  if (!fs::exists(folder)) return out;
  for (const auto& e : fs::directory_iterator(folder)) out.push_back(e.path().filename().string());
  std::sort(out.begin(), out.end());
  return out;
}

// What op threw; empty when it succeeded.
std::string failureOf(const std::function<void()>& op) {
  try {
    op();
  } catch (const std::exception& e) {
    return e.what();
  }
  return "";
}

void expectStandardToolsRead(const fs::path& archive) {
  const auto test = ServerProcess::run("/usr/bin/unzip", {"-tq", archive.string()}, 120s);
  EXPECT_EQ(test.status, 0) << test.output;
}

// While a backup runs, three clients keep replacing their data files whole
// and recording in a configuration part which round of files they have
// written, and a fourth keeps writing rounds of three parts (a small one, a
// large one, a small one) with the round's number. The archive must hold
// the database of one moment (a whole file, whose parts fit one moment of
// that sequence) and data files that are each one whole write, taken after
// that moment (never older than the round the database records).
TEST(BackupUnderWriters, TheArchiveHoldsOneMomentOfTheDatabaseAndEveryDataFileWhole) {
  ServerProcess server(kServer);
  const std::string db = "busy";
  constexpr std::uint32_t kWriters = 3;
  constexpr std::uint32_t kFiles = 3;
  constexpr std::uint32_t kMiddle = 16;
  const auto middle = [](std::uint32_t i) { return "pair-m" + std::to_string(100 + i); };
  {
    // Eight MiB of parts that sort between the pair, so the two lie pages
    // apart and the copy takes more than one step.
    auto setup = clientOf(server, db);
    setup->setCfg("pair-a", part(0));
    for (std::uint32_t i = 0; i < kMiddle; ++i) setup->setCfg(middle(i), part(0, 512 * kKiB));
    setup->setCfg("pair-z", part(0));
    for (std::uint32_t w = 0; w < kWriters; ++w) {
      for (std::uint32_t f = 0; f < kFiles; ++f) {
        setup->setData("w" + std::to_string(w), "f" + std::to_string(f), bytes(contentOf({w, f, 0})));
      }
      setup->setCfg("w" + std::to_string(w), part(0));
    }
  }
  const auto ballast = putBallast(server, db, "ballast", 8, 4 * kMiB);

  std::atomic<bool> inBackup{false};
  std::atomic<bool> done{false};
  std::atomic<int> dataWrites{0};  // acknowledged while the backup ran
  std::atomic<int> cfgWrites{0};
  std::array<std::atomic<std::uint32_t>, kWriters> lastRound{};
  std::mutex failuresMutex;
  std::vector<std::string> failures;
  std::latch started(kWriters + 1);
  // Counts a write that was sent after the backup began and acknowledged
  // before its stream ended.
  const auto counted = [&](std::atomic<int>& count, const std::function<void()>& write) {
    const bool before = inBackup;
    write();
    if (before && inBackup) ++count;
  };
  const auto guarded = [&](const std::function<void()>& body) {
    return [&, body] {
      try {
        body();
      } catch (const std::exception& e) {
        std::lock_guard lock(failuresMutex);
        failures.push_back(e.what());
      }
    };
  };
  std::vector<std::thread> writers;
  for (std::uint32_t w = 0; w < kWriters; ++w) {
    writers.emplace_back(guarded([&, w] {
      auto c = clientOf(server, db);
      for (std::uint32_t round = 1;; ++round) {
        for (std::uint32_t f = 0; f < kFiles; ++f) {
          counted(dataWrites, [&] {
            c->setData("w" + std::to_string(w), "f" + std::to_string(f), bytes(contentOf({w, f, round})));
          });
        }
        counted(cfgWrites, [&] { c->setCfg("w" + std::to_string(w), part(round)); });
        lastRound[w] = round;
        if (round == 1) started.count_down();
        if (done) break;
      }
    }));
  }
  writers.emplace_back(guarded([&] {
    auto c = clientOf(server, db);
    for (std::uint32_t seq = 1;; ++seq) {
      // Half a MiB each time between the two: the log fills, and the
      // database file is checkpointed while the backup runs.
      counted(cfgWrites, [&] { c->setCfg("pair-a", part(seq)); });
      counted(cfgWrites, [&] { c->setCfg(middle(seq % kMiddle), part(seq, 512 * kKiB)); });
      counted(cfgWrites, [&] { c->setCfg("pair-z", part(seq)); });
      if (seq == 1) started.count_down();
      if (done) break;
    }
  }));

  // Every writer is under way before the backup starts.
  started.wait();
  TempDir dir;
  const fs::path archive = dir / "busy.cvbak";
  const auto t0 = std::chrono::steady_clock::now();
  try {
    clientOf(server, db)->backup(archive.string(), false, [&](std::uint32_t, const std::string&) { inBackup = true; });
  } catch (const std::exception& e) {
    ADD_FAILURE() << "backup: " << e.what();
  }
  inBackup = false;
  const auto took = std::chrono::steady_clock::now() - t0;
  done = true;
  for (auto& t : writers) t.join();
  ASSERT_TRUE(failures.empty()) << failures.front();
  ASSERT_TRUE(fs::exists(archive));
  // Otherwise the test proves nothing: the writers must have overlapped it.
  EXPECT_GE(dataWrites, 3) << took / 1ms << " ms";
  EXPECT_GE(cfgWrites, 3) << took / 1ms << " ms";
  RecordProperty("writes_during_backup", std::to_string(dataWrites) + " data files, " + std::to_string(cfgWrites) +
                                             " configuration parts, in " + std::to_string(took / 1ms) + " ms");

  expectStandardToolsRead(archive);
  const fs::path unpacked = dir / "unpacked";
  maint::ArchiveReader(sys::Env::posix(), archive).unpackTo(unpacked);

  testing_support::RawDb copy(unpacked / "cvdb.edb");
  EXPECT_EQ(copy.value("PRAGMA integrity_check").value_or("(no answer)"), "ok");
  // Round n writes pair-a, then the middle part n % 16, then pair-z, each
  // with n: with pair-z at z, a middle part holds the last round up to z
  // that wrote it, or round z + 1 when pair-a has it already.
  const long long a = seqIn(storedPart(copy, "pair-a"));
  const long long z = seqIn(storedPart(copy, "pair-z"));
  EXPECT_TRUE(a == z || a == z + 1) << "pair-a " << a << ", pair-z " << z;
  for (std::uint32_t i = 0; i < kMiddle; ++i) {
    long long last = z;
    while (last > 0 && last % kMiddle != i) --last;
    const long long m = seqIn(storedPart(copy, middle(i)));
    EXPECT_TRUE(m == last || (m == a && a == z + 1 && a % kMiddle == i))
        << middle(i) << " " << m << ", pair-a " << a << ", pair-z " << z;
  }

  for (std::uint32_t w = 0; w < kWriters; ++w) {
    const long long recorded = seqIn(storedPart(copy, "w" + std::to_string(w)));
    ASSERT_GE(recorded, 0) << w;
    for (std::uint32_t f = 0; f < kFiles; ++f) {
      SCOPED_TRACE("w" + std::to_string(w) + "/f" + std::to_string(f));
      const fs::path file = unpacked / "d" / ("w" + std::to_string(w)) / ("f" + std::to_string(f));
      ASSERT_TRUE(fs::exists(file));
      std::string why;
      const auto v = versionIn(readFile(file), why);
      ASSERT_TRUE(v) << why;
      EXPECT_EQ(v->writer, w);
      EXPECT_EQ(v->file, f);
      EXPECT_LE(v->seq, lastRound[w].load());
      // The files of a round are on disk before the part that records it;
      // the database is copied before any data file is read.
      EXPECT_GE(v->seq, recorded);
    }
  }
  for (const auto& [file, name] : ballast) {
    const std::string inArchive = readFile(unpacked / "d" / "ballast" / file.filename());
    EXPECT_TRUE(inArchive == readFile(file)) << name;
  }
  // Nothing else (temporary files of writes under way are left out:
  // Backup.TheTemporaryFileOfAWriteIsLeftOut in the store tests).
  std::vector<std::string> names;
  for (const auto& e : fs::recursive_directory_iterator(unpacked / "d")) {
    if (!e.is_directory() && !e.path().filename().string().starts_with(".cvtmp.")) {
      names.push_back(fs::relative(e.path(), unpacked / "d").string());
    }
  }
  EXPECT_EQ(names.size(), kWriters * kFiles + ballast.size()) << testing::PrintToString(names);
  EXPECT_TRUE(server.waitForLogLine("Database backup completed for \"busy\""));
}

// Waits until the server has written, in all, at least n lines that hold
// one of the fragments; false when it has not within the timeout.
bool waitForLines(ServerProcess& server, const std::vector<std::string>& fragments, std::size_t n,
                  std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    std::size_t count = 0;
    for (const auto& f : fragments) count += server.countLogLines(f);
    if (count >= n) return true;
    if (std::chrono::steady_clock::now() >= deadline) return false;
    // A look at the lines every 100 ms (no line holds this fragment).
    server.waitForLogLine("\x01", 100ms);
  }
}

// A backup whose client leaves runs to its end (or fails cleanly) all the
// same, logs its outcome and lets go of the database: here one client
// leaves while its backup compresses, another while its backup has just
// started (and waits for the first). A completed archive is whole; a failed
// one leaves nothing; and a third client's cleanup and backup of the same
// database then run without waiting out MaxWaitMaintenanceOpSecs.
TEST(BackupWithoutItsClient, EndsLogsItsOutcomeAndLetsGoOfTheDatabase) {
  ServerOptions o;
  o.configJson = R"({"ServerPort": 0, "MaxWaitMaintenanceOpSecs": 30})";
  ServerProcess server(kServer, o);
  const std::string db = "left";
  clientOf(server, db)->setCfg("layout", part(1));
  putBallast(server, db, "ballast", 12, 4 * kMiB);
  TempDir dir;

  struct Leaving {};
  const auto leaveAt = [](const std::string& fragment) {
    return [fragment](std::uint32_t, const std::string& text) {
      if (has(text, fragment)) throw Leaving{};
    };
  };
  auto first = clientOf(server, db);
  EXPECT_THROW(first->backup((dir / "first").string(), false, leaveAt("Compressing binaries")), Leaving);
  EXPECT_FALSE(first->isOpen());
  auto second = clientOf(server, db);
  EXPECT_THROW(second->backup((dir / "second").string(), false, leaveAt("Starting backup for")), Leaving);
  EXPECT_FALSE(second->isOpen());

  const std::string completed = "Database backup completed for \"left\"";
  const std::string failed = "Async command Backup failed with";
  ASSERT_TRUE(waitForLines(server, {completed, failed}, 2, 120s));
  for (const char* name : {"first", "second"}) {
    SCOPED_TRACE(name);
    const fs::path archive = dir / (std::string(name) + ".cvbak");
    if (server.countLogLines(completed + " into \"" + archive.string() + '"') == 1) {
      expectStandardToolsRead(archive);
    } else {
      EXPECT_FALSE(fs::exists(archive));
    }
  }
  EXPECT_EQ(entriesOf(server.home() / "db" / "db.temp"), std::vector<std::string>{});
  RecordProperty("outcomes", std::to_string(server.countLogLines(completed)) + " completed, " +
                                 std::to_string(server.countLogLines(failed)) + " failed");

  auto third = clientOf(server, db);
  EXPECT_EQ(failureOf([&] { third->cleanup({"ballast"}); }), "");
  EXPECT_EQ(failureOf([&] { third->backup((dir / "third").string(), false); }), "");
  expectStandardToolsRead(dir / "third.cvbak");
}

// One frame as the server sends it: tag, kind and payload.
struct Seen {
  std::uint8_t tag;
  wire::FrameKind kind;
  std::string payload;
};

std::string frameOf(const Ipc::CmdI& cmd) {
  const wire::OutFrame f = cmd.requestFrame();
  return f.head + std::string(f.tail.view());
}

// A raw connection bound to the database, for requests sent ahead of their
// answers.
std::unique_ptr<cvdb::FrameSocket> rawConnection(const ServerProcess& server, const std::string& db) {
  auto s = std::make_unique<cvdb::FrameSocket>("127.0.0.1", server.port(), 5s);
  Ipc::DB::Connect connect;
  connect.setRequest(db, 0);
  s->send(connect.requestFrame(), 10s);
  const auto f = s->receive(10s);
  EXPECT_EQ(f.kind, wire::FrameKind::Answer);
  return s;
}

// The bytes in one write, so that the server finds the requests together.
void sendAll(cvdb::FrameSocket& s, const std::string& frames) { s.sendRaw(frames.data(), frames.size(), 10s); }

// Every frame until the socket ends or until, and with, the frame for which
// last is true.
std::vector<Seen> framesUntil(cvdb::FrameSocket& s, const std::function<bool(const Seen&)>& last) {
  std::vector<Seen> seen;
  try {
    for (;;) {
      const auto f = s.receive(120s);
      seen.push_back(
          {f.tag, f.kind, f.size ? std::string(reinterpret_cast<const char*>(f.payload.get()), f.size) : ""});
      if (last(seen.back())) break;
    }
  } catch (const cvdb::ConnectionEnded&) {
  }
  return seen;
}

std::string progressText(const Seen& f) {
  wire::Reader in(f.payload.data(), f.payload.size());
  return Ipc::DB::ProgressCmdsBase::readProgress(in).second;
}

// Requests sent on the heels of a Backup, in the same packet, are read only
// once the backup's stream has ended, and answered in order: a PingPong
// (which the transport answers itself) as much as a GetCfgPart.
TEST(BackupPipelined, RequestsBehindABackupAreAnsweredAfterItsStreamEnds) {
  ServerProcess server(kServer);
  const std::string db = "piped";
  clientOf(server, db)->setCfg("layout", part(7));
  putBallast(server, db, "ballast", 6, 4 * kMiB);
  TempDir dir;

  Ipc::DB::Backup backup;
  backup.setRequest((dir / "piped").string(), false);
  Ipc::PingPong ping;
  Ipc::DB::GetCfgPart get;
  get.setRequest("layout");
  auto s = rawConnection(server, db);
  sendAll(*s, frameOf(backup) + frameOf(ping) + frameOf(get));
  const auto seen = framesUntil(*s, [](const Seen& f) { return f.tag == 4; });
  const auto end =
      std::find_if(seen.begin(), seen.end(), [](const Seen& f) { return f.kind == wire::FrameKind::ProgressEnd; });
  ASSERT_NE(end, seen.end());
  std::vector<std::string> texts;
  for (auto f = seen.begin(); f != end; ++f) {
    EXPECT_EQ(f->tag, 16) << "a frame of tag " << int(f->tag) << " inside the backup's stream";
    EXPECT_EQ(f->kind, wire::FrameKind::Progress);
    if (f->tag == 16 && f->kind == wire::FrameKind::Progress) texts.push_back(progressText(*f));
  }
  EXPECT_EQ(std::count(texts.begin(), texts.end(), "Compressing binaries 100% complete (6/6)"), 1);
  ASSERT_EQ(seen.end() - end, 3) << "after the stream's end: the pong and the part, nothing else";
  EXPECT_EQ(end[1].tag, 1);
  EXPECT_EQ(end[1].kind, wire::FrameKind::Answer);
  EXPECT_EQ(end[2].tag, 4);
  ASSERT_EQ(end[2].kind, wire::FrameKind::Answer);
  wire::Reader in(end[2].payload.data(), end[2].payload.size());
  get.readAnswer(in);
  EXPECT_EQ(seqIn(get.respCfg().dump()), 7);
  expectStandardToolsRead(dir / "piped.cvbak");
}

// After a failed backup the server ends the connection: a request sent
// behind it is neither run nor answered, so a client that sees its
// connection end may take its pipelined write as not done. The outcome
// depends on how the server's threads meet, so each kind of request is
// tried 250 times.
TEST(BackupPipelined, ARequestBehindAFailedBackupIsNeitherRunNorAnswered) {
  ServerProcess server(kServer);
  const std::string db = "piped";
  clientOf(server, db)->setCfg("layout", part(7));

  // A target in the database's own folder fails the backup.
  Ipc::DB::Backup backup;
  backup.setRequest((server.home() / "db" / db / "x.cvbak").string(), false);
  int answered = 0;
  for (int attempt = 0; attempt < 500; ++attempt) {
    std::shared_ptr<Ipc::CmdI> behind;
    if (attempt % 2 == 0) {
      auto set = std::make_shared<Ipc::DB::SetCfgPart>();
      set->setRequest("after-failure-" + std::to_string(attempt), part(1));
      behind = set;
    } else {
      auto get = std::make_shared<Ipc::DB::GetCfgPart>();
      get->setRequest("layout");
      behind = get;
    }
    SCOPED_TRACE(behind->name() + " " + std::to_string(attempt));
    auto s = rawConnection(server, db);
    sendAll(*s, frameOf(backup) + frameOf(*behind));
    const auto seen = framesUntil(*s, [](const Seen&) { return false; });
    ASSERT_GE(seen.size(), 3u);
    EXPECT_EQ(seen.back().kind, wire::FrameKind::Bye);
    answered += static_cast<int>(
        std::count_if(seen.begin(), seen.end(), [&](const Seen& f) { return f.tag == behind->tag(); }));
  }
  EXPECT_EQ(answered, 0) << "answers to requests behind a failed backup";
  EXPECT_EQ(clientOf(server, db)->cfgIds("after-failure"), std::vector<std::string>{})
      << "writes behind a failed backup were stored";
}

// A server started bound to one CPU (the first this thread may use): its
// compression then takes about as long on a machine of many cores as on a
// small one, so that a test can catch a backup in the middle.
std::unique_ptr<ServerProcess> serverOnOneCpu() {
  cpu_set_t all;
  CPU_ZERO(&all);
  if (sched_getaffinity(0, sizeof all, &all) != 0) return std::make_unique<ServerProcess>(kServer);
  cpu_set_t one;
  CPU_ZERO(&one);
  for (int cpu = 0; cpu < CPU_SETSIZE; ++cpu) {
    if (CPU_ISSET(cpu, &all)) {
      CPU_SET(cpu, &one);
      break;
    }
  }
  // The child inherits the binding of the thread that starts it.
  sched_setaffinity(0, sizeof one, &one);
  struct Restore {
    cpu_set_t& all;
    ~Restore() { sched_setaffinity(0, sizeof all, &all); }
  } restore{all};
  return std::make_unique<ServerProcess>(kServer);
}

// SIGTERM while a backup compresses: the server stops the backup at its
// next chunk and exits cleanly and promptly, and nothing of the backup is
// left, neither the archive nor its temporary file nor the working folder.
TEST(BackupStopped, ASigtermWhileCompressingLeavesNoArchiveAndNoWorkingFolder) {
  const auto running = serverOnOneCpu();
  ServerProcess& server = *running;
  const std::string db = "stopped";
  clientOf(server, db)->setCfg("layout", part(1));
  putBallast(server, db, "ballast", 32, 4 * kMiB);
  TempDir dir;
  const fs::path out = dir / "out";

  std::future<int> stopped;
  std::chrono::steady_clock::time_point signalled;
  auto c = clientOf(server, db);
  const std::string reason = endedBy([&] {
    c->backup((out / "stopped.cvbak").string(), false, [&](std::uint32_t, const std::string& text) {
      if (has(text, "Compressing") && !stopped.valid()) {
        signalled = std::chrono::steady_clock::now();
        stopped = std::async(std::launch::async, [&] { return server.stop(SIGTERM, 15s); });
      }
    });
  });
  ASSERT_TRUE(stopped.valid()) << "no compression reported";
  EXPECT_EQ(stopped.get(), 0);
  const auto took = std::chrono::steady_clock::now() - signalled;
  EXPECT_EQ(reason, "Server is stopping");
  // Well inside the twenty seconds the server gives maintenance to stop.
  EXPECT_LT(took, 10s) << took / 1ms << " ms";
  RecordProperty("stop_ms", std::to_string(took / 1ms));

  ASSERT_EQ(server.countLogLines("Database backup completed for"), 0u)
      << "the backup ran to its end: it went past the stop, or ended before the stop reached it";
  EXPECT_EQ(server.countLogLines("Async command Backup failed with Writing the archive"), 1u);
  EXPECT_EQ(server.countLogLines("Maintenance operations still running after"), 0u);
  EXPECT_EQ(entriesOf(out), std::vector<std::string>{});
  EXPECT_EQ(entriesOf(server.home() / "db" / "db.temp"), std::vector<std::string>{});
}

}  // namespace
