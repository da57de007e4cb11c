// The backup archive: written by ArchiveWriter, read back by ArchiveReader
// and by independent readers (minizip, unzip -t, Python's zipfile); what a
// failure or a stop at any step leaves; names that would escape the folder.

#include <gtest/gtest.h>
#include <unzip.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <sstream>

#include "maintenance/archive_reader.h"
#include "maintenance/archive_writer.h"
#include "maintenance/zip_format.h"
#include "support/fault_env.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using maint::ArchiveError;
using maint::ArchiveReader;
using maint::ArchiveWriter;
using testing_support::FaultEnv;
using testing_support::readFile;
using testing_support::TempDir;
using testing_support::writeFile;

std::string randomBytes(std::size_t n, unsigned seed) {
  std::mt19937 gen(seed);
  std::string s(n, '\0');
  for (char& c : s) c = static_cast<char>(gen());
  return s;
}

std::string text(std::size_t n) {
  std::string s;
  for (int i = 0; s.size() < n; ++i)
    s += "line " + std::to_string(i) + ": the quick brown fox, pack " + std::to_string(i % 97) + '\n';
  s.resize(n);
  return s;
}

struct Source {
  std::string rel;   // below the source folder
  std::string name;  // entry name
  std::string content;
};

// A small tree: text, binary, empty, nested, and one file of several
// chunks (the tests use 64 KiB chunks) mixing text and random bytes.
std::vector<Source> sampleTree() {
  return {
      {"cvdb.edb", "cvdb.edb", text(5000)},
      {"originDB.txt", "originDB.txt", "/srv/db/a/cvdb.edb\r\nteam\\alpha"},
      {"d/7/blob.bin", "d\\7\\blob.bin", randomBytes(3000, 1)},
      {"d/7/empty", "d\\7\\empty", ""},
      {"d/8/x/y/deep.txt", "d\\8\\x\\y\\deep.txt", "deep"},
      {"d/9/large.bin", "d\\9\\large.bin", text(150000) + randomBytes(150000, 2) + text(70000)},
  };
}

// Time stamps on even seconds, one in summer and one in winter, so that
// daylight saving in the local zone is crossed.
sys::WallClock::time_point stamp(std::size_t i) {
  std::tm tm{};
  tm.tm_year = 2024 - 1900;
  tm.tm_mon = i % 2 == 0 ? 6 : 0;
  tm.tm_mday = 10 + static_cast<int>(i);
  tm.tm_hour = 13;
  tm.tm_min = 5;
  tm.tm_sec = 42;
  tm.tm_isdst = -1;
  return sys::WallClock::from_time_t(std::mktime(&tm));
}

void makeTree(const fs::path& root, const std::vector<Source>& files) {
  for (std::size_t i = 0; i < files.size(); ++i) {
    writeFile(root / files[i].rel, files[i].content);
    sys::Env::posix().setModified(root / files[i].rel, stamp(i));
  }
}

maint::ArchiveWriterOptions smallChunks(unsigned threads = 2) {
  maint::ArchiveWriterOptions o;
  o.threads = threads;
  o.chunkSize = 64 * 1024;
  return o;
}

void writeArchive(sys::Env& env, const fs::path& src, const fs::path& dest, const std::vector<Source>& files,
                  unsigned threads = 2) {
  ArchiveWriter writer(env, dest, smallChunks(threads));
  for (const Source& s : files) writer.add(src / s.rel, s.name);
  writer.commit();
}

std::vector<std::string> namesIn(const fs::path& folder) {
  std::vector<std::string> out;
  if (!fs::exists(folder)) return out;
  for (const auto& e : fs::directory_iterator(folder)) out.push_back(e.path().filename().string());
  return out;
}

std::string run(const std::string& command, int* status) {
  std::string out;
  FILE* p = ::popen(command.c_str(), "r");
  char buf[4096];
  std::size_t n;
  while ((n = std::fread(buf, 1, sizeof buf, p)) > 0) out.append(buf, n);
  *status = ::pclose(p);
  return out;
}

TEST(Archive, RoundTripThroughOurReaderMinizipUnzipAndPython) {
  TempDir dir;
  auto files = sampleTree();
  // Larger than the writer's 1 MiB output buffer: its local header is
  // already on disk when the sizes and checksum are filled in.
  files.push_back({"d/9/huge.bin", "d\\9\\huge.bin", randomBytes(2621440, 3)});
  makeTree(dir / "src", files);
  const auto dest = dir / "out/team.cvbak";
  std::vector<std::string> reported;
  {
    ArchiveWriter writer(sys::Env::posix(), dest, smallChunks());
    for (const Source& s : files) writer.add(dir / "src" / s.rel, s.name);
    writer.add(dir / "src/missing.bin", "d\\missing.bin");
    writer.onEntry([&](const ArchiveWriter::EntryReport& r) {
      reported.push_back(std::to_string(r.index) + (r.skipped ? " skipped " : " ") + r.name);
    });
    writer.commit();
  }
  ASSERT_EQ(reported.size(), files.size() + 1);
  for (std::size_t i = 0; i < files.size(); ++i) EXPECT_EQ(reported[i], std::to_string(i) + " " + files[i].name);
  EXPECT_EQ(reported.back(), std::to_string(files.size()) + " skipped d\\missing.bin");
  EXPECT_EQ(namesIn(dir / "out"), std::vector<std::string>{"team.cvbak"});  // no temporary file

  // Ours: contents, time stamps, sizes.
  ArchiveReader reader(sys::Env::posix(), dest);
  ASSERT_EQ(reader.entryCount(), files.size());
  std::uint64_t total = 0;
  for (const Source& s : files) total += s.content.size();
  EXPECT_EQ(reader.totalSize(), total);
  std::vector<std::size_t> progress;
  reader.unpackTo(dir / "back", [&](std::size_t done, std::size_t n) {
    EXPECT_EQ(n, files.size());
    progress.push_back(done);
  });
  EXPECT_EQ(progress, (std::vector<std::size_t>{1, 2, 3, 4, 5, 6, 7}));
  for (std::size_t i = 0; i < files.size(); ++i) {
    EXPECT_TRUE(readFile(dir / "back" / files[i].rel) == files[i].content) << files[i].rel;
    EXPECT_EQ(sys::Env::posix().stat(dir / "back" / files[i].rel).modified, stamp(i)) << files[i].rel;
  }

  // minizip, the library the original tools read with.
  unzFile uz = unzOpen64(dest.c_str());
  ASSERT_NE(uz, nullptr);
  std::size_t i = 0;
  for (int rc = unzGoToFirstFile(uz); rc == UNZ_OK; rc = unzGoToNextFile(uz), ++i) {
    ASSERT_LT(i, files.size());
    unz_file_info64 info{};
    char name[2048];
    unsigned char extra[256];
    ASSERT_EQ(unzGetCurrentFileInfo64(uz, &info, name, sizeof name, extra, sizeof extra, nullptr, 0), UNZ_OK);
    EXPECT_EQ(std::string(name), files[i].name);
    EXPECT_EQ(info.compression_method, 8u);
    EXPECT_EQ(info.external_fa, 0u);
    EXPECT_EQ(info.internal_fa, 0u);
    EXPECT_EQ(info.size_file_comment, 0u);
    EXPECT_EQ(info.dosDate, maint::zip::toDosDateTime(stamp(i)));
    ASSERT_EQ(unzOpenCurrentFile(uz), UNZ_OK) << name;
    std::string content(files[i].content.size() + 1, '\0');
    const int n = unzReadCurrentFile(uz, content.data(), static_cast<unsigned>(content.size()));
    content.resize(static_cast<std::size_t>(std::max(n, 0)));
    EXPECT_TRUE(content == files[i].content) << files[i].name;
    EXPECT_EQ(unzCloseCurrentFile(uz), UNZ_OK);  // checks the CRC
  }
  EXPECT_EQ(i, files.size());
  unzClose(uz);

  // Info-ZIP's unzip tests every entry's checksum.
  int status = 0;
  const std::string tested = run("unzip -t '" + dest.string() + "' 2>&1", &status);
  EXPECT_EQ(status, 0) << tested;
  EXPECT_NE(tested.find("No errors detected"), std::string::npos) << tested;

  // Python's zipfile: names, method, the ZIP64 extra field of each local
  // header, time stamps, checksums.
  std::ofstream(dir / "check.py") << R"(import sys, zipfile, struct
z = zipfile.ZipFile(sys.argv[1])
assert z.testzip() is None
for i in z.infolist():
    raw = open(sys.argv[1], 'rb')
    raw.seek(i.header_offset)
    h = raw.read(30)
    n, m = struct.unpack('<HH', h[26:30])
    raw.seek(i.header_offset + 30 + n)
    local_extra = raw.read(m)
    print(i.filename, i.compress_type, i.file_size, local_extra[:4].hex(), '%04d-%02d-%02d %02d:%02d:%02d' % i.date_time)
)";
  const std::string listed = run("python3 '" + (dir / "check.py").string() + "' '" + dest.string() + "' 2>&1", &status);
  EXPECT_EQ(status, 0) << listed;
  std::ostringstream expected;
  for (std::size_t k = 0; k < files.size(); ++k) {
    const std::time_t t = sys::WallClock::to_time_t(stamp(k));
    std::tm tm{};
    localtime_r(&t, &tm);
    char when[32];
    std::strftime(when, sizeof when, "%Y-%m-%d %H:%M:%S", &tm);
    expected << files[k].name << " 8 " << files[k].content.size() << " 01001000 " << when << '\n';
  }
  EXPECT_EQ(listed, expected.str());
}

TEST(Archive, EmptyArchiveIsValid) {
  TempDir dir;
  writeArchive(sys::Env::posix(), dir.path(), dir / "empty.cvbak", {});
  int status = 0;
  run("unzip -t '" + (dir / "empty.cvbak").string() + "' >/dev/null 2>&1", &status);
  // unzip reports an archive without entries with status 1 (a warning).
  EXPECT_LE(WEXITSTATUS(status), 1);
  ArchiveReader reader(sys::Env::posix(), dir / "empty.cvbak");
  EXPECT_EQ(reader.entryCount(), 0u);
  reader.unpackTo(dir / "back");
  EXPECT_TRUE(fs::is_empty(dir / "back"));
}

// Every Env call of a clean run, failed in turn: the commit either fails and
// leaves neither the archive nor a temporary file (the older archive of the
// same name survives), or succeeds with an archive that reads back (a source
// file that could not be opened is left out).
TEST(Archive, AFailureAtAnyStepOfWritingLeavesOnlyTheOlderArchive) {
  TempDir dir;
  const auto files = sampleTree();
  makeTree(dir / "src", files);
  const auto dest = dir / "out/team.cvbak";
  writeFile(dest, "older archive");
  FaultEnv counting(dir / "scratch");
  writeArchive(counting, dir / "src", dir / "clean.cvbak", files);
  const std::uint64_t calls = counting.count(FaultEnv::kAny);
  ASSERT_GT(calls, 20u);
  int failures = 0;
  for (std::uint64_t n = 1; n <= calls; ++n) {
    FaultEnv env(dir / "scratch");
    env.failNth(FaultEnv::kAny, n);
    bool ok = true;
    try {
      writeArchive(env, dir / "src", dest, files);
    } catch (const ArchiveError& e) {
      ok = false;
      ++failures;
      // Only a failed flush of the folder comes after the rename; the new
      // archive, whole, then stays under its name (removing it would leave
      // nothing there).
      if (std::string(e.what()).find("Failed to flush the folder") != std::string::npos) {
        EXPECT_GE(ArchiveReader(sys::Env::posix(), dest).entryCount(), files.size() - 1) << "call " << n;
        writeFile(dest, "older archive");
      }
      EXPECT_EQ(readFile(dest), "older archive") << "call " << n << ": " << e.what();
    }
    EXPECT_EQ(env.injected(), 1u) << "call " << n;  // the fault was reached
    EXPECT_EQ(namesIn(dir / "out"), std::vector<std::string>{"team.cvbak"}) << "call " << n;
    if (ok) {
      ArchiveReader reader(sys::Env::posix(), dest);
      EXPECT_GE(reader.entryCount(), files.size() - 1) << "call " << n;
      reader.unpackTo(dir / ("ok" + std::to_string(n)));
      writeFile(dest, "older archive");
    }
  }
  EXPECT_GT(failures, 10);
}

TEST(Archive, AStopAbandonsTheArchive) {
  TempDir dir;
  const auto files = sampleTree();
  makeTree(dir / "src", files);
  for (int after : {0, 1, 5}) {
    std::stop_source stop;
    ArchiveWriter writer(sys::Env::posix(), dir / "out/a.cvbak", smallChunks());
    for (const Source& s : files) writer.add(dir / "src" / s.rel, s.name);
    int seen = 0;
    writer.onEntry([&](const ArchiveWriter::EntryReport&) {
      if (++seen == after) stop.request_stop();
    });
    if (after == 0) stop.request_stop();
    EXPECT_THROW(writer.commit(stop.get_token()), maint::OperationStopped) << after;
    EXPECT_TRUE(namesIn(dir / "out").empty()) << after;
  }
  // An uncommitted writer removes its temporary file.
  { ArchiveWriter writer(sys::Env::posix(), dir / "out/b.cvbak"); }
  EXPECT_TRUE(namesIn(dir / "out").empty());
}

// Names that would put a file outside the folder refuse the whole archive
// before anything is written, even when a harmless entry comes first.
TEST(ArchiveReader, RefusesNamesThatLeaveTheFolderBeforeWritingAnything) {
  TempDir dir;
  writeFile(dir / "f", "payload");
  fs::create_directories(dir / "outside");
  for (const std::string bad :
       {"..\\evil", "a/../../evil", "a\\..\\b", "C:\\evil", "link\\evil", "d\\7\\link2\\evil"}) {
    const auto archive = dir / "bad.cvbak";
    {
      ArchiveWriter writer(sys::Env::posix(), archive);
      writer.add(dir / "f", "first.txt");
      writer.add(dir / "f", bad);
      writer.commit();
    }
    const auto into = dir / "into";
    fs::remove_all(into);
    fs::create_directories(into / "d/7");
    fs::create_directory_symlink(dir / "outside", into / "link");
    fs::create_directory_symlink(dir / "outside", into / "d/7/link2");
    ArchiveReader reader(sys::Env::posix(), archive);
    try {
      reader.unpackTo(into);
      ADD_FAILURE() << bad << " was unpacked";
    } catch (const ArchiveError& e) {
      EXPECT_EQ(std::string(e.what()).rfind("Decompression error: ", 0), 0u) << e.what();
    }
    EXPECT_FALSE(fs::exists(into / "first.txt")) << bad;
    EXPECT_TRUE(fs::is_empty(dir / "outside")) << bad;
  }
}

TEST(ArchiveReader, DirectoryEntriesAreSkippedAndLeadingSeparatorsDropped) {
  TempDir dir;
  writeFile(dir / "f", "payload");
  writeFile(dir / "empty", "");
  {
    ArchiveWriter writer(sys::Env::posix(), dir / "a.cvbak");
    writer.add(dir / "empty", "d\\");
    writer.add(dir / "f", "\\\\/lead\\x.txt");
    writer.add(dir / "f", "mixed/sep\\y.txt");
    writer.commit();
  }
  ArchiveReader reader(sys::Env::posix(), dir / "a.cvbak");
  reader.unpackTo(dir / "into");
  EXPECT_EQ(readFile(dir / "into/lead/x.txt"), "payload");
  EXPECT_EQ(readFile(dir / "into/mixed/sep/y.txt"), "payload");
  EXPECT_FALSE(fs::exists(dir / "into/d"));
}

TEST(ArchiveReader, AStopEndsTheUnpacking) {
  TempDir dir;
  const auto files = sampleTree();
  makeTree(dir / "src", files);
  writeArchive(sys::Env::posix(), dir / "src", dir / "a.cvbak", files);
  std::stop_source stop;
  maint::ArchiveReaderOptions one;
  one.threads = 1;
  ArchiveReader reader(sys::Env::posix(), dir / "a.cvbak", one);
  // The stop is seen between entries or, at the latest, before the syncs.
  EXPECT_THROW(reader.unpackTo(
                   dir / "into", [&](std::size_t, std::size_t) { stop.request_stop(); }, stop.get_token()),
               maint::OperationStopped);
}

// A damaged archive: a clear error, whichever byte was hit.
TEST(ArchiveReader, DamageIsReportedClearly) {
  TempDir dir;
  const auto files = sampleTree();
  makeTree(dir / "src", files);
  writeArchive(sys::Env::posix(), dir / "src", dir / "a.cvbak", files);
  const std::string good = readFile(dir / "a.cvbak");

  try {
    ArchiveReader reader(sys::Env::posix(), dir / "missing.cvbak");
    ADD_FAILURE();
  } catch (const ArchiveError& e) {
    EXPECT_EQ(std::string(e.what()).rfind(
                  "Failed to open for decompression file \"" + (dir / "missing.cvbak").string() + '"', 0),
              0u);
  }
  for (std::size_t cut : {std::size_t{0}, std::size_t{10}, good.size() / 2, good.size() - 1}) {
    writeFile(dir / "cut.cvbak", good.substr(0, cut));
    EXPECT_THROW(ArchiveReader(sys::Env::posix(), dir / "cut.cvbak"), ArchiveError) << cut;
  }
  // Flipped bytes inside the large entry's data: inflate error or checksum.
  const std::size_t at = good.find("d\\9\\large.bin") + 40;
  for (std::size_t off : {std::size_t{0}, std::size_t{5000}, std::size_t{100000}}) {
    std::string bad = good;
    bad[at + off] = static_cast<char>(bad[at + off] ^ 0x5a);
    writeFile(dir / "bad.cvbak", bad);
    ArchiveReader reader(sys::Env::posix(), dir / "bad.cvbak");
    try {
      reader.unpackTo(dir / ("bad" + std::to_string(off)));
      ADD_FAILURE() << "damage at " << off << " passed";
    } catch (const ArchiveError& e) {
      EXPECT_EQ(std::string(e.what()).rfind("Decompression error: ", 0), 0u) << e.what();
    }
  }
}

// Every Env call of an unpack, failed in turn: an error with a clear text,
// never a crash or a silent success with missing files.
TEST(ArchiveReader, AFailureAtAnyStepOfUnpackingIsReported) {
  TempDir dir;
  const auto files = sampleTree();
  makeTree(dir / "src", files);
  writeArchive(sys::Env::posix(), dir / "src", dir / "a.cvbak", files);
  FaultEnv env(dir / "scratch");
  maint::ArchiveReaderOptions one;
  one.threads = 1;  // the same order of calls in every run
  {
    ArchiveReader reader(env, dir / "a.cvbak", one);
    reader.unpackTo(dir / "clean");
  }
  const std::uint64_t calls = env.count(FaultEnv::kAny);
  for (std::uint64_t n = 1; n <= calls; ++n) {
    env.resetCounts();
    env.failNth(FaultEnv::kAny, n);
    const auto into = dir / ("run" + std::to_string(n));
    try {
      ArchiveReader reader(env, dir / "a.cvbak", one);
      reader.unpackTo(into);
      ADD_FAILURE() << "call " << n << " failed silently";
    } catch (const ArchiveError& e) {
      const std::string what = e.what();
      EXPECT_TRUE(what.rfind("Decompression error: ", 0) == 0 ||
                  what.rfind("Decompression failed to create file", 0) == 0 ||
                  what.rfind("Failed to open for decompression file", 0) == 0)
          << what;
      EXPECT_NE(what.find("injected"), std::string::npos) << what;
    }
  }
}

}  // namespace
