// The reader parses the ZIP records itself (the same few records the writer
// writes, see archive_writer.cpp) so that entries can be read at their
// offsets by several threads at once, each through its own sys::Env file.

#include "maintenance/archive_reader.h"

#include <zlib.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <exception>
#include <functional>
#include <mutex>
#include <set>
#include <system_error>
#include <thread>

#include "maintenance/zip_format.h"

namespace maint {
namespace {

constexpr std::size_t kBuffer = 1 << 20;
constexpr std::uint32_t kUnknown32 = 0xffffffffu;

[[noreturn]] void decompressionError(int code, const std::string& what) {
  throw ArchiveError("Decompression error: " + std::to_string(code) + " (" + what + ")");
}

void readExactly(sys::File& file, std::uint64_t offset, unsigned char* data, std::size_t size) {
  std::size_t done = 0;
  while (done < size) {
    const std::size_t n = file.readAt(offset + done, data + done, size - done);
    if (n == 0) decompressionError(zip::kBadZipFile, "the archive \"" + file.path().string() + "\" is cut short");
    done += n;
  }
}

bool isSeparator(char c) { return c == '\\' || c == '/'; }

// Runs f, turning an Env failure into the archive text.
template <typename F>
auto envStep(F f) {
  try {
    return f();
  } catch (const std::system_error& e) {
    decompressionError(zip::kErrno, e.what());
  }
}

}  // namespace

ArchiveReader::ArchiveReader(sys::Env& env, sys::Path archive, ArchiveReaderOptions options)
    : env_(env), path_(std::move(archive)), options_(options) {
  try {
    file_ = env_.open(path_, sys::OpenMode::Read);
  } catch (const std::system_error& e) {
    throw ArchiveError("Failed to open for decompression file \"" + path_.string() + "\": " + e.what());
  }
  readDirectory();
}

ArchiveReader::~ArchiveReader() = default;

void ArchiveReader::readDirectory() {
  const std::uint64_t fileSize = envStep([&] { return file_->size(); });
  // The end record lies in the last 22 bytes plus a comment of up to 64 KiB.
  const std::size_t tailSize = static_cast<std::size_t>(std::min<std::uint64_t>(fileSize, zip::kEndSize + 0xffff));
  if (tailSize < zip::kEndSize) decompressionError(zip::kBadZipFile, "\"" + path_.string() + "\" is not a ZIP archive");
  std::vector<unsigned char> tail(tailSize);
  const std::uint64_t tailStart = fileSize - tailSize;
  envStep([&] {
    readExactly(*file_, tailStart, tail.data(), tail.size());
    return 0;
  });
  std::size_t end = tailSize - zip::kEndSize + 1;
  do {
    --end;
    if (zip::get32(&tail[end]) == zip::kEndSig) break;
  } while (end > 0);
  if (zip::get32(&tail[end]) != zip::kEndSig) {
    decompressionError(zip::kBadZipFile, "\"" + path_.string() + "\" is not a ZIP archive");
  }
  std::uint64_t count = zip::get16(&tail[end + 10]);
  std::uint64_t cdSize = zip::get32(&tail[end + 12]);
  std::uint64_t cdOffset = zip::get32(&tail[end + 16]);
  const std::uint64_t endAt = tailStart + end;
  if (endAt >= zip::kEnd64LocatorSize) {
    unsigned char loc[zip::kEnd64LocatorSize];
    envStep([&] {
      readExactly(*file_, endAt - zip::kEnd64LocatorSize, loc, sizeof loc);
      return 0;
    });
    if (zip::get32(loc) == zip::kEnd64LocatorSig) {
      const std::uint64_t end64At = zip::get64(loc + 8);
      unsigned char rec[zip::kEnd64Size];
      if (end64At > fileSize - zip::kEnd64Size) decompressionError(zip::kBadZipFile, "ZIP64 end record out of range");
      envStep([&] {
        readExactly(*file_, end64At, rec, sizeof rec);
        return 0;
      });
      if (zip::get32(rec) != zip::kEnd64Sig) decompressionError(zip::kBadZipFile, "ZIP64 end record missing");
      count = zip::get64(rec + 32);
      cdSize = zip::get64(rec + 40);
      cdOffset = zip::get64(rec + 48);
    }
  }
  if (cdOffset > fileSize || cdSize > fileSize - cdOffset || count > cdSize / zip::kCentralHeaderSize) {
    decompressionError(zip::kBadZipFile, "central directory out of range");
  }
  std::vector<unsigned char> cd(static_cast<std::size_t>(cdSize));
  envStep([&] {
    readExactly(*file_, cdOffset, cd.data(), cd.size());
    return 0;
  });
  std::size_t at = 0;
  entries_.reserve(static_cast<std::size_t>(count));
  for (std::uint64_t i = 0; i < count; ++i) {
    if (cd.size() - at < zip::kCentralHeaderSize || zip::get32(&cd[at]) != zip::kCentralHeaderSig) {
      decompressionError(zip::kBadZipFile, "damaged central directory");
    }
    const unsigned char* h = &cd[at];
    Entry e;
    e.flags = zip::get16(h + 8);
    e.method = zip::get16(h + 10);
    e.dosTime = zip::get32(h + 12);
    e.crc = zip::get32(h + 16);
    e.compressedSize = zip::get32(h + 20);
    e.size = zip::get32(h + 24);
    const std::size_t nameLen = zip::get16(h + 28);
    const std::size_t extraLen = zip::get16(h + 30);
    const std::size_t commentLen = zip::get16(h + 32);
    e.offset = zip::get32(h + 42);
    const std::size_t total = zip::kCentralHeaderSize + nameLen + extraLen + commentLen;
    if (cd.size() - at < total) decompressionError(zip::kBadZipFile, "damaged central directory");
    e.name.assign(reinterpret_cast<const char*>(h + zip::kCentralHeaderSize), nameLen);
    e.name.resize(std::min(e.name.find('\0'), e.name.size()));
    // ZIP64 extra field: the values whose header field is all ones, in order.
    const unsigned char* x = h + zip::kCentralHeaderSize + nameLen;
    for (std::size_t xa = 0; xa + 4 <= extraLen;) {
      const std::uint16_t id = zip::get16(x + xa);
      const std::size_t len = zip::get16(x + xa + 2);
      if (xa + 4 + len > extraLen) break;
      if (id == zip::kZip64ExtraId) {
        std::size_t f = xa + 4;
        const std::size_t fEnd = xa + 4 + len;
        auto take = [&](std::uint64_t& v) {
          if (v != kUnknown32) return;
          if (f + 8 > fEnd) decompressionError(zip::kBadZipFile, "damaged ZIP64 field of \"" + e.name + '"');
          v = zip::get64(x + f);
          f += 8;
        };
        take(e.size);
        take(e.compressedSize);
        take(e.offset);
      }
      xa += 4 + len;
    }
    if (e.offset > cdOffset || e.compressedSize > cdOffset - e.offset) {
      decompressionError(zip::kBadZipFile, "entry \"" + e.name + "\" lies outside the archive's data");
    }
    totalSize_ += e.size;
    entries_.push_back(std::move(e));
    at += total;
  }
}

sys::Path ArchiveReader::targetPath(const std::string& name) {
  if (name.empty() || isSeparator(name.back())) return {};
  sys::Path rel;
  std::size_t i = 0;
  while (i < name.size() && isSeparator(name[i])) ++i;
  bool first = true;
  while (i < name.size()) {
    std::size_t j = i;
    while (j < name.size() && !isSeparator(name[j])) ++j;
    const std::string element = name.substr(i, j - i);
    i = j + 1;
    if (element.empty() || element == ".") continue;
    if (element == "..") decompressionError(zip::kBadZipFile, "entry name \"" + name + "\" leads out of the folder");
    if (first && element.back() == ':') {
      decompressionError(zip::kBadZipFile, "entry name \"" + name + "\" is an absolute path");
    }
    first = false;
    rel /= element;
  }
  if (rel.empty()) decompressionError(zip::kBadZipFile, "entry name \"" + name + "\" names no file");
  return rel;
}

void ArchiveReader::unpackTo(const sys::Path& folder, const Progress& progress, std::stop_token stop) {
  // 1. Every name, checked before anything is written.
  std::vector<sys::Path> targets(entries_.size());
  std::set<sys::Path> folders;  // below folder, to create
  std::set<sys::Path> checked;  // prefixes known to be folders or missing
  for (std::size_t i = 0; i < entries_.size(); ++i) {
    const Entry& e = entries_[i];
    const sys::Path rel = targetPath(e.name);
    if (rel.empty()) continue;
    if ((e.flags & 1) != 0) decompressionError(zip::kBadZipFile, "entry \"" + e.name + "\" is encrypted");
    if (e.method != zip::kMethodDeflate && e.method != zip::kMethodStored) {
      decompressionError(zip::kBadZipFile, "entry \"" + e.name + "\" uses method " + std::to_string(e.method));
    }
    // Nothing on the way may be a link (or a special file) that would carry
    // the write somewhere else.
    sys::Path at = folder;
    bool missing = false;
    for (auto it = rel.begin(); it != rel.end(); ++it) {
      at /= *it;
      const bool leaf = std::next(it) == rel.end();
      if (!leaf) folders.insert(at);
      if (missing || checked.count(at) != 0) continue;
      const sys::FileType type = envStep([&] { return env_.stat(at).type; });
      if (type == sys::FileType::Link || type == sys::FileType::Other) {
        decompressionError(
            zip::kBadZipFile,
            "entry \"" + e.name + "\" would be written through the link or special file \"" + at.string() + '"');
      }
      if (type == sys::FileType::Missing) missing = true;
      if (!leaf) checked.insert(at);
    }
    targets[i] = folder / rel;
  }

  // 2. The folders, made here so that workers never race to make one; each
  // folder that gains an entry is synced at the end.
  std::set<sys::Path> toSync;
  for (const sys::Path& made : envStep([&] { return env_.createFolders(folder); })) toSync.insert(made.parent_path());
  toSync.insert(folder);
  for (const sys::Path& f : folders) {
    std::vector<sys::Path> made;
    try {
      made = env_.createFolders(f);
    } catch (const std::system_error& e) {
      throw ArchiveError("Decompression failed to create file \"" + f.string() + "\": " + e.what());
    }
    for (const sys::Path& m : made) toSync.insert(m.parent_path());
  }
  for (const sys::Path& t : targets) {
    if (!t.empty()) toSync.insert(t.parent_path());
  }

  // 3. The entries, inflated by the workers in index order.
  std::mutex mutex;
  std::condition_variable changed;
  std::size_t done = 0;        // guarded by mutex
  std::exception_ptr failure;  // guarded by mutex
  std::atomic<std::size_t> next{0};
  std::atomic<bool> failed{false};

  auto unpackOne = [&](sys::File& archive, std::size_t index, std::vector<unsigned char>& in,
                       std::vector<unsigned char>& out, z_stream& zs) {
    const Entry& e = entries_[index];
    const sys::Path& target = targets[index];
    if (target.empty()) return;
    unsigned char local[zip::kLocalHeaderSize];
    envStep([&] {
      readExactly(archive, e.offset, local, sizeof local);
      return 0;
    });
    if (zip::get32(local) != zip::kLocalHeaderSig)
      decompressionError(zip::kBadZipFile, "local header of \"" + e.name + "\" missing");
    std::uint64_t dataAt = e.offset + zip::kLocalHeaderSize + zip::get16(local + 26) + zip::get16(local + 28);
    std::unique_ptr<sys::File> outFile;
    try {
      outFile = env_.open(target, sys::OpenMode::CreateOrTruncate);
    } catch (const std::system_error& ex) {
      throw ArchiveError("Decompression failed to create file \"" + target.string() + "\": " + ex.what());
    }
    std::uint64_t left = e.compressedSize;
    std::uint64_t written = 0;
    std::uint32_t crc = 0;
    bool ended = e.method == zip::kMethodStored;
    if (!ended && inflateReset(&zs) != Z_OK) decompressionError(Z_STREAM_ERROR, "inflate reset");
    auto emit = [&](const unsigned char* data, std::size_t size) {
      if (size == 0) return;
      crc = static_cast<std::uint32_t>(crc32_z(crc, data, size));
      written += size;
      if (written > e.size) decompressionError(zip::kCrcError, "\"" + e.name + "\" is longer than recorded");
      envStep([&] {
        outFile->write(data, size);
        return 0;
      });
    };
    while (left > 0) {
      if (stop.stop_requested()) throw OperationStopped("Unpacking \"" + path_.string() + "\" was stopped");
      if (failed.load()) return;
      const std::size_t n = static_cast<std::size_t>(std::min<std::uint64_t>(left, in.size()));
      envStep([&] {
        readExactly(archive, dataAt, in.data(), n);
        return 0;
      });
      dataAt += n;
      left -= n;
      if (e.method == zip::kMethodStored) {
        emit(in.data(), n);
        continue;
      }
      zs.next_in = in.data();
      zs.avail_in = static_cast<uInt>(n);
      while (zs.avail_in > 0 && !ended) {
        zs.next_out = out.data();
        zs.avail_out = static_cast<uInt>(out.size());
        const int rc = inflate(&zs, Z_NO_FLUSH);
        if (rc != Z_OK && rc != Z_STREAM_END && rc != Z_BUF_ERROR) {
          decompressionError(rc, std::string(zs.msg != nullptr ? zs.msg : "inflate") + " in \"" + e.name + '"');
        }
        emit(out.data(), out.size() - zs.avail_out);
        if (rc == Z_STREAM_END) ended = true;
        if (rc == Z_BUF_ERROR) break;
      }
    }
    // Output the inflater still holds once all input is in.
    while (!ended) {
      zs.next_out = out.data();
      zs.avail_out = static_cast<uInt>(out.size());
      const int rc = inflate(&zs, Z_NO_FLUSH);
      emit(out.data(), out.size() - zs.avail_out);
      if (rc == Z_STREAM_END)
        ended = true;
      else if (zs.avail_out == out.size())
        decompressionError(Z_DATA_ERROR, "\"" + e.name + "\" is cut short");
    }
    if (written != e.size || crc != e.crc) decompressionError(zip::kCrcError, "checksum mismatch in \"" + e.name + '"');
    envStep([&] {
      outFile->close();
      env_.setModified(target, zip::fromDosDateTime(e.dosTime));
      return 0;
    });
  };

  auto work = [&] {
    z_stream zs{};
    bool zsReady = false;
    try {
      std::unique_ptr<sys::File> archive = envStep([&] { return env_.open(path_, sys::OpenMode::Read); });
      std::vector<unsigned char> in(kBuffer);
      std::vector<unsigned char> out(kBuffer);
      if (inflateInit2(&zs, -15) != Z_OK) decompressionError(Z_MEM_ERROR, "inflate init");
      zsReady = true;
      for (;;) {
        if (failed.load()) break;
        if (stop.stop_requested()) throw OperationStopped("Unpacking \"" + path_.string() + "\" was stopped");
        const std::size_t index = next.fetch_add(1);
        if (index >= entries_.size()) break;
        unpackOne(*archive, index, in, out, zs);
        {
          std::lock_guard lock(mutex);
          ++done;
        }
        changed.notify_all();
      }
    } catch (...) {
      std::lock_guard lock(mutex);
      if (!failure) failure = std::current_exception();
      failed = true;
    }
    if (zsReady) inflateEnd(&zs);
    changed.notify_all();
  };

  unsigned threads = options_.threads;
  if (threads == 0) threads = std::max(1u, std::thread::hardware_concurrency());
  threads = static_cast<unsigned>(std::min<std::size_t>(threads, std::max<std::size_t>(1, entries_.size())));
  std::vector<std::thread> workers;
  for (unsigned i = 0; i < threads; ++i) workers.emplace_back(work);
  std::exception_ptr callbackFailure;
  {
    std::size_t reported = 0;
    std::unique_lock lock(mutex);
    for (;;) {
      changed.wait(lock, [&] { return failed.load() || done > reported || done == entries_.size(); });
      if (failed.load() || callbackFailure) break;
      const std::size_t now = done;
      lock.unlock();
      try {
        while (reported < now) {
          ++reported;
          if (progress) progress(reported, entries_.size());
        }
      } catch (...) {
        callbackFailure = std::current_exception();
        failed = true;
      }
      lock.lock();
      if (callbackFailure || reported == entries_.size()) break;
    }
  }
  for (auto& t : workers) t.join();
  if (callbackFailure) std::rethrow_exception(callbackFailure);
  if (failure) std::rethrow_exception(failure);

  // 4. Every file, then the names of the new files and folders, on disk.
  // The syncs run last and from many threads at once: by then most data has
  // been written back, and the file system commits its journal once for
  // many waiting syncs instead of once per file.
  std::vector<std::function<void()>> syncs;
  for (const sys::Path& t : targets) {
    if (!t.empty()) syncs.emplace_back([this, &t] { env_.open(t, sys::OpenMode::Read)->sync(); });
  }
  std::vector<std::function<void()>> folderSyncs;
  for (const sys::Path& f : toSync) folderSyncs.emplace_back([this, &f] { env_.syncFolder(f); });
  runAll(syncs, stop);
  runAll(folderSyncs, stop);
}

void ArchiveReader::runAll(const std::vector<std::function<void()>>& jobs, std::stop_token stop) {
  std::atomic<std::size_t> next{0};
  std::mutex mutex;
  std::exception_ptr failure;  // guarded by mutex
  auto work = [&] {
    for (;;) {
      const std::size_t i = next.fetch_add(1);
      if (i >= jobs.size()) return;
      try {
        if (stop.stop_requested()) throw OperationStopped("Unpacking \"" + path_.string() + "\" was stopped");
        jobs[i]();
      } catch (const std::system_error& e) {
        std::lock_guard lock(mutex);
        if (!failure)
          failure = std::make_exception_ptr(
              ArchiveError("Decompression error: " + std::to_string(zip::kErrno) + " (" + e.what() + ")"));
        next = jobs.size();
      } catch (...) {
        std::lock_guard lock(mutex);
        if (!failure) failure = std::current_exception();
        next = jobs.size();
      }
    }
  };
  const std::size_t threads = std::min<std::size_t>(options_.syncThreads == 0 ? 1 : options_.syncThreads, jobs.size());
  std::vector<std::thread> pool;
  for (std::size_t i = 1; i < threads; ++i) pool.emplace_back(work);
  work();
  for (auto& t : pool) t.join();
  if (failure) std::rethrow_exception(failure);
}

}  // namespace maint
