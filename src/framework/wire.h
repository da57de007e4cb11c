#pragma once
// Encoding of message fields: little-endian fixed-width integers,
// length-prefixed strings and byte strings. docs/protocol.md is the
// reference for the format; this header is its implementation.
//
// Reader never reads past the bytes it was given: every length is checked
// against what is left before anything is allocated or copied, and any
// violation throws wire::DecodeError. Writer appends to a std::string.
// Thread safety: none; one reader or writer per thread.

#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "framework/buffers.h"

namespace wire {

class DecodeError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

class Writer {
 public:
  explicit Writer(std::string& out) : out_(&out) {}
  // With a tail slot, sharedBytes hands its buffer over without copying it;
  // it must then be the last field written.
  Writer(std::string& out, SharedMemBuffer& tail) : out_(&out), tail_(&tail) {}
  Writer(const Writer&) = delete;
  Writer& operator=(const Writer&) = delete;

  void u8(std::uint8_t v) { out_->push_back(static_cast<char>(v)); }
  void boolean(bool v) { u8(v ? 1 : 0); }
  void u32(std::uint32_t v) { fixed(v); }
  void i32(std::int32_t v) { fixed(static_cast<std::uint32_t>(v)); }
  void u64(std::uint64_t v) { fixed(v); }
  void i64(std::int64_t v) { fixed(static_cast<std::uint64_t>(v)); }
  // u32 length, then the bytes.
  void str(std::string_view s);
  // u64 length, then the bytes.
  void bytes(const void* data, std::uint64_t size);
  // Same encoding as bytes(); without a tail slot the bytes are copied.
  void sharedBytes(const SharedMemBuffer& b);
  void strList(const std::vector<std::string>& list);

  std::string& buffer() { return *out_; }

 private:
  template <typename T>
  void fixed(T v) {
    char b[sizeof(T)];
    for (std::size_t i = 0; i < sizeof(T); ++i) b[i] = static_cast<char>((v >> (8 * i)) & 0xFF);
    out_->append(b, sizeof(T));
  }

  std::string* out_;
  SharedMemBuffer* tail_ = nullptr;
};

class Reader {
 public:
  Reader(const void* data, std::size_t size) : p_(static_cast<const unsigned char*>(data)), left_(size) {}
  // A reader over bytes that owner keeps alive: sharedBytes() then shares
  // them instead of copying.
  Reader(std::shared_ptr<unsigned char> owner, std::size_t size)
      : p_(owner.get()), left_(size), owner_(std::move(owner)) {}
  explicit Reader(std::string_view s) : Reader(s.data(), s.size()) {}

  std::uint8_t u8();
  bool boolean();  // only 0 and 1 are valid
  std::uint32_t u32() { return fixed<std::uint32_t>(); }
  std::int32_t i32() { return static_cast<std::int32_t>(fixed<std::uint32_t>()); }
  std::uint64_t u64() { return fixed<std::uint64_t>(); }
  std::int64_t i64() { return static_cast<std::int64_t>(fixed<std::uint64_t>()); }
  std::string str();
  // The same encoding as str(), as a view into the reader's bytes (valid as
  // long as they are): a long text is neither copied nor allocated.
  std::string_view strView();
  // The same encoding as str(), as a buffer that shares the reader's owner
  // (or a copy when the reader has none): bytes kept for later without a
  // copy.
  SharedMemBuffer sharedStr();
  // A view into the reader's bytes (valid as long as they are): u64 length,
  // then the bytes.
  std::string_view bytes();
  std::vector<std::string> strList();
  // Same encoding as bytes(), as a buffer that shares the reader's owner
  // (or a copy when the reader has none).
  SharedMemBuffer sharedBytes();

  std::size_t left() const { return left_; }
  // Throws unless every byte was consumed: trailing bytes are malformed.
  void expectEnd() const;

 private:
  void need(std::uint64_t n, const char* what) const;
  // The view's bytes as a buffer that shares the owner, or a copy.
  SharedMemBuffer share(std::string_view v) const;
  template <typename T>
  T fixed() {
    need(sizeof(T), "integer");
    T v = 0;
    for (std::size_t i = 0; i < sizeof(T); ++i) v |= static_cast<T>(p_[i]) << (8 * i);
    p_ += sizeof(T);
    left_ -= sizeof(T);
    return v;
  }

  const unsigned char* p_;
  std::size_t left_;
  std::shared_ptr<unsigned char> owner_;
};

}  // namespace wire
