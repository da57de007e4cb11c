#pragma once
// The load generator's event loop: many connections on one thread, each
// with exactly one request in flight (as redis-benchmark runs its clients),
// so that the generator spends little CPU and no thread per connection
// competes with the server for the cores.
//
// A connection sends its requests in turn, each encoded once beforehand,
// and waits for the complete answer before it sends the next. The latency
// of a request runs from its first byte sent to the last byte of its
// answer received; the answer is checked afterwards. Two wire protocols:
// the server's frames (one frame per answer) and Redis's RESP (a fixed
// number of replies per request, for a MULTI ... EXEC sent in one write).
//
// Ownership: a Stream owns its socket. Thread safety: one loop per thread,
// each with streams of its own. Failures: setup problems throw
// std::runtime_error; problems during the run are counted per stream (a
// connection that ends stops there) and never throw.

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace loadgen {

using Clock = std::chrono::steady_clock;

enum class Wire { Frames, Resp };

// Checks one complete answer to the request of the given index: returns an
// empty text when it is right, else what is wrong.
using AnswerCheck = std::function<std::string(std::string_view answer, std::size_t request)>;

struct Stream {
  int fd = -1;
  std::vector<std::string> requests;  // sent in turn, round and round
  AnswerCheck check;
  unsigned replies = 1;  // Resp: replies per request

  // Results.
  std::vector<std::uint64_t> latenciesNs;
  std::uint64_t errors = 0;
  std::string firstError;

  Stream() = default;
  Stream(Stream&& other) noexcept;
  Stream& operator=(Stream&&) = delete;
  Stream(const Stream&) = delete;
  ~Stream();
};

// A blocking TCP connection with TCP_NODELAY; throws std::runtime_error.
int connectTo(const std::string& host, std::uint16_t port);

// Blocking exchange for the setup phase: sends request, returns the whole
// answer (a frame with its length field, or the given number of RESP
// replies). Throws std::runtime_error when the connection ends.
std::string exchange(int fd, Wire wire, std::string_view request, unsigned replies = 1);

// Bytes of one complete answer at the start of [p, p + n), or 0 while it is
// incomplete. For frames, *need is set to the bytes the answer will take
// once its length is known.
std::size_t answerLength(Wire wire, unsigned replies, const unsigned char* p, std::size_t n, std::size_t* need);

// Runs the streams until the deadline; the sockets are made non-blocking.
// Requests still in flight at the deadline are not counted.
void runLoop(std::vector<Stream*>& streams, Wire wire, Clock::time_point deadline);

// RESP encoding of one command.
std::string resp(const std::vector<std::string_view>& args);

}  // namespace loadgen
