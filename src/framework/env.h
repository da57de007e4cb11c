#pragma once
// sys::Env: the one seam between the server and the operating system's
// files and clocks.
//
// Every file-system call of the store, the engine layer (outside SQLite's
// own files), the maintenance operations and the configuration loading goes
// through an Env, and so does every reading of the wall clock and every
// pause. Production uses Env::posix(); tests hand the layers a FaultEnv
// (tests/support/fault_env.h) that fails chosen calls, drops what was not
// synced, and runs a clock of its own.
//
// Failures: every member throws std::system_error whose code is the
// operating system's error number (generic category) and whose text names
// the step and the path, for example: write "/db/x/d/a/.cvtmp.Xy12ab":
// No space left on device. The error number becomes an exception in exactly
// one place (PosixEnv's fail()). Where a missing path is an ordinary
// outcome, the member says so (stat, remove, removeAll).
// Ownership: the Env outlives every File it opened and every caller it was
// handed to; Env::posix() lives for the whole process.
// Thread safety: every member of an Env may be called from any thread; a
// File is used by one thread at a time.

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <stop_token>
#include <string>
#include <string_view>
#include <vector>

namespace sys {

using Path = std::filesystem::path;
using WallClock = std::chrono::system_clock;

// An open file. Reads and writes move through the file from the current
// position (0 when opened), or at an explicit offset.
class File {
 public:
  virtual ~File() = default;
  File(const File&) = delete;
  File& operator=(const File&) = delete;

  const Path& path() const noexcept { return path_; }

  // Up to size bytes at the current position; 0 at the end of the file.
  virtual std::size_t read(void* data, std::size_t size) = 0;
  // Up to size bytes at offset; 0 at or past the end of the file.
  virtual std::size_t readAt(std::uint64_t offset, void* data, std::size_t size) = 0;
  // All size bytes at the current position, which moves past them.
  virtual void write(const void* data, std::size_t size) = 0;
  // All size bytes at offset; the current position does not move.
  virtual void writeAt(std::uint64_t offset, const void* data, std::size_t size) = 0;
  virtual void seek(std::uint64_t position) = 0;
  virtual std::uint64_t position() const noexcept = 0;
  virtual std::uint64_t size() = 0;
  // The content (and the size) on disk.
  virtual void sync() = 0;
  // Closes now and reports what closing found (a late write error); the
  // destructor closes quietly.
  virtual void close() = 0;

 protected:
  explicit File(Path path) : path_(std::move(path)) {}

 private:
  Path path_;
};

enum class FileType { Missing, Regular, Folder, Link, Other };

struct FileInfo {
  FileType type = FileType::Missing;
  std::uint64_t size = 0;
  WallClock::time_point modified;  // last write (a folder's: its entries changed)
};

struct DirEntry {
  std::string name;
  FileType type = FileType::Other;  // of the entry itself: links are not followed
};

enum class OpenMode {
  Read,              // an existing file, for reading
  ReadWrite,         // an existing file, for reading and writing
  CreateNew,         // a new file; fails with EEXIST when the name exists
  CreateOrTruncate,  // a new or emptied file
};

class Env {
 public:
  virtual ~Env() = default;

  // The real operating system; lives for the whole process.
  static Env& posix();

  // ---- Files ---------------------------------------------------------------
  virtual std::unique_ptr<File> open(const Path& path, OpenMode mode) = 0;
  // A new, empty file in folder whose name is prefix followed by six random
  // characters; *made receives its path.
  virtual std::unique_ptr<File> createTemp(const Path& folder, std::string_view prefix, Path* made) = 0;
  // Forces the folder's entries (names created, renamed, removed) to disk.
  virtual void syncFolder(const Path& folder) = 0;
  // Replaces to atomically when it exists (a file, or an empty folder for a
  // folder).
  virtual void rename(const Path& from, const Path& to) = 0;
  // A second name for the file; EEXIST when to exists (nothing is replaced).
  virtual void link(const Path& from, const Path& to) = 0;
  // Removes a file, a link (not what it points to) or an empty folder;
  // false when nothing was there.
  virtual bool remove(const Path& path) = 0;
  // Removes the path and everything below it; links are removed, never
  // followed. The number of entries removed (0 when nothing was there).
  virtual std::uint64_t removeAll(const Path& path) = 0;
  // Creates the folder and its missing parents; returns the levels it made,
  // outermost first (none when the folder existed).
  virtual std::vector<Path> createFolders(const Path& folder) = 0;
  // The entries of a folder, in the order the file system lists them
  // ("." and ".." left out).
  virtual std::vector<DirEntry> list(const Path& folder) = 0;
  // What the path is; type Missing when nothing is there (or a component
  // of its folder is not a folder). With follow, a link is looked through.
  virtual FileInfo stat(const Path& path, bool follow = false) = 0;
  virtual void setModified(const Path& path, WallClock::time_point when) = 0;
  // Bytes that an unprivileged writer may still put on the file system of
  // path.
  virtual std::uint64_t freeSpace(const Path& path) = 0;
  // Whether the process may read and write the existing file; false when it
  // is missing; throws for a file that exists but may not be used so.
  virtual bool readWritable(const Path& path) = 0;

  // ---- Time ----------------------------------------------------------------
  virtual WallClock::time_point now() = 0;
  // Pauses for d, or until stop is requested; false when it was.
  virtual bool sleepFor(std::chrono::milliseconds d, std::stop_token stop = {}) = 0;

  // ---- Helpers built on the members above ------------------------------------
  // The whole content of a file.
  std::string readFile(const Path& path);
  // Whole seconds since 1970-01-01 UTC.
  std::int64_t nowSeconds();
  // Writes content to path all at once: a new file beside it, synced, renamed
  // over path, the folder synced. Readers see the old or the new content.
  void writeFileDurably(const Path& path, std::string_view content);
  // Copies a regular file's bytes into a new file to (created or
  // truncated), synced; returns the bytes copied.
  std::uint64_t copyFile(const Path& from, const Path& to);

 protected:
  Env() = default;
};

}  // namespace sys
