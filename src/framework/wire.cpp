#include "framework/wire.h"

#include <algorithm>

namespace wire {

void Writer::str(std::string_view s) {
  if (s.size() > UINT32_MAX) throw std::length_error("string too long for the wire");
  u32(static_cast<std::uint32_t>(s.size()));
  out_->append(s.data(), s.size());
}

void Writer::bytes(const void* data, std::uint64_t size) {
  u64(size);
  if (size) out_->append(static_cast<const char*>(data), static_cast<std::size_t>(size));
}

void Writer::sharedBytes(const SharedMemBuffer& b) {
  if (tail_ && tail_->empty()) {
    u64(b.size());
    *tail_ = b;
    return;
  }
  if (tail_) throw std::logic_error("a message can carry only one shared byte string");
  bytes(b.data(), b.size());
}

void Writer::strList(const std::vector<std::string>& list) {
  if (list.size() > UINT32_MAX) throw std::length_error("list too long for the wire");
  u32(static_cast<std::uint32_t>(list.size()));
  for (const auto& s : list) str(s);
}

void Reader::need(std::uint64_t n, const char* what) const {
  if (n > left_) {
    throw DecodeError(std::string(what) + " of " + std::to_string(n) + " byte(s) runs past the end of the message (" +
                      std::to_string(left_) + " left)");
  }
}

std::uint8_t Reader::u8() {
  need(1, "byte");
  --left_;
  return *p_++;
}

bool Reader::boolean() {
  const std::uint8_t v = u8();
  if (v > 1) throw DecodeError("boolean field holds " + std::to_string(v));
  return v == 1;
}

std::string Reader::str() { return std::string(strView()); }

std::string_view Reader::strView() {
  const std::uint32_t n = u32();
  need(n, "string");
  std::string_view v(reinterpret_cast<const char*>(p_), n);
  p_ += n;
  left_ -= n;
  return v;
}

SharedMemBuffer Reader::sharedStr() { return share(strView()); }

std::string_view Reader::bytes() {
  const std::uint64_t n = u64();
  need(n, "byte string");
  std::string_view v(reinterpret_cast<const char*>(p_), static_cast<std::size_t>(n));
  p_ += n;
  left_ -= static_cast<std::size_t>(n);
  return v;
}

SharedMemBuffer Reader::sharedBytes() { return share(bytes()); }

SharedMemBuffer Reader::share(std::string_view v) const {
  if (v.empty()) return {};
  if (owner_) {
    auto* p = reinterpret_cast<unsigned char*>(const_cast<char*>(v.data()));
    return SharedMemBuffer(std::shared_ptr<unsigned char>(owner_, p), v.size());
  }
  return SharedMemBuffer(MemBuffer::copyOf(v.data(), v.size()));
}

std::vector<std::string> Reader::strList() {
  const std::uint32_t count = u32();
  // Every string takes at least its 4-byte length: a count that cannot fit
  // is refused before anything is reserved.
  need(static_cast<std::uint64_t>(count) * 4, "string list");
  std::vector<std::string> list;
  // A std::string costs several times the 4 bytes its length takes on the
  // wire, so reserving the claimed count could cost far more than the frame;
  // the vector grows with what actually arrives.
  list.reserve(std::min<std::uint32_t>(count, 256));
  for (std::uint32_t i = 0; i < count; ++i) list.push_back(str());
  return list;
}

void Reader::expectEnd() const {
  if (left_ != 0) throw DecodeError(std::to_string(left_) + " unexpected trailing byte(s)");
}

}  // namespace wire
