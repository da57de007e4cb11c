#pragma once
// A blocking TCP client that speaks raw frames, for tests of the transport:
// it sends whatever bytes a test gives it, well-formed or not, and reads
// frames with a deadline.

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "framework/frame.h"

namespace transport_test {

struct Frame {
  std::uint8_t tag = 0;
  wire::FrameKind kind = wire::FrameKind::Request;
  std::string payload;
  // The payload read as one string field (Refused and Bye frames).
  std::string text() const;
};

// The bytes of one frame.
std::string frameBytes(std::uint8_t tag, wire::FrameKind kind, std::string_view payload = {});
std::string requestBytes(std::uint8_t tag, std::string_view payload = {});
// A payload holding one string field.
std::string strField(std::string_view s);

class RawClient {
 public:
  // Connects to the loopback address of the family; throws on failure.
  explicit RawClient(std::uint16_t port, bool ipv6 = false);
  ~RawClient();
  RawClient(RawClient&& other) noexcept;
  RawClient(const RawClient&) = delete;
  RawClient& operator=(const RawClient&) = delete;

  // Whether connect() succeeded (for a client built with tryConnect).
  static std::optional<RawClient> tryConnect(std::uint16_t port, bool ipv6);

  void send(std::string_view bytes);
  // The next frame; nothing when the server closed the connection. Throws
  // std::runtime_error when nothing arrives before the deadline.
  std::optional<Frame> read(std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // Reads frames until the server closes; returns the last frame seen
  // before the end (normally a Bye). Throws on timeout.
  std::optional<Frame> readUntilClosed(std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // A ping and its answer.
  bool ping(std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // Closes the socket now; with reset, the peer sees a connection reset.
  void close(bool reset = false);

 private:
  RawClient() = default;
  bool fill(std::size_t want, std::chrono::steady_clock::time_point deadline);

  int fd_ = -1;
  std::string in_;
};

}  // namespace transport_test
