#pragma once
// maint::ArchiveReader: reads a ZIP archive written by ArchiveWriter (or any
// ZIP archive whose entries are stored or deflated) and unpacks it into a
// folder.
//
// Opening reads the central directory (ZIP64 records and extra fields
// included), so the entry count and the total uncompressed size are known
// before anything is written, for a free-space check.
//
// unpackTo() first turns every entry name into a path below the folder and
// refuses the whole archive, before anything is created, when one name is
// unsafe: a ".." element, a drive prefix ("C:"), or a path that passes
// through a symbolic link or special file already on disk. Names map '\'
// and '/' to the separator; leading separators are dropped; directory
// entries (an empty name or one ending in a separator) are skipped. Entries
// are always written as regular files, never as links. Then the entries are
// inflated on worker threads, each file written through the Env and given
// its entry's time stamp (MS-DOS local time) as last write time; finally
// every file, then every folder that received a file or a new subfolder, is
// synced, so an unpacked tree survives a power loss once unpackTo()
// returns. Memory: two 1 MiB buffers per worker, whatever the archive's
// size.
//
// Ownership: the Env outlives the reader; the reader holds the archive file
// open until it is destroyed.
// Thread safety: one thread at a time; the progress callback runs on the
// thread that called unpackTo(), with the count of finished entries rising
// by one per call (1 to entryCount()).
// Failures: ArchiveError "Failed to open for decompression file \"<path>\""
// from the constructor when the file cannot be opened, "Decompression error:
// <code> (<what>)" for a damaged archive, an unsafe name, a checksum or
// length mismatch (code -105) or a deflate error (the inflate library's
// code), "Decompression failed to create file \"<path>\"" when a target
// cannot be created, and OperationStopped when the stop token was
// triggered. After a failure of unpackTo() the folder may hold part of the
// archive (never anything outside it); the caller removes it with its
// working folder.

#include <cstdint>
#include <functional>
#include <memory>
#include <stop_token>
#include <string>
#include <vector>

#include "framework/env.h"
#include "maintenance/archive_writer.h"

namespace maint {

struct ArchiveReaderOptions {
  unsigned threads = 0;      // inflating threads; 0: one per core
  unsigned syncThreads = 8;  // threads that sync the written files at the end
};

class ArchiveReader {
 public:
  struct Entry {
    std::string name;  // as stored, up to its first zero byte
    std::uint64_t size = 0;
    std::uint64_t compressedSize = 0;
    std::uint64_t offset = 0;  // of the local header
    std::uint32_t crc = 0;
    std::uint32_t dosTime = 0;
    std::uint16_t method = 0;
    std::uint16_t flags = 0;
  };
  using Progress = std::function<void(std::size_t done, std::size_t count)>;

  ArchiveReader(sys::Env& env, sys::Path archive, ArchiveReaderOptions options = {});
  ~ArchiveReader();
  ArchiveReader(const ArchiveReader&) = delete;
  ArchiveReader& operator=(const ArchiveReader&) = delete;

  const std::vector<Entry>& entries() const noexcept { return entries_; }
  std::size_t entryCount() const noexcept { return entries_.size(); }
  // Bytes the unpacked entries take, directory entries included (0 each).
  std::uint64_t totalSize() const noexcept { return totalSize_; }

  // Unpacks every entry into folder (created when missing), as described
  // above. Throws as above.
  void unpackTo(const sys::Path& folder, const Progress& progress = {}, std::stop_token stop = {});

  // The path below folder for an entry name; empty for a directory entry.
  // Throws ArchiveError for an unsafe name. Looks at nothing on disk.
  static sys::Path targetPath(const std::string& name);

 private:
  void readDirectory();
  // Runs the jobs on syncThreads threads; the first failure stops the rest
  // and is thrown.
  void runAll(const std::vector<std::function<void()>>& jobs, std::stop_token stop);

  sys::Env& env_;
  const sys::Path path_;
  const ArchiveReaderOptions options_;
  std::unique_ptr<sys::File> file_;
  std::vector<Entry> entries_;
  std::uint64_t totalSize_ = 0;
};

}  // namespace maint
