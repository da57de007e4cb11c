#include "framework/frame.h"

#include <stdexcept>

#include "framework/wire.h"

namespace wire {

void beginFrame(std::string& out, std::uint8_t tag, FrameKind kind) {
  Writer w(out);
  w.u32(0);
  w.u8(tag);
  w.u8(static_cast<std::uint8_t>(kind));
}

void endFrame(std::string& out, std::size_t start) {
  const std::size_t body = out.size() - start - kLengthSize;
  if (body > kMaxBody) throw std::length_error("message of " + std::to_string(body) + " bytes exceeds the frame limit");
  for (std::size_t i = 0; i < 4; ++i) out[start + i] = static_cast<char>((body >> (8 * i)) & 0xFF);
}

void endFrame(OutFrame& frame) {
  const std::uint64_t body = frame.size() - kLengthSize;
  if (body > kMaxBody) throw std::length_error("message of " + std::to_string(body) + " bytes exceeds the frame limit");
  for (std::size_t i = 0; i < 4; ++i) frame.head[i] = static_cast<char>((body >> (8 * i)) & 0xFF);
}

std::uint32_t frameLength(const unsigned char* h) {
  return static_cast<std::uint32_t>(h[0]) | static_cast<std::uint32_t>(h[1]) << 8 |
         static_cast<std::uint32_t>(h[2]) << 16 | static_cast<std::uint32_t>(h[3]) << 24;
}

}  // namespace wire
