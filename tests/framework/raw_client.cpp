#include "raw_client.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>

#include "framework/wire.h"

namespace transport_test {

std::string Frame::text() const {
  wire::Reader in(payload);
  return in.str();
}

std::string frameBytes(std::uint8_t tag, wire::FrameKind kind, std::string_view payload) {
  std::string out;
  wire::beginFrame(out, tag, kind);
  out.append(payload);
  wire::endFrame(out);
  return out;
}

std::string requestBytes(std::uint8_t tag, std::string_view payload) {
  return frameBytes(tag, wire::FrameKind::Request, payload);
}

std::string strField(std::string_view s) {
  std::string out;
  wire::Writer(out).str(s);
  return out;
}

namespace {

int connectTo(std::uint16_t port, bool ipv6) {
  const int fd = ::socket(ipv6 ? AF_INET6 : AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) throw std::runtime_error(std::string("socket: ") + std::strerror(errno));
  int rc;
  if (ipv6) {
    sockaddr_in6 a{};
    a.sin6_family = AF_INET6;
    a.sin6_port = htons(port);
    a.sin6_addr = in6addr_loopback;
    rc = ::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
  } else {
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_port = htons(port);
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    rc = ::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
  }
  if (rc != 0) {
    ::close(fd);
    return -1;
  }
  const int one = 1;
  ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
  return fd;
}

}  // namespace

RawClient::RawClient(std::uint16_t port, bool ipv6) : fd_(connectTo(port, ipv6)) {
  if (fd_ < 0) throw std::runtime_error("connect to port " + std::to_string(port) + " failed");
}

std::optional<RawClient> RawClient::tryConnect(std::uint16_t port, bool ipv6) {
  RawClient c;
  c.fd_ = connectTo(port, ipv6);
  if (c.fd_ < 0) return std::nullopt;
  return c;
}

RawClient::~RawClient() { close(); }

RawClient::RawClient(RawClient&& other) noexcept : fd_(other.fd_), in_(std::move(other.in_)) { other.fd_ = -1; }

void RawClient::send(std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t n = ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (n < 0) {
      if (errno == EINTR) continue;
      throw std::runtime_error(std::string("send: ") + std::strerror(errno));
    }
    bytes.remove_prefix(static_cast<std::size_t>(n));
  }
}

// Reads until in_ holds want bytes; false when the peer closed first.
bool RawClient::fill(std::size_t want, std::chrono::steady_clock::time_point deadline) {
  char buf[65536];
  while (in_.size() < want) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) throw std::runtime_error("timed out waiting for the server");
    pollfd p{fd_, POLLIN, 0};
    const int r = ::poll(&p, 1, static_cast<int>(left.count()));
    if (r < 0 && errno == EINTR) continue;
    if (r == 0) continue;
    const ssize_t n = ::recv(fd_, buf, sizeof buf, 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    in_.append(buf, static_cast<std::size_t>(n));
  }
  return true;
}

std::optional<Frame> RawClient::read(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  if (!fill(wire::kLengthSize, deadline)) return std::nullopt;
  const std::uint32_t length = wire::frameLength(reinterpret_cast<const unsigned char*>(in_.data()));
  if (length < 2) throw std::runtime_error("server sent a frame of length " + std::to_string(length));
  if (!fill(wire::kLengthSize + length, deadline)) return std::nullopt;
  Frame f;
  f.tag = static_cast<std::uint8_t>(in_[4]);
  f.kind = static_cast<wire::FrameKind>(in_[5]);
  f.payload = in_.substr(wire::kHeaderSize, length - 2);
  in_.erase(0, wire::kLengthSize + length);
  return f;
}

std::optional<Frame> RawClient::readUntilClosed(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  std::optional<Frame> last;
  for (;;) {
    const auto left =
        std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    auto f = read(left);
    if (!f) return last;
    last = std::move(f);
  }
}

bool RawClient::ping(std::chrono::milliseconds timeout) {
  send(requestBytes(1));
  const auto f = read(timeout);
  return f && f->tag == 1 && f->kind == wire::FrameKind::Answer && f->payload.empty();
}

void RawClient::close(bool reset) {
  if (fd_ < 0) return;
  if (reset) {
    const linger l{1, 0};
    ::setsockopt(fd_, SOL_SOCKET, SO_LINGER, &l, sizeof l);
  }
  ::close(fd_);
  fd_ = -1;
}

}  // namespace transport_test
