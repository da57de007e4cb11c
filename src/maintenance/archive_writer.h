#pragma once
// maint::ArchiveWriter: writes one ZIP archive of backup files.
//
// Format of every entry: deflate, a ZIP64 extra field (local and central
// header), the name as the caller gives it (elements joined with '\', no
// leading separator), the file's last write time as local MS-DOS date and
// time, attributes 0, no comments, no directory entries. Entries appear in
// the order of add().
//
// The archive is built under a temporary name beside its destination
// (".<name>.tmp-XXXXXX"). commit() writes everything, syncs the file,
// renames it over the destination and syncs the folder, so the destination
// holds either its older content or the whole new archive, never a part.
// A writer that is destroyed uncommitted, or whose commit failed or was
// stopped, removes its temporary file and leaves the destination as it was.
//
// Work: add() only records the file; commit() reads the files on the calling
// thread, compresses them in chunks on worker threads (at a lower scheduling
// priority, so that requests are served first) and writes the compressed
// chunks in order on the calling thread. A file fitting one chunk becomes one
// whole-buffer deflate stream; a larger file is cut into chunks whose deflate
// streams are primed with the previous 32 KiB and joined, so the entry is one
// ordinary deflate stream. Memory is bounded by the number of chunks in
// flight (2 x threads + 2 of options.chunkSize, twice: input and output),
// whatever the size of the files.
//
// Ownership: the Env outlives the writer; the writer owns its temporary
// file and its worker threads (started and joined inside commit()).
// Thread safety: one thread at a time; the entry callback runs on the thread
// that called commit(), in add order.
// Failures: ArchiveError with "Failed to create destination file \"<path>\""
// from the constructor; from commit() "Compression error: <code> (<what>)"
// for a failure while writing an entry (code -1 for a file-system error, the
// deflate library's code otherwise), a clear text naming the step for the
// central directory, sync, close or rename, and OperationStopped when the
// stop token was triggered. A source file that cannot be opened is left out
// and reported as skipped; a read that fails once the file is open fails the
// archive (a silently cut entry would pass every checksum). One failure
// leaves the new archive in place: the folder's sync after the rename (the
// archive is whole and has replaced the older one; only its name may not
// survive a power loss).

#include <cstdint>
#include <functional>
#include <memory>
#include <stdexcept>
#include <stop_token>
#include <string>
#include <vector>

#include "framework/env.h"

namespace maint {

class ArchiveError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// An archive operation ended early because its stop token was triggered.
class OperationStopped : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

struct ArchiveWriterOptions {
  unsigned threads = 0;             // compression threads; 0: one per core
  int level = 3;                    // deflate level, 1 to 9
  int workerNice = 10;              // added to the workers' nice value
  std::size_t chunkSize = 1 << 20;  // bytes of a file compressed as one piece
};

class ArchiveWriter {
 public:
  struct EntryReport {
    std::size_t index;  // in add order, from 0
    const sys::Path& file;
    const std::string& name;
    bool skipped;        // the file could not be opened: not in the archive
    std::string reason;  // why it was skipped
    std::uint64_t size;  // bytes read from the file
  };
  using EntryCallback = std::function<void(const EntryReport&)>;

  // Creates the destination's missing parent folders and the temporary file.
  ArchiveWriter(sys::Env& env, sys::Path destination, ArchiveWriterOptions options = {});
  ~ArchiveWriter();
  ArchiveWriter(const ArchiveWriter&) = delete;
  ArchiveWriter& operator=(const ArchiveWriter&) = delete;

  // Records a file for the archive under entryName; nothing is read yet.
  // Throws ArchiveError for an empty name or one longer than 65535 bytes.
  void add(sys::Path file, std::string entryName);
  // Called once per added file, done or skipped, during commit().
  void onEntry(EntryCallback callback) { callback_ = std::move(callback); }
  // Writes, syncs and renames the archive into place. Throws as above; after
  // a failure nothing of this archive is left and the writer is spent.
  void commit(std::stop_token stop = {});

  const sys::Path& destination() const noexcept { return destination_; }
  const sys::Path& temporaryPath() const noexcept { return temp_; }
  std::size_t entryCount() const noexcept { return entries_.size(); }

 private:
  struct Entry {
    sys::Path file;
    std::string name;
    std::uint32_t dosTime = 0;
    std::uint32_t crc = 0;
    std::uint64_t size = 0;
    std::uint64_t compressedSize = 0;
    std::uint64_t offset = 0;
    bool written = false;
  };
  class Pipeline;
  friend class Pipeline;

  void append(const void* data, std::size_t size);
  void flush();
  void patch(std::uint64_t offset, const std::string& bytes);
  void writeLocalHeader(Entry& entry, bool final);
  void finishLocalHeader(const Entry& entry);
  void writeCentralDirectory();
  void discard() noexcept;

  sys::Env& env_;
  const sys::Path destination_;
  ArchiveWriterOptions options_;
  sys::Path temp_;
  std::unique_ptr<sys::File> file_;  // null once committed or discarded
  std::vector<Entry> entries_;
  EntryCallback callback_;
  std::string buffer_;         // bytes not yet written to file_
  std::uint64_t flushed_ = 0;  // bytes written to file_
  bool spent_ = false;
};

}  // namespace maint
