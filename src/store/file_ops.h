#pragma once
// DB::FileOps: the file-system calls of the store whose failure a test must
// be able to bring about (running as root, or on a disk that is not full,
// the real calls do not fail when asked to).
//
// Each member behaves like the POSIX call of its name: it returns what
// that call returns and leaves errno set on failure. The store reaches the
// calls through FileOps::current(), which is the real implementation
// unless a test has installed a Replacement.
//
// Thread safety: the real calls may run on any thread. Installing and
// removing a Replacement is not synchronised with calls in flight: tests
// install one while no store operation runs.

#include <sys/types.h>

#include <cstddef>

namespace DB {

class FileOps {
 public:
  virtual ~FileOps() = default;

  virtual int access(const char* path, int mode);
  virtual ssize_t write(int fd, const void* data, std::size_t size);
  virtual int fsync(int fd);
  virtual int rename(const char* from, const char* to);

  static FileOps& current() noexcept;

  // Makes ops the current calls for its lifetime; the previous ones come
  // back when it goes.
  class Replacement {
   public:
    explicit Replacement(FileOps& ops) noexcept;
    ~Replacement();
    Replacement(const Replacement&) = delete;
    Replacement& operator=(const Replacement&) = delete;

   private:
    FileOps* previous_;
  };
};

}  // namespace DB
