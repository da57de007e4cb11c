#include "framework/buffers.h"

#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>

unsigned char* ExportedUCharAlloc::alloc(std::uint64_t size) {
  if (size == 0) return nullptr;
  if (size > std::numeric_limits<std::size_t>::max()) throw std::bad_alloc();
  void* p = std::malloc(static_cast<std::size_t>(size));
  if (!p) throw std::bad_alloc();
  return static_cast<unsigned char*>(p);
}

void ExportedUCharAlloc::operator()(unsigned char* p) const noexcept { std::free(p); }

MemBuffer::MemBuffer(std::uint64_t size) : data_(ExportedUCharAlloc::alloc(size)), size_(size) {}

MemBuffer::MemBuffer(unsigned char* data, std::uint64_t size) noexcept : data_(data), size_(data ? size : 0) {}

MemBuffer MemBuffer::copyOf(const void* data, std::uint64_t size) {
  MemBuffer b(size);
  if (size) std::memcpy(b.data(), data, static_cast<std::size_t>(size));
  return b;
}

void MemBuffer::grow(std::uint64_t size) {
  if (size <= size_) return;
  if (size > std::numeric_limits<std::size_t>::max()) throw std::bad_alloc();
  void* p = std::realloc(data_.get(), static_cast<std::size_t>(size));
  if (!p) throw std::bad_alloc();
  (void)data_.release();  // realloc has taken the old block over
  data_.reset(static_cast<unsigned char*>(p));
  size_ = size;
}

unsigned char* MemBuffer::release() noexcept {
  size_ = 0;
  return data_.release();
}

SharedMemBuffer::SharedMemBuffer(MemBuffer&& owned) {
  const std::uint64_t size = owned.size();
  if (unsigned char* p = owned.release()) {
    data_ = std::shared_ptr<unsigned char>(p, ExportedUCharAlloc());
    size_ = size;
  }
}
