#pragma once
// Byte buffers in which data files and pack contents travel between the
// store, the commands and the wire.
//
// Ownership: a MemBuffer owns its bytes alone and releases them through
// ExportedUCharAlloc; a SharedMemBuffer shares them, and the last share
// releases them through the deleter it was given. An empty buffer of either
// kind is a null pointer with length 0.
// Thread safety: none beyond that of std::unique_ptr and std::shared_ptr.

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string_view>

// Allocates and releases the bytes of buffers. Bytes are not initialised.
struct ExportedUCharAlloc {
  // Returns nullptr for size 0; throws std::bad_alloc when memory runs out.
  static unsigned char* alloc(std::uint64_t size);
  void operator()(unsigned char* p) const noexcept;
};

class MemBuffer {
 public:
  MemBuffer() = default;
  // Allocates size uninitialised bytes (none for size 0).
  explicit MemBuffer(std::uint64_t size);
  // Takes over bytes allocated with ExportedUCharAlloc::alloc.
  MemBuffer(unsigned char* data, std::uint64_t size) noexcept;
  static MemBuffer copyOf(const void* data, std::uint64_t size);
  static MemBuffer copyOf(std::string_view text) { return copyOf(text.data(), text.size()); }

  unsigned char* data() const noexcept { return data_.get(); }
  std::uint64_t size() const noexcept { return size_; }
  bool empty() const noexcept { return size_ == 0; }
  std::string_view view() const noexcept {
    return {reinterpret_cast<const char*>(data_.get()), static_cast<std::size_t>(size_)};
  }

  // Grows the buffer to size bytes (no smaller than size()), keeping its
  // bytes; the new ones are not initialised. The bytes may move, so
  // pointers into them become invalid. A large buffer is remapped rather
  // than copied (realloc), so growing one step by step costs nothing in
  // proportion to what it holds. Throws std::bad_alloc, leaving the buffer
  // as it was.
  void grow(std::uint64_t size);

  // Hands the bytes to the caller, who releases them with ExportedUCharAlloc.
  unsigned char* release() noexcept;

 private:
  std::unique_ptr<unsigned char, ExportedUCharAlloc> data_;
  std::uint64_t size_ = 0;
};

class SharedMemBuffer {
 public:
  SharedMemBuffer() = default;
  SharedMemBuffer(std::shared_ptr<unsigned char> data, std::uint64_t size) noexcept
      : data_(std::move(data)), size_(data_ ? size : 0) {}
  // Takes the bytes over without copying them; releases them through
  // ExportedUCharAlloc when the last share lets go. An empty MemBuffer gives
  // an empty shared buffer with no owner.
  explicit SharedMemBuffer(MemBuffer&& owned);

  unsigned char* data() const noexcept { return data_.get(); }
  const std::shared_ptr<unsigned char>& owner() const noexcept { return data_; }
  std::uint64_t size() const noexcept { return size_; }
  bool empty() const noexcept { return size_ == 0; }
  std::string_view view() const noexcept {
    return {reinterpret_cast<const char*>(data_.get()), static_cast<std::size_t>(size_)};
  }

 private:
  std::shared_ptr<unsigned char> data_;
  std::uint64_t size_ = 0;
};
