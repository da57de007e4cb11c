#include "load_loop.h"

#include <fcntl.h>
#include <netdb.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <optional>
#include <stdexcept>

namespace loadgen {
namespace {

std::string errnoText() { return std::strerror(errno); }

// One RESP reply starting at pos; the position after it, or nothing while
// it is incomplete.
std::optional<std::size_t> replyEnd(const unsigned char* p, std::size_t n, std::size_t pos) {
  if (pos >= n) return std::nullopt;
  const auto* lineEnd = static_cast<const unsigned char*>(std::memchr(p + pos, '\r', n - pos));
  if (!lineEnd || lineEnd + 1 >= p + n) return std::nullopt;
  const std::size_t afterLine = static_cast<std::size_t>(lineEnd - p) + 2;
  const char type = static_cast<char>(p[pos]);
  if (type != '$' && type != '*') return afterLine;  // +, -, : and the like: one line
  long long count = 0;
  bool negative = false;
  for (const unsigned char* q = p + pos + 1; q < lineEnd; ++q) {
    if (*q == '-') {
      negative = true;
    } else {
      count = count * 10 + (*q - '0');
    }
  }
  if (negative) return afterLine;  // null bulk string or array
  if (type == '$') {
    const std::size_t end = afterLine + static_cast<std::size_t>(count) + 2;
    if (end > n) return std::nullopt;
    return end;
  }
  std::size_t at = afterLine;
  for (long long i = 0; i < count; ++i) {
    const auto next = replyEnd(p, n, at);
    if (!next) return std::nullopt;
    at = *next;
  }
  return at;
}

void setNonBlocking(int fd) {
  const int flags = ::fcntl(fd, F_GETFL);
  ::fcntl(fd, F_SETFL, flags | O_NONBLOCK);
}

// The state of one stream in the loop.
struct Conn {
  Stream* s = nullptr;
  std::size_t next = 0;  // the next request to send
  const std::string* sending = nullptr;
  std::size_t sent = 0;
  std::vector<unsigned char> in;
  std::size_t have = 0;
  std::size_t current = 0;  // the request in flight
  Clock::time_point start;
  bool waitingToSend = false;  // registered for EPOLLOUT
  bool dead = false;
};

class Loop {
 public:
  Loop(Wire wire, Clock::time_point deadline) : wire_(wire), deadline_(deadline), ep_(::epoll_create1(EPOLL_CLOEXEC)) {
    if (ep_ < 0) throw std::runtime_error("epoll_create1: " + errnoText());
  }
  ~Loop() { ::close(ep_); }
  Loop(const Loop&) = delete;
  Loop& operator=(const Loop&) = delete;

  void run(std::vector<Stream*>& streams) {
    std::vector<Conn> conns(streams.size());
    for (std::size_t i = 0; i < streams.size(); ++i) {
      Conn& c = conns[i];
      c.s = streams[i];
      c.in.resize(16 * 1024);
      setNonBlocking(c.s->fd);
      epoll_event ev{};
      ev.events = EPOLLIN;
      ev.data.ptr = &c;
      if (::epoll_ctl(ep_, EPOLL_CTL_ADD, c.s->fd, &ev) != 0) fail(c, "epoll_ctl: " + errnoText());
    }
    for (Conn& c : conns) {
      if (!c.dead) startRequest(c);
    }
    epoll_event events[256];
    for (;;) {
      const auto now = Clock::now();
      if (now >= deadline_) break;
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline_ - now).count() + 1;
      const int n = ::epoll_wait(ep_, events, 256, static_cast<int>(left));
      if (n < 0) {
        if (errno == EINTR) continue;
        break;
      }
      for (int i = 0; i < n; ++i) {
        Conn& c = *static_cast<Conn*>(events[i].data.ptr);
        if (!c.dead && (events[i].events & EPOLLOUT)) pushSend(c);
        if (!c.dead && (events[i].events & (EPOLLIN | EPOLLHUP | EPOLLERR))) readSome(c);
      }
    }
  }

 private:
  void fail(Conn& c, const std::string& text) {
    if (c.s->errors++ == 0) c.s->firstError = text;
    c.dead = true;
    ::epoll_ctl(ep_, EPOLL_CTL_DEL, c.s->fd, nullptr);
  }

  void watchOut(Conn& c, bool on) {
    if (c.waitingToSend == on) return;
    c.waitingToSend = on;
    epoll_event ev{};
    ev.events = EPOLLIN | (on ? EPOLLOUT : 0u);
    ev.data.ptr = &c;
    ::epoll_ctl(ep_, EPOLL_CTL_MOD, c.s->fd, &ev);
  }

  void startRequest(Conn& c) {
    c.current = c.next++ % c.s->requests.size();
    c.sending = &c.s->requests[c.current];
    c.sent = 0;
    c.start = Clock::now();
    pushSend(c);
  }

  void pushSend(Conn& c) {
    while (c.sending && c.sent < c.sending->size()) {
      const ssize_t r = ::send(c.s->fd, c.sending->data() + c.sent, c.sending->size() - c.sent, MSG_NOSIGNAL);
      if (r > 0) {
        c.sent += static_cast<std::size_t>(r);
      } else if (r < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
        watchOut(c, true);
        return;
      } else if (r < 0 && errno == EINTR) {
        continue;
      } else {
        fail(c, "send: " + errnoText());
        return;
      }
    }
    watchOut(c, false);
  }

  void readSome(Conn& c) {
    for (;;) {
      std::size_t need = 0;
      answerLength(wire_, c.s->replies, c.in.data(), c.have, &need);
      if (need > c.in.size()) {
        c.in.resize(need);
      } else if (c.in.size() - c.have < 4096) {
        c.in.resize(c.in.size() * 2);
      }
      const ssize_t r = ::recv(c.s->fd, c.in.data() + c.have, c.in.size() - c.have, 0);
      if (r == 0) {
        fail(c, "the server closed the connection");
        return;
      }
      if (r < 0) {
        if (errno == EINTR) continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK) fail(c, "recv: " + errnoText());
        return;
      }
      c.have += static_cast<std::size_t>(r);
      const std::size_t len = answerLength(wire_, c.s->replies, c.in.data(), c.have, &need);
      if (len == 0) continue;
      const auto end = Clock::now();
      if (c.have != len) {
        fail(c, "bytes beyond the answer");
        return;
      }
      c.have = 0;
      const std::string problem =
          c.s->check ? c.s->check(std::string_view(reinterpret_cast<const char*>(c.in.data()), len), c.current)
                     : std::string();
      if (!problem.empty()) {
        if (c.s->errors++ == 0) c.s->firstError = problem;
      } else if (end <= deadline_) {
        const auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(end - c.start).count();
        c.s->latenciesNs.push_back(static_cast<std::uint64_t>(ns));
      }
      if (Clock::now() < deadline_) startRequest(c);
      return;
    }
  }

  const Wire wire_;
  const Clock::time_point deadline_;
  const int ep_;
};

}  // namespace

Stream::Stream(Stream&& other) noexcept
    : fd(other.fd),
      requests(std::move(other.requests)),
      check(std::move(other.check)),
      replies(other.replies),
      latenciesNs(std::move(other.latenciesNs)),
      errors(other.errors),
      firstError(std::move(other.firstError)) {
  other.fd = -1;
}

Stream::~Stream() {
  if (fd >= 0) ::close(fd);
}

int connectTo(const std::string& host, std::uint16_t port) {
  addrinfo hints{};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* list = nullptr;
  const std::string service = std::to_string(port);
  const int rc = ::getaddrinfo(host.c_str(), service.c_str(), &hints, &list);
  if (rc != 0) throw std::runtime_error("cannot resolve " + host + ": " + ::gai_strerror(rc));
  std::unique_ptr<addrinfo, decltype(&::freeaddrinfo)> guard(list, &::freeaddrinfo);
  std::string problem = "no address";
  for (const addrinfo* ai = list; ai; ai = ai->ai_next) {
    const int fd = ::socket(ai->ai_family, ai->ai_socktype | SOCK_CLOEXEC, ai->ai_protocol);
    if (fd < 0) {
      problem = errnoText();
      continue;
    }
    if (::connect(fd, ai->ai_addr, ai->ai_addrlen) == 0) {
      const int one = 1;
      ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
      return fd;
    }
    problem = errnoText();
    ::close(fd);
  }
  throw std::runtime_error("cannot connect to " + host + ":" + service + ": " + problem);
}

std::string exchange(int fd, Wire wire, std::string_view request, unsigned replies) {
  std::size_t sent = 0;
  while (sent < request.size()) {
    const ssize_t r = ::send(fd, request.data() + sent, request.size() - sent, MSG_NOSIGNAL);
    if (r < 0 && errno == EINTR) continue;
    if (r <= 0) throw std::runtime_error("send: " + errnoText());
    sent += static_cast<std::size_t>(r);
  }
  std::string in(4096, '\0');
  std::size_t have = 0;
  for (;;) {
    std::size_t need = 0;
    const auto* p = reinterpret_cast<const unsigned char*>(in.data());
    const std::size_t len = answerLength(wire, replies, p, have, &need);
    if (len > 0) {
      in.resize(len);
      return in;
    }
    if (need > in.size()) in.resize(need);
    if (in.size() - have < 1024) in.resize(in.size() * 2);
    const ssize_t r = ::recv(fd, in.data() + have, in.size() - have, 0);
    if (r < 0 && errno == EINTR) continue;
    if (r == 0) throw std::runtime_error("the server closed the connection");
    if (r < 0) throw std::runtime_error("recv: " + errnoText());
    have += static_cast<std::size_t>(r);
  }
}

std::size_t answerLength(Wire wire, unsigned replies, const unsigned char* p, std::size_t n, std::size_t* need) {
  *need = 0;
  if (wire == Wire::Frames) {
    if (n < 4) return 0;
    const std::size_t length = static_cast<std::size_t>(p[0]) | static_cast<std::size_t>(p[1]) << 8 |
                               static_cast<std::size_t>(p[2]) << 16 | static_cast<std::size_t>(p[3]) << 24;
    *need = 4 + length;
    return n >= *need ? *need : 0;
  }
  std::size_t at = 0;
  for (unsigned i = 0; i < replies; ++i) {
    const auto next = replyEnd(p, n, at);
    if (!next) return 0;
    at = *next;
  }
  return at;
}

void runLoop(std::vector<Stream*>& streams, Wire wire, Clock::time_point deadline) {
  Loop(wire, deadline).run(streams);
}

std::string resp(const std::vector<std::string_view>& args) {
  std::string out = "*" + std::to_string(args.size()) + "\r\n";
  for (const auto a : args) {
    out += "$" + std::to_string(a.size()) + "\r\n";
    out += a;
    out += "\r\n";
  }
  return out;
}

}  // namespace loadgen
