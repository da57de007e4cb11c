// Backup archives against the standard tools, in one run on one machine:
//   - writing: ArchiveWriter against `zip -3 -r -q` and `tar -c | pigz -3`
//     (throughput), and the archive's size against zip -3's;
//   - unpacking: ArchiveReader (every file and folder synced) against
//     `unzip -q` followed by `sync`;
//   - the peak resident memory that writing and unpacking add.
//
//   archive_bench [--mib S] [--files N] [--runs R] [--threads T]
//                 [--worker-nice N] [--dir PATH]
//
// --worker-nice 0 runs the compression threads at the tools' priority (the
// server's default, 10, lets every other process go first, so on a busy
// machine the figures then measure the other load as much as the writer).
// Our writer's time includes syncing the archive; the tools' does not.
// The tree is N files of S MiB in all (default 1024 MiB, 10,000 files),
// half compressible text and half random bytes, in 100 folders. Every
// figure is the median of R runs (default 3); the runs of the different
// tools are interleaved. Our writer and reader run in a child process of
// this program (--child), so that their peak memory is their own.

#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <random>
#include <string>
#include <vector>

#include "framework/env.h"
#include "maintenance/archive_reader.h"
#include "maintenance/archive_writer.h"

namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

double seconds(Clock::time_point since) { return std::chrono::duration<double>(Clock::now() - since).count(); }

// Resident kilobytes of this process: now (VmRSS) or at the peak (VmHWM).
long statusKiB(const char* field) {
  std::ifstream in("/proc/self/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind(field, 0) == 0) return std::atol(line.c_str() + std::strlen(field) + 1);
  }
  return -1;
}

void run(const std::string& command) {
  if (std::system(command.c_str()) != 0) throw std::runtime_error("failed: " + command);
}

std::string quoted(const fs::path& p) { return "'" + p.string() + "'"; }

void makeTree(const fs::path& root, std::uint64_t total, int files) {
  std::mt19937_64 gen(42);
  static const char* const words[] = {"pack",    "document", "record", "client", "the",  "of",     "upload", "scan",
                                      "invoice", "2024",     "page",   "user",   "lock", "status", "signed", "copy"};
  const std::uint64_t average = total / static_cast<std::uint64_t>(files);
  for (int i = 0; i < files; ++i) {
    // Sizes from a fifth to nine fifths of the average.
    const std::uint64_t size = average / 5 + gen() % (average * 8 / 5 + 1);
    const fs::path file = root / std::to_string(i % 100) / (std::to_string(i) + (i % 2 ? ".bin" : ".txt"));
    fs::create_directories(file.parent_path());
    std::string data;
    data.reserve(size);
    if (i % 2 == 0) {
      while (data.size() < size) {
        data += words[gen() % 16];
        data += (gen() % 9 == 0) ? '\n' : ' ';
        if (gen() % 7 == 0) data += std::to_string(gen() % 100000);
      }
      data.resize(size);
    } else {
      data.resize(size);
      for (std::size_t k = 0; k + 8 <= size; k += 8) {
        const std::uint64_t v = gen();
        std::memcpy(&data[k], &v, 8);
      }
    }
    std::ofstream(file, std::ios::binary).write(data.data(), static_cast<std::streamsize>(data.size()));
  }
}

std::uint64_t treeBytes(const fs::path& root) {
  std::uint64_t n = 0;
  for (const auto& e : fs::recursive_directory_iterator(root)) {
    if (e.is_regular_file()) n += e.file_size();
  }
  return n;
}

// Child modes: one write or one unpack, then "seconds extraKiB" on stdout.
int child(int argc, char** argv) {
  const std::string mode = argv[2];
  const fs::path a = argv[3];
  const fs::path b = argv[4];
  const unsigned threads = argc > 5 ? static_cast<unsigned>(std::atoi(argv[5])) : 0;
  const int workerNice = argc > 6 ? std::atoi(argv[6]) : 10;
  std::vector<std::pair<fs::path, std::string>> files;
  if (mode == "write") {
    for (const auto& e : fs::recursive_directory_iterator(a)) {
      if (!e.is_regular_file()) continue;
      std::string name = "d";
      for (const auto& part : fs::relative(e.path(), a)) name += "\\" + part.string();
      files.emplace_back(e.path(), std::move(name));
    }
  }
  const long before = statusKiB("VmRSS:");
  const auto t0 = Clock::now();
  if (mode == "write") {
    maint::ArchiveWriterOptions o;
    o.threads = threads;
    o.workerNice = workerNice;
    maint::ArchiveWriter writer(sys::Env::posix(), b, o);
    for (auto& [file, name] : files) writer.add(file, name);
    writer.commit();
  } else {
    maint::ArchiveReaderOptions o;
    o.threads = threads;
    maint::ArchiveReader reader(sys::Env::posix(), a, o);
    reader.unpackTo(b);
  }
  std::printf("%.6f %ld\n", seconds(t0), statusKiB("VmHWM:") - before);
  return 0;
}

struct ChildResult {
  double seconds;
  long extraKiB;
};

ChildResult runChild(const std::string& self, const std::string& args) {
  FILE* p = ::popen((self + " --child " + args).c_str(), "r");
  ChildResult r{0, 0};
  if (p == nullptr || std::fscanf(p, "%lf %ld", &r.seconds, &r.extraKiB) != 2) throw std::runtime_error("child failed");
  if (::pclose(p) != 0) throw std::runtime_error("child failed");
  return r;
}

double timed(const std::string& command) {
  const auto t0 = Clock::now();
  run(command);
  return seconds(t0);
}

double median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v[v.size() / 2];
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 4 && std::string(argv[1]) == "--child") return child(argc, argv);
  std::uint64_t mib = 1024;
  int files = 10000;
  int runs = 3;
  unsigned threads = 0;
  int workerNice = 10;
  fs::path dir = fs::temp_directory_path();
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string k = argv[i];
    if (k == "--mib")
      mib = std::stoull(argv[i + 1]);
    else if (k == "--files")
      files = std::stoi(argv[i + 1]);
    else if (k == "--runs")
      runs = std::stoi(argv[i + 1]);
    else if (k == "--threads")
      threads = static_cast<unsigned>(std::stoi(argv[i + 1]));
    else if (k == "--dir")
      dir = argv[i + 1];
    else if (k == "--worker-nice")
      workerNice = std::stoi(argv[i + 1]);
    else {
      std::cerr
          << "usage: archive_bench [--mib S] [--files N] [--runs R] [--threads T] [--worker-nice N] [--dir PATH]\n";
      return 2;
    }
  }
  const std::string self = fs::canonical("/proc/self/exe").string();
  const fs::path work = dir / ("archive-bench-" + std::to_string(::getpid()));
  const fs::path src = work / "src";
  try {
    std::cout << "generating " << files << " files, " << mib << " MiB in " << work << std::endl;
    makeTree(src / "d", mib << 20, files);
    const double input = static_cast<double>(treeBytes(src / "d"));
    run("sync");
    std::vector<double> ours, zip, pigz, unpack, unzip;
    long writeKiB = 0, readKiB = 0;
    std::uint64_t oursSize = 0, zipSize = 0, pigzSize = 0;
    for (int r = 0; r < runs; ++r) {
      fs::remove(work / "a.cvbak");
      fs::remove(work / "z.zip");
      fs::remove(work / "t.tgz");
      run("sync");
      const ChildResult w = runChild(self, "write " + quoted(src / "d") + " " + quoted(work / "a.cvbak") + " " +
                                               std::to_string(threads) + " " + std::to_string(workerNice));
      ours.push_back(w.seconds);
      writeKiB = std::max(writeKiB, w.extraKiB);
      run("sync");
      zip.push_back(timed("cd " + quoted(src) + " && zip -3 -r -q " + quoted(work / "z.zip") + " d"));
      run("sync");
      pigz.push_back(timed("cd " + quoted(src) + " && tar -c d | pigz -3 > " + quoted(work / "t.tgz")));
      oursSize = fs::file_size(work / "a.cvbak");
      zipSize = fs::file_size(work / "z.zip");
      pigzSize = fs::file_size(work / "t.tgz");

      fs::remove_all(work / "u1");
      fs::remove_all(work / "u2");
      run("sync");
      const ChildResult u = runChild(
          self, "read " + quoted(work / "a.cvbak") + " " + quoted(work / "u1") + " " + std::to_string(threads));
      unpack.push_back(u.seconds);
      readKiB = std::max(readKiB, u.extraKiB);
      run("sync");
      unzip.push_back(timed("unzip -q " + quoted(work / "z.zip") + " -d " + quoted(work / "u2") + " && sync"));
      std::cout << "run " << r + 1 << ": write " << w.seconds << " s, zip " << zip.back() << " s, pigz " << pigz.back()
                << " s, unpack " << u.seconds << " s, unzip+sync " << unzip.back() << " s" << std::endl;
    }
    const double mb = input / 1e6;
    const double mOurs = median(ours), mZip = median(zip), mPigz = median(pigz), mUnpack = median(unpack),
                 mUnzip = median(unzip);
    std::printf("\ninput %.0f MB in %d files; medians of %d runs\n", mb, files, runs);
    std::printf("write: ours %.1f MB/s, zip -3 %.1f MB/s, tar|pigz -3 %.1f MB/s\n", mb / mOurs, mb / mZip, mb / mPigz);
    std::printf("write throughput vs zip -3: %.2fx   vs tar|pigz -3: %.2fx\n", mZip / mOurs, mPigz / mOurs);
    std::printf("compressed size: ours %.1f%%, zip -3 %.1f%%, pigz -3 %.1f%% of input; ours/zip = %.4f\n",
                100.0 * static_cast<double>(oursSize) / input, 100.0 * static_cast<double>(zipSize) / input,
                100.0 * static_cast<double>(pigzSize) / input,
                static_cast<double>(oursSize) / static_cast<double>(zipSize));
    std::printf("unpack (synced): ours %.1f MB/s, unzip+sync %.1f MB/s; ratio %.2fx\n", mb / mUnpack, mb / mUnzip,
                mUnzip / mUnpack);
    std::printf("extra resident memory (peak): writer %.1f MiB, reader %.1f MiB\n", writeKiB / 1024.0,
                readKiB / 1024.0);
  } catch (const std::exception& e) {
    std::cerr << "archive_bench: " << e.what() << '\n';
    fs::remove_all(work);
    return 1;
  }
  fs::remove_all(work);
  return 0;
}
