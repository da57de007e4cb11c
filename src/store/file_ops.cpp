#include "store/file_ops.h"

#include <unistd.h>

#include <atomic>
#include <cstdio>

namespace DB {
namespace {

FileOps g_real;
std::atomic<FileOps*> g_current{&g_real};

}  // namespace

int FileOps::access(const char* path, int mode) { return ::access(path, mode); }

ssize_t FileOps::write(int fd, const void* data, std::size_t size) { return ::write(fd, data, size); }

int FileOps::fsync(int fd) { return ::fsync(fd); }

int FileOps::rename(const char* from, const char* to) { return std::rename(from, to); }

FileOps& FileOps::current() noexcept { return *g_current.load(std::memory_order_acquire); }

FileOps::Replacement::Replacement(FileOps& ops) noexcept
    : previous_(g_current.exchange(&ops, std::memory_order_acq_rel)) {}

FileOps::Replacement::~Replacement() { g_current.store(previous_, std::memory_order_release); }

}  // namespace DB
