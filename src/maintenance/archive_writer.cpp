// The ZIP records are written here rather than through minizip: minizip
// compresses an entry on the thread that writes it, one entry at a time,
// and the backup needs chunks compressed on worker threads and joined in
// order, written through sys::Env so that every write, sync and rename can
// be failed in tests. The records are few and fixed (local header with a
// ZIP64 extra field, central directory, ZIP64 end records), and minizip's
// reader and standard tools read the result back in the tests.

#include "maintenance/archive_writer.h"

#include <libdeflate.h>
#include <sys/resource.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <exception>
#include <limits>
#include <mutex>
#include <optional>
#include <system_error>
#include <thread>

#include "framework/log.h"
#include "maintenance/zip_format.h"

namespace maint {
namespace {

constexpr std::size_t kWindow = 32768;
constexpr std::size_t kWriteBuffer = 1 << 20;
constexpr std::uint32_t kUnknown32 = 0xffffffffu;

std::uint32_t size32(std::uint64_t size) { return size >= kUnknown32 ? kUnknown32 : static_cast<std::uint32_t>(size); }

std::string compressionError(int code, const std::string& what) {
  return "Compression error: " + std::to_string(code) + " (" + what + ")";
}

// One piece of one file on its way through the pipeline.
struct Chunk {
  std::size_t entry = 0;
  bool first = false;
  bool last = false;
  bool skipped = false;
  std::string reason;         // why the entry was skipped
  std::uint32_t dosTime = 0;  // first chunk of an entry
  std::vector<unsigned char> input;
  std::vector<unsigned char> window;  // up to 32 KiB of input before this chunk
  std::vector<unsigned char> output;  // raw deflate
  std::uint32_t crc = 0;
  int error = 0;  // compression library's code; 0: fine
  std::string errorText;
  bool done = false;  // guarded by Pipeline::mutex_
};

// Per worker: the two encoders, reused from chunk to chunk.
class Encoder {
 public:
  explicit Encoder(int level) : whole_(libdeflate_alloc_compressor(level)) {
    stream_.zalloc = Z_NULL;
    stream_.zfree = Z_NULL;
    stream_.opaque = Z_NULL;
    streamReady_ = deflateInit2(&stream_, level, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY) == Z_OK;
  }
  ~Encoder() {
    if (whole_ != nullptr) libdeflate_free_compressor(whole_);
    if (streamReady_) deflateEnd(&stream_);
  }
  Encoder(const Encoder&) = delete;
  Encoder& operator=(const Encoder&) = delete;

  void run(Chunk& c) {
    c.crc = static_cast<std::uint32_t>(crc32_z(0, c.input.data(), c.input.size()));
    if (c.first && c.last) {
      // The whole entry in one buffer: the faster whole-buffer encoder.
      if (whole_ == nullptr) return fail(c, Z_MEM_ERROR, "no memory for the encoder");
      c.output.resize(libdeflate_deflate_compress_bound(whole_, c.input.size()));
      const std::size_t n =
          libdeflate_deflate_compress(whole_, c.input.data(), c.input.size(), c.output.data(), c.output.size());
      if (n == 0) return fail(c, Z_BUF_ERROR, "output larger than its bound");
      c.output.resize(n);
      return;
    }
    // A piece of a longer entry: a stream primed with the window before it,
    // ended with a sync flush (byte-aligned, not final) unless it is the last.
    if (!streamReady_) return fail(c, Z_MEM_ERROR, "no memory for the encoder");
    int rc = deflateReset(&stream_);
    if (rc == Z_OK && !c.window.empty()) {
      rc = deflateSetDictionary(&stream_, c.window.data(), static_cast<uInt>(c.window.size()));
    }
    if (rc != Z_OK) return fail(c, rc, "deflate reset");
    c.output.resize(deflateBound(&stream_, c.input.size()) + 64);
    stream_.next_in = c.input.data();
    stream_.avail_in = static_cast<uInt>(c.input.size());
    std::size_t used = 0;
    const int flush = c.last ? Z_FINISH : Z_SYNC_FLUSH;
    for (;;) {
      stream_.next_out = c.output.data() + used;
      stream_.avail_out = static_cast<uInt>(c.output.size() - used);
      rc = deflate(&stream_, flush);
      used = c.output.size() - stream_.avail_out;
      if (rc == Z_STREAM_END || (rc == Z_OK && flush == Z_SYNC_FLUSH && stream_.avail_out > 0)) break;
      if (rc != Z_OK && rc != Z_BUF_ERROR) return fail(c, rc, "deflate");
      c.output.resize(c.output.size() * 2);
    }
    c.output.resize(used);
  }

 private:
  static void fail(Chunk& c, int code, const char* what) {
    c.error = code;
    c.errorText = what;
  }

  libdeflate_compressor* whole_;
  z_stream stream_{};
  bool streamReady_ = false;
};

}  // namespace

// The worker threads and the queue of chunks between the reading, the
// compressing and the writing. Chunks are written in the order they were
// queued, whichever worker finishes first.
class ArchiveWriter::Pipeline {
 public:
  Pipeline(ArchiveWriter& writer, std::stop_token stop) : w_(writer), stop_(std::move(stop)) {
    unsigned threads = w_.options_.threads;
    if (threads == 0) threads = std::max(1u, std::thread::hardware_concurrency());
    maxInFlight_ = 2 * threads + 2;
    for (unsigned i = 0; i < threads; ++i) workers_.emplace_back([this] { work(); });
  }
  ~Pipeline() {
    {
      std::lock_guard lock(mutex_);
      quit_ = true;
    }
    wake_.notify_all();
    for (auto& t : workers_) t.join();
  }

  void run() {
    for (std::size_t i = 0; i < w_.entries_.size(); ++i) readEntry(i);
    while (!inFlight_.empty()) writeFront();
  }

 private:
  void checkStop() {
    if (stop_.stop_requested())
      throw OperationStopped("Writing the archive \"" + w_.destination_.string() + "\" was stopped");
  }

  void readEntry(std::size_t index) {
    checkStop();
    Entry& entry = w_.entries_[index];
    std::unique_ptr<sys::File> in;
    auto head = std::make_unique<Chunk>();
    head->entry = index;
    head->first = true;
    try {
      in = w_.env_.open(entry.file, sys::OpenMode::Read);
      head->dosTime = zip::toDosDateTime(w_.env_.stat(entry.file, true).modified);
    } catch (const std::system_error& e) {
      head->skipped = true;
      head->reason = e.what();
      head->done = true;
      queue(std::move(head), false);
      return;
    }
    // A buffer of the file's size (up to a chunk) when it fits: most files
    // are far smaller than a chunk.
    std::size_t capacity = w_.options_.chunkSize;
    try {
      capacity = static_cast<std::size_t>(std::min<std::uint64_t>(capacity, in->size() + 1));
    } catch (const std::system_error&) {
    }
    std::vector<unsigned char> data = readChunk(*in, capacity);
    std::unique_ptr<Chunk> current = std::move(head);
    for (;;) {
      current->input = std::move(data);
      if (current->input.size() < capacity) {
        current->last = true;
      } else {
        capacity = w_.options_.chunkSize;
        data = readChunk(*in, capacity);
        current->last = data.empty();
      }
      std::vector<unsigned char> window;
      if (!current->last) {
        const auto& inp = current->input;
        window.assign(inp.end() - static_cast<std::ptrdiff_t>(std::min(kWindow, inp.size())), inp.end());
      }
      const bool last = current->last;
      queue(std::move(current), true);
      if (last) break;
      checkStop();
      current = std::make_unique<Chunk>();
      current->entry = index;
      current->window = std::move(window);
    }
  }

  std::vector<unsigned char> readChunk(sys::File& in, std::size_t capacity) {
    std::vector<unsigned char> data(capacity);
    std::size_t used = 0;
    try {
      while (used < data.size()) {
        const std::size_t n = in.read(data.data() + used, data.size() - used);
        if (n == 0) break;
        used += n;
      }
    } catch (const std::system_error& e) {
      throw ArchiveError(compressionError(zip::kErrno, e.what()));
    }
    data.resize(used);
    return data;
  }

  void queue(std::unique_ptr<Chunk> chunk, bool compress) {
    // Keep memory bounded: write finished chunks until there is room.
    while (inFlight_.size() >= maxInFlight_) writeFront();
    Chunk* raw = chunk.get();
    {
      std::lock_guard lock(mutex_);
      inFlight_.push_back(std::move(chunk));
      if (compress) todo_.push_back(raw);
    }
    if (compress) wake_.notify_one();
    // Write whatever is ready without waiting, so output keeps flowing.
    while (!inFlight_.empty() && frontDone()) writeFront();
  }

  bool frontDone() {
    std::lock_guard lock(mutex_);
    return inFlight_.front()->done;
  }

  void writeFront() {
    std::unique_ptr<Chunk> c;
    {
      std::unique_lock lock(mutex_);
      finished_.wait(lock, [&] { return inFlight_.front()->done; });
      c = std::move(inFlight_.front());
      inFlight_.pop_front();
    }
    Entry& entry = w_.entries_[c->entry];
    if (c->skipped) {
      report(entry, c->entry, true, c->reason);
      return;
    }
    if (c->error != 0)
      throw ArchiveError(compressionError(c->error, c->errorText + " of \"" + entry.file.string() + '"'));
    try {
      if (c->first) {
        entry.dosTime = c->dosTime;
        entry.crc = c->crc;
        entry.size = c->input.size();
        entry.compressedSize = c->output.size();
        w_.writeLocalHeader(entry, c->last);
      } else {
        entry.crc = static_cast<std::uint32_t>(crc32_combine(entry.crc, c->crc, static_cast<z_off_t>(c->input.size())));
        entry.size += c->input.size();
        entry.compressedSize += c->output.size();
      }
      w_.append(c->output.data(), c->output.size());
      if (c->last && !c->first) w_.finishLocalHeader(entry);
    } catch (const std::system_error& e) {
      throw ArchiveError(compressionError(zip::kErrno, e.what()));
    }
    if (c->last) {
      entry.written = true;
      report(entry, c->entry, false, {});
    }
  }

  void report(const Entry& entry, std::size_t index, bool skipped, std::string reason) {
    if (!w_.callback_) return;
    w_.callback_(EntryReport{index, entry.file, entry.name, skipped, std::move(reason), entry.size});
  }

  void work() {
    // Compression yields to the server's requests.
    const pid_t tid = gettid();
    errno = 0;
    const int nice = getpriority(PRIO_PROCESS, static_cast<id_t>(tid));
    if (errno == 0) setpriority(PRIO_PROCESS, static_cast<id_t>(tid), std::min(19, nice + w_.options_.workerNice));
    Encoder encoder(w_.options_.level);
    for (;;) {
      Chunk* c = nullptr;
      {
        std::unique_lock lock(mutex_);
        wake_.wait(lock, [&] { return quit_ || !todo_.empty(); });
        if (quit_) return;
        c = todo_.front();
        todo_.pop_front();
      }
      try {
        encoder.run(*c);
      } catch (const std::exception& e) {
        c->error = Z_MEM_ERROR;
        c->errorText = e.what();
      }
      c->input.shrink_to_fit();
      {
        std::lock_guard lock(mutex_);
        c->done = true;
        c->window.clear();
      }
      finished_.notify_all();
    }
  }

  ArchiveWriter& w_;
  std::stop_token stop_;
  std::size_t maxInFlight_ = 0;
  std::mutex mutex_;
  std::condition_variable wake_;                 // work queued or quit
  std::condition_variable finished_;             // a chunk is done
  std::deque<std::unique_ptr<Chunk>> inFlight_;  // in archive order; guarded by mutex_
  std::deque<Chunk*> todo_;                      // guarded by mutex_
  bool quit_ = false;                            // guarded by mutex_
  std::vector<std::thread> workers_;
};

ArchiveWriter::ArchiveWriter(sys::Env& env, sys::Path destination, ArchiveWriterOptions options)
    : env_(env), destination_(std::move(destination)), options_(options) {
  if (options_.chunkSize < kWindow) options_.chunkSize = kWindow;
  try {
    const sys::Path folder = destination_.parent_path();
    if (!folder.empty()) env_.createFolders(folder);
    file_ = env_.createTemp(folder, "." + destination_.filename().string() + ".tmp-", &temp_);
  } catch (const std::system_error& e) {
    throw ArchiveError("Failed to create destination file \"" + destination_.string() + "\": " + e.what());
  }
  buffer_.reserve(kWriteBuffer + 4096);
}

ArchiveWriter::~ArchiveWriter() { discard(); }

void ArchiveWriter::add(sys::Path file, std::string entryName) {
  if (spent_) throw std::logic_error("ArchiveWriter::add after commit");
  if (entryName.empty() || entryName.size() > 0xffff) {
    throw ArchiveError("Compression error: " + std::to_string(zip::kInternalError) +
                       " (an entry name must have 1 to 65535 bytes: \"" + entryName.substr(0, 64) + "\")");
  }
  entries_.push_back(Entry{std::move(file), std::move(entryName)});
}

void ArchiveWriter::commit(std::stop_token stop) {
  if (spent_) throw std::logic_error("ArchiveWriter::commit twice");
  spent_ = true;
  try {
    {
      Pipeline pipeline(*this, stop);
      pipeline.run();
    }
    if (stop.stop_requested())
      throw OperationStopped("Writing the archive \"" + destination_.string() + "\" was stopped");
    try {
      writeCentralDirectory();
      flush();
    } catch (const std::system_error& e) {
      throw ArchiveError("Failed to write the archive's directory: " + std::string(e.what()));
    }
    try {
      file_->sync();
      file_->close();
    } catch (const std::system_error& e) {
      throw ArchiveError("Failed to close the archive \"" + temp_.string() + "\": " + e.what());
    }
    file_.reset();
    try {
      env_.rename(temp_, destination_);
    } catch (const std::system_error& e) {
      throw ArchiveError("Failed to move the archive into place as \"" + destination_.string() + "\": " + e.what());
    }
    temp_.clear();
    try {
      env_.syncFolder(destination_.parent_path());
    } catch (const std::system_error& e) {
      // The archive is whole (its content reached the disk before the
      // rename) and has replaced the older one, but its name may not
      // survive a power loss: the backup fails, and the archive stays, since
      // removing it would leave nothing under that name.
      throw ArchiveError("Failed to flush the folder of the archive \"" + destination_.string() + "\": " + e.what());
    }
  } catch (...) {
    discard();
    throw;
  }
}

void ArchiveWriter::append(const void* data, std::size_t size) {
  buffer_.append(static_cast<const char*>(data), size);
  if (buffer_.size() >= kWriteBuffer) flush();
}

void ArchiveWriter::flush() {
  if (buffer_.empty()) return;
  file_->write(buffer_.data(), buffer_.size());
  flushed_ += buffer_.size();
  buffer_.clear();
}

void ArchiveWriter::patch(std::uint64_t offset, const std::string& bytes) {
  // Still buffered: change the buffer; already written: write over it.
  std::size_t done = 0;
  if (offset < flushed_) {
    const std::size_t onDisk = static_cast<std::size_t>(std::min<std::uint64_t>(bytes.size(), flushed_ - offset));
    file_->writeAt(offset, bytes.data(), onDisk);
    done = onDisk;
  }
  if (done < bytes.size()) {
    buffer_.replace(static_cast<std::size_t>(offset + done - flushed_), bytes.size() - done, bytes, done);
  }
}

void ArchiveWriter::writeLocalHeader(Entry& entry, bool final) {
  // Sizes and checksum go in now when the entry is one chunk, otherwise
  // finishLocalHeader() fills them in after the data.
  entry.offset = flushed_ + buffer_.size();
  std::string h;
  zip::put32(h, zip::kLocalHeaderSig);
  zip::put16(h, zip::kVersion);
  zip::put16(h, 0);
  zip::put16(h, zip::kMethodDeflate);
  zip::put32(h, entry.dosTime);
  zip::put32(h, final ? entry.crc : 0);
  // Sizes both here (all ones when they do not fit) and in the ZIP64 extra
  // field, as minizip writes them.
  zip::put32(h, final ? size32(entry.compressedSize) : 0);
  zip::put32(h, final ? size32(entry.size) : 0);
  zip::put16(h, static_cast<std::uint16_t>(entry.name.size()));
  zip::put16(h, 20);
  h += entry.name;
  zip::put16(h, zip::kZip64ExtraId);
  zip::put16(h, 16);
  zip::put64(h, final ? entry.size : 0);
  zip::put64(h, final ? entry.compressedSize : 0);
  append(h.data(), h.size());
}

void ArchiveWriter::finishLocalHeader(const Entry& entry) {
  std::string head;
  zip::put32(head, entry.crc);
  zip::put32(head, size32(entry.compressedSize));
  zip::put32(head, size32(entry.size));
  patch(entry.offset + 14, head);
  std::string sizes;
  zip::put64(sizes, entry.size);
  zip::put64(sizes, entry.compressedSize);
  patch(entry.offset + zip::kLocalHeaderSize + entry.name.size() + 4, sizes);
}

void ArchiveWriter::writeCentralDirectory() {
  const std::uint64_t start = flushed_ + buffer_.size();
  std::uint64_t count = 0;
  for (const Entry& e : entries_) {
    if (!e.written) continue;
    ++count;
    std::string h;
    zip::put32(h, zip::kCentralHeaderSig);
    zip::put16(h, zip::kVersion);  // made by: MS-DOS host, ZIP 4.5
    zip::put16(h, zip::kVersion);
    zip::put16(h, 0);
    zip::put16(h, zip::kMethodDeflate);
    zip::put32(h, e.dosTime);
    zip::put32(h, e.crc);
    // Central values that fit 32 bits are written as they are, and only
    // those that do not go into a ZIP64 extra field: minizip's reader (the
    // reader of the original tools) takes the central values literally.
    std::string extra;
    if (e.size >= kUnknown32) zip::put64(extra, e.size);
    if (e.compressedSize >= kUnknown32) zip::put64(extra, e.compressedSize);
    if (e.offset >= kUnknown32) zip::put64(extra, e.offset);
    zip::put32(h, size32(e.compressedSize));
    zip::put32(h, size32(e.size));
    zip::put16(h, static_cast<std::uint16_t>(e.name.size()));
    zip::put16(h, static_cast<std::uint16_t>(extra.empty() ? 0 : extra.size() + 4));
    zip::put16(h, 0);  // comment
    zip::put16(h, 0);  // disk
    zip::put16(h, 0);  // internal attributes
    zip::put32(h, 0);  // external attributes
    zip::put32(h, size32(e.offset));
    h += e.name;
    if (!extra.empty()) {
      zip::put16(h, zip::kZip64ExtraId);
      zip::put16(h, static_cast<std::uint16_t>(extra.size()));
      h += extra;
    }
    append(h.data(), h.size());
  }
  const std::uint64_t end64 = flushed_ + buffer_.size();
  const std::uint64_t cdSize = end64 - start;
  std::string t;
  zip::put32(t, zip::kEnd64Sig);
  zip::put64(t, zip::kEnd64Size - 12);
  zip::put16(t, zip::kVersion);
  zip::put16(t, zip::kVersion);
  zip::put32(t, 0);
  zip::put32(t, 0);
  zip::put64(t, count);
  zip::put64(t, count);
  zip::put64(t, cdSize);
  zip::put64(t, start);
  zip::put32(t, zip::kEnd64LocatorSig);
  zip::put32(t, 0);
  zip::put64(t, end64);
  zip::put32(t, 1);
  zip::put32(t, zip::kEndSig);
  zip::put16(t, 0);
  zip::put16(t, 0);
  zip::put16(t, static_cast<std::uint16_t>(std::min<std::uint64_t>(count, 0xffff)));
  zip::put16(t, static_cast<std::uint16_t>(std::min<std::uint64_t>(count, 0xffff)));
  zip::put32(t, static_cast<std::uint32_t>(std::min<std::uint64_t>(cdSize, kUnknown32)));
  zip::put32(t, static_cast<std::uint32_t>(std::min<std::uint64_t>(start, kUnknown32)));
  zip::put16(t, 0);  // no comment
  append(t.data(), t.size());
}

void ArchiveWriter::discard() noexcept {
  file_.reset();  // closes quietly
  if (temp_.empty()) return;
  try {
    env_.remove(temp_);
  } catch (const std::exception& e) {
    try {
      Log::Lock(Log::Error).logStreamLine()
          << "Failed to clean up file(s) at \"" << temp_.string() << "\": " << e.what();
    } catch (...) {
    }
  }
  temp_.clear();
}

}  // namespace maint
