#include "client/frame_socket.h"

#include "framework/unique_fd.h"

#include <fcntl.h>
#include <netdb.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "client/errors.h"

namespace cvdb {
namespace {

int pollTimeout(std::chrono::milliseconds timeout) {
  if (timeout.count() <= 0) return -1;
  return static_cast<int>(std::min<std::chrono::milliseconds::rep>(timeout.count(), INT32_MAX));
}

std::string errnoText(int err) { return std::strerror(err); }

// Connects one address within the timeout; returns the socket or -1 with
// err set.
UniqueFd connectOne(const addrinfo& ai, std::chrono::milliseconds timeout, int& err) {
  UniqueFd fd(::socket(ai.ai_family, ai.ai_socktype | SOCK_CLOEXEC | SOCK_NONBLOCK, ai.ai_protocol));
  if (!fd.valid()) {
    err = errno;
    return fd;
  }
  if (::connect(fd.get(), ai.ai_addr, ai.ai_addrlen) != 0) {
    if (errno != EINPROGRESS) {
      err = errno;
      return UniqueFd();
    }
    pollfd p{fd.get(), POLLOUT, 0};
    int r;
    do {
      r = ::poll(&p, 1, pollTimeout(timeout));
    } while (r < 0 && errno == EINTR);
    if (r == 0) {
      err = ETIMEDOUT;
      return UniqueFd();
    }
    socklen_t len = sizeof(err);
    if (r < 0 || ::getsockopt(fd.get(), SOL_SOCKET, SO_ERROR, &err, &len) != 0 || err != 0) {
      if (r < 0) err = errno;
      return UniqueFd();
    }
  }
  const int one = 1;
  ::setsockopt(fd.get(), IPPROTO_TCP, TCP_NODELAY, &one, sizeof(one));
  return fd;
}

}  // namespace

FrameSocket::FrameSocket(const std::string& host, std::uint16_t port, std::chrono::milliseconds connectTimeout,
                         const TlsOptions* tls) {
  addrinfo hints{};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* list = nullptr;
  const std::string service = std::to_string(port);
  const int rc = ::getaddrinfo(host.c_str(), service.c_str(), &hints, &list);
  if (rc != 0) throw ConnectFailed("cannot resolve \"" + host + "\": " + ::gai_strerror(rc));
  std::unique_ptr<addrinfo, decltype(&::freeaddrinfo)> guard(list, &::freeaddrinfo);
  int err = 0;
  for (const addrinfo* ai = list; ai && !fd_.valid(); ai = ai->ai_next) fd_ = connectOne(*ai, connectTimeout, err);
  if (!fd_.valid()) {
    throw ConnectFailed("cannot connect to " + host + ":" + service + ": " + errnoText(err));
  }
  if (tls) tls_ = std::make_unique<TlsSession>(fd_.get(), host, *tls, connectTimeout);
}

FrameSocket::~FrameSocket() { close(); }

void FrameSocket::close() noexcept {
  if (tls_) {
    tls_->close();
    tls_.reset();
  }
  fd_.close();
}

void FrameSocket::fail(const std::string& reason) {
  close();
  throw ConnectionEnded(reason, false);
}

void FrameSocket::waitFor(short events, std::chrono::milliseconds timeout) {
  pollfd p{fd_.get(), events, 0};
  int r;
  do {
    r = ::poll(&p, 1, pollTimeout(timeout));
  } while (r < 0 && errno == EINTR);
  if (r == 0) fail("no progress for " + std::to_string(timeout.count()) + " ms");
  if (r < 0) fail(errnoText(errno));
}

void FrameSocket::sendRaw(const void* data, std::size_t size, std::chrono::milliseconds timeout) {
  if (!fd_.valid()) throw ConnectionEnded("the connection is closed", false);
  if (tls_) {
    // The socket stays open as in plain TCP.
    tls_->write(data, size, timeout);
    return;
  }
  const auto* p = static_cast<const unsigned char*>(data);
  while (size > 0) {
    const ssize_t n = ::send(fd_.get(), p, size, MSG_NOSIGNAL);
    if (n > 0) {
      p += n;
      size -= static_cast<std::size_t>(n);
    } else if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      pollfd pfd{fd_.get(), POLLOUT, 0};
      int r;
      do {
        r = ::poll(&pfd, 1, pollTimeout(timeout));
      } while (r < 0 && errno == EINTR);
      if (r == 0)
        throw ConnectionEnded("the server took no data for " + std::to_string(timeout.count()) + " ms", false);
      if (r < 0) throw ConnectionEnded(errnoText(errno), false);
    } else if (n < 0 && errno == EINTR) {
      continue;
    } else {
      // The socket stays open: the server may have said why in a Bye.
      throw ConnectionEnded(errnoText(errno), false);
    }
  }
}

void FrameSocket::send(const wire::OutFrame& frame, std::chrono::milliseconds timeout) {
  sendRaw(frame.head.data(), frame.head.size(), timeout);
  if (!frame.tail.empty()) sendRaw(frame.tail.data(), static_cast<std::size_t>(frame.tail.size()), timeout);
}

void FrameSocket::readExactly(unsigned char* out, std::size_t size, std::chrono::milliseconds timeout) {
  while (size > 0 && tls_) {
    std::size_t n = 0;
    try {
      n = tls_->read(out, size, timeout);
    } catch (const ConnectionEnded& e) {
      fail(e.reason());
    }
    if (n == 0) fail("the server closed the connection");
    out += n;
    size -= n;
  }
  while (size > 0) {
    const ssize_t n = ::recv(fd_.get(), out, size, 0);
    if (n > 0) {
      out += n;
      size -= static_cast<std::size_t>(n);
    } else if (n == 0) {
      fail("the server closed the connection");
    } else if (errno == EAGAIN || errno == EWOULDBLOCK) {
      waitFor(POLLIN, timeout);
    } else if (errno != EINTR) {
      fail(errnoText(errno));
    }
  }
}

FrameSocket::Frame FrameSocket::receive(std::chrono::milliseconds timeout) {
  if (!fd_.valid()) throw ConnectionEnded("the connection is closed", false);
  unsigned char header[wire::kLengthSize];
  readExactly(header, sizeof(header), timeout);
  const std::uint32_t length = wire::frameLength(header);
  if (length < 2 || length > wire::kMaxBody) {
    fail("the server sent a frame of length " + std::to_string(length));
  }
  std::shared_ptr<unsigned char> body(ExportedUCharAlloc::alloc(length), ExportedUCharAlloc());
  readExactly(body.get(), length, timeout);
  Frame f;
  f.tag = body.get()[0];
  f.kind = static_cast<wire::FrameKind>(body.get()[1]);
  f.size = length - 2;
  f.payload = std::shared_ptr<unsigned char>(body, body.get() + 2);
  return f;
}

}  // namespace cvdb
