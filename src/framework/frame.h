#pragma once
// Message framing shared by the server's transport and the client library.
//
//   offset 0  u32  length L of everything after this field (2 <= L <= kMaxBody)
//   offset 4  u8   command tag
//   offset 5  u8   kind (FrameKind)
//   offset 6  payload of L - 2 bytes
//
// See docs/protocol.md for the payload of every command.

#include <cstdint>
#include <string>
#include <string_view>

#include "framework/buffers.h"

namespace wire {

enum class FrameKind : std::uint8_t {
  Request = 0,      // client to server: a command's request
  Answer = 1,       // server to client: the command's answer
  Progress = 2,     // server to client: u32 percent, string text
  ProgressEnd = 3,  // server to client: the progress stream of the command is over
  Refused = 4,      // server to client: string text; the tag is unknown, no command ran
  Bye = 5,          // server to client: string reason; the server ends the connection
};

inline constexpr std::size_t kLengthSize = 4;
inline constexpr std::size_t kHeaderSize = 6;
// Largest L: one gibibyte of payload and its tag and kind. The store's
// largest value (about 10^9 bytes) and a data file of that size fit.
inline constexpr std::uint32_t kMaxBody = (1u << 30) + 2;

// A partially received frame that makes no progress for this long ends the
// connection. Idle connections between frames are kept.
inline constexpr unsigned kStallTimeoutSeconds = 30;

// A frame on its way out: the head (header and fields) followed on the wire
// by the bytes of tail, which are shared, not copied.
struct OutFrame {
  std::string head;
  SharedMemBuffer tail;
  std::uint64_t size() const { return head.size() + tail.size(); }
};

// Starts a frame in out: writes the header with a placeholder length.
void beginFrame(std::string& out, std::uint8_t tag, FrameKind kind);
// Fills in the length of the frame that begins at offset start of out.
// Throws std::length_error if the frame is larger than kMaxBody allows.
void endFrame(std::string& out, std::size_t start = 0);
void endFrame(OutFrame& frame);

// Reads the length field of a header; no check.
std::uint32_t frameLength(const unsigned char* header4);

}  // namespace wire
