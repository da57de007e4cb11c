// Env::posix(): the Env of the real operating system, over POSIX calls.
// Every failing call ends in fail(), the one place where an error number
// becomes an exception.

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <mutex>
#include <system_error>
#include <thread>

#include "framework/env.h"
#include "framework/unique_fd.h"

namespace sys {
namespace {

// Linux moves at most about 2 GiB per read or write call.
constexpr std::size_t kMaxIo = std::size_t{1} << 30;

[[noreturn]] void fail(int error, std::string_view step, const Path& path) {
  throw std::system_error(error, std::generic_category(), std::string(step) + " \"" + path.string() + '"');
}

FileType typeOf(mode_t mode) {
  if (S_ISREG(mode)) return FileType::Regular;
  if (S_ISDIR(mode)) return FileType::Folder;
  if (S_ISLNK(mode)) return FileType::Link;
  return FileType::Other;
}

FileType typeOf(std::filesystem::file_type type) {
  switch (type) {
    case std::filesystem::file_type::regular:
      return FileType::Regular;
    case std::filesystem::file_type::directory:
      return FileType::Folder;
    case std::filesystem::file_type::symlink:
      return FileType::Link;
    case std::filesystem::file_type::not_found:
      return FileType::Missing;
    default:
      return FileType::Other;
  }
}

class PosixFile final : public File {
 public:
  PosixFile(Path path, UniqueFd fd) : File(std::move(path)), fd_(std::move(fd)) {}

  std::size_t read(void* data, std::size_t size) override {
    const std::size_t n = readAt(position_, data, size);
    position_ += n;
    return n;
  }

  std::size_t readAt(std::uint64_t offset, void* data, std::size_t size) override {
    for (;;) {
      const ssize_t n = ::pread(fd_.get(), data, std::min(size, kMaxIo), static_cast<off_t>(offset));
      if (n >= 0) return static_cast<std::size_t>(n);
      if (errno != EINTR) fail(errno, "read", path());
    }
  }

  void write(const void* data, std::size_t size) override {
    writeAt(position_, data, size);
    position_ += size;
  }

  void writeAt(std::uint64_t offset, const void* data, std::size_t size) override {
    const char* next = static_cast<const char*>(data);
    while (size > 0) {
      const ssize_t n = ::pwrite(fd_.get(), next, std::min(size, kMaxIo), static_cast<off_t>(offset));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) fail(n < 0 ? errno : EIO, "write", path());
      next += n;
      offset += static_cast<std::uint64_t>(n);
      size -= static_cast<std::size_t>(n);
    }
  }

  void seek(std::uint64_t position) override { position_ = position; }
  std::uint64_t position() const noexcept override { return position_; }

  std::uint64_t size() override {
    struct stat info {};
    if (::fstat(fd_.get(), &info) != 0) fail(errno, "stat", path());
    return static_cast<std::uint64_t>(info.st_size);
  }

  void sync() override {
    if (::fdatasync(fd_.get()) != 0) fail(errno, "flush", path());
  }

  void close() override {
    if (fd_.close() != 0) fail(errno, "close", path());
  }

 private:
  UniqueFd fd_;
  std::uint64_t position_ = 0;
};

class PosixEnv final : public Env {
 public:
  std::unique_ptr<File> open(const Path& path, OpenMode mode) override {
    int flags = O_CLOEXEC;
    switch (mode) {
      case OpenMode::Read:
        flags |= O_RDONLY;
        break;
      case OpenMode::ReadWrite:
        flags |= O_RDWR;
        break;
      case OpenMode::CreateNew:
        flags |= O_RDWR | O_CREAT | O_EXCL;
        break;
      case OpenMode::CreateOrTruncate:
        flags |= O_RDWR | O_CREAT | O_TRUNC;
        break;
    }
    UniqueFd fd(::open(path.c_str(), flags, 0644));
    if (!fd.valid()) fail(errno, "open", path);
    return std::make_unique<PosixFile>(path, std::move(fd));
  }

  std::unique_ptr<File> createTemp(const Path& folder, std::string_view prefix, Path* made) override {
    std::string name = (folder / prefix).string() + "XXXXXX";
    UniqueFd fd(::mkostemp(name.data(), O_CLOEXEC));
    if (!fd.valid()) fail(errno, "create a file in", folder);
    // mkostemp makes the file private to its owner; the server's files are
    // ordinary files.
    ::fchmod(fd.get(), 0644);
    if (made != nullptr) *made = name;
    return std::make_unique<PosixFile>(Path(name), std::move(fd));
  }

  void syncFolder(const Path& folder) override {
    const Path target = folder.empty() ? Path(".") : folder;
    const UniqueFd fd(::open(target.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd.valid()) fail(errno, "open folder", target);
    if (::fsync(fd.get()) != 0) fail(errno, "flush folder", target);
  }

  void rename(const Path& from, const Path& to) override {
    if (::rename(from.c_str(), to.c_str()) != 0) fail(errno, "rename to \"" + to.string() + "\"", from);
  }

  void link(const Path& from, const Path& to) override {
    if (::link(from.c_str(), to.c_str()) != 0) fail(errno, "link as \"" + to.string() + "\"", from);
  }

  bool remove(const Path& path) override {
    if (::remove(path.c_str()) == 0) return true;
    if (errno == ENOENT) return false;
    fail(errno, "remove", path);
  }

  std::uint64_t removeAll(const Path& path) override {
    std::error_code ec;
    const auto removed = std::filesystem::remove_all(path, ec);
    if (ec) fail(ec.value(), "remove", path);
    return removed;
  }

  std::vector<Path> createFolders(const Path& folder) override {
    std::vector<Path> missing;
    Path target = folder;
    if (!target.has_filename() && target.has_parent_path()) target = target.parent_path();  // "a/b/" is "a/b"
    for (Path level = target; !level.empty(); level = level.parent_path()) {
      struct stat info {};
      if (::stat(level.c_str(), &info) == 0) break;
      if (errno != ENOENT) fail(errno, "look at", level);
      missing.push_back(level);
      if (level == level.parent_path()) break;
    }
    std::reverse(missing.begin(), missing.end());
    std::vector<Path> made;
    for (const Path& level : missing) {
      if (::mkdir(level.c_str(), 0755) == 0) {
        made.push_back(level);
      } else if (errno != EEXIST) {
        fail(errno, "create folder", level);
      }
    }
    return made;
  }

  std::vector<DirEntry> list(const Path& folder) override {
    std::vector<DirEntry> entries;
    std::error_code ec;
    std::filesystem::directory_iterator it(folder, ec);
    for (const std::filesystem::directory_iterator end; !ec && it != end; it.increment(ec)) {
      std::error_code typeEc;
      const auto type = it->symlink_status(typeEc).type();
      entries.push_back({it->path().filename().string(), typeEc ? FileType::Other : typeOf(type)});
    }
    if (ec) fail(ec.value(), "list", folder);
    return entries;
  }

  FileInfo stat(const Path& path, bool follow) override {
    struct stat info {};
    const int rc = follow ? ::stat(path.c_str(), &info) : ::lstat(path.c_str(), &info);
    if (rc != 0) {
      if (errno == ENOENT || errno == ENOTDIR) return {};
      fail(errno, "look at", path);
    }
    FileInfo result;
    result.type = typeOf(info.st_mode);
    result.size = static_cast<std::uint64_t>(info.st_size);
    result.modified = WallClock::time_point(std::chrono::duration_cast<WallClock::duration>(
        std::chrono::seconds(info.st_mtim.tv_sec) + std::chrono::nanoseconds(info.st_mtim.tv_nsec)));
    return result;
  }

  void setModified(const Path& path, WallClock::time_point when) override {
    const auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(when.time_since_epoch()).count();
    timespec times[2]{};
    times[0].tv_nsec = UTIME_OMIT;
    times[1].tv_sec = static_cast<time_t>(ns / 1000000000);
    times[1].tv_nsec = static_cast<long>(ns % 1000000000);
    if (times[1].tv_nsec < 0) {
      times[1].tv_nsec += 1000000000;
      --times[1].tv_sec;
    }
    if (::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) fail(errno, "set the time of", path);
  }

  std::uint64_t freeSpace(const Path& path) override {
    struct statvfs info {};
    if (::statvfs(path.c_str(), &info) != 0) fail(errno, "look at the file system of", path);
    return static_cast<std::uint64_t>(info.f_bavail) * info.f_frsize;
  }

  bool readWritable(const Path& path) override {
    if (::access(path.c_str(), R_OK | W_OK) == 0) return true;
    if (errno == ENOENT || errno == ENOTDIR) return false;
    fail(errno, "access", path);
  }

  WallClock::time_point now() override { return WallClock::now(); }

  bool sleepFor(std::chrono::milliseconds d, std::stop_token stop) override {
    if (!stop.stop_possible()) {
      std::this_thread::sleep_for(d);
      return true;
    }
    std::mutex mutex;
    std::condition_variable_any woken;
    std::unique_lock lock(mutex);
    woken.wait_for(lock, stop, d, [] { return false; });
    return !stop.stop_requested();
  }
};

}  // namespace

Env& Env::posix() {
  static PosixEnv env;
  return env;
}

}  // namespace sys
