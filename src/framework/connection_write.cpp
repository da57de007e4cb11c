// A connection's write queue: frames queued in order, written with gather
// writes (at once when the socket takes them, else asynchronously), and
// kept until the write that covers them has completed.

#include "framework/connection.h"

#include <algorithm>
#include <boost/asio/write.hpp>

#include "framework/transport_core.h"

namespace Ipc::detail {
namespace {

namespace asio = boost::asio;
using Clock = std::chrono::steady_clock;

// What one TLS write takes at most when frames are copied together: one
// full record.
constexpr std::size_t kTlsCoalesce = 16 * 1024;

// A view of the first count buffers of an array, as an Asio buffer sequence.
struct BufferSpan {
  const asio::const_buffer* first;
  std::size_t count;
  const asio::const_buffer* begin() const { return first; }
  const asio::const_buffer* end() const { return first + count; }
};

}  // namespace

void Connection::enqueue(wire::OutFrame frame) {
  if (closing_ || finished_) return;
  addQueued(frame.size());
  out_.push_back(std::move(frame));
  if (!writing_) startWrite();
}

// Writes what is queued: first at once, without waiting (the usual case:
// the socket takes a small answer whole, and no completion has to be
// scheduled for it), then, for what the socket did not take, with an
// asynchronous write. A TLS session always writes asynchronously, from one
// buffer.
void Connection::startWrite() {
  while (!writing_ && !finished_) {
    const std::size_t count = gather();
    if (count == 0) return;
    boost::system::error_code ec = asio::error::would_block;
    const std::size_t n = writeAtOnce_ ? stream_.socket().write_some(BufferSpan{gather_.data(), count}, ec) : 0;
    if (ec == asio::error::would_block || ec == asio::error::try_again || (!ec && n == 0)) {
      writing_ = true;
      writeSince_ = Clock::now();
      auto done = [self = shared_from_this()](const boost::system::error_code& e, std::size_t m) {
        self->onWrite(e, m);
      };
      if (stream_.tls()) {
        stream_.asyncWriteSome(coalesce(count), std::move(done));
      } else {
        stream_.asyncWriteSome(BufferSpan{gather_.data(), count}, std::move(done));
      }
      armStallTimer();
      return;
    }
    if (ec) {
      peerGone();
      return;
    }
    consumeWritten(n);
    if (out_.empty()) {
      if (closing_) byeWritten();
      return;
    }
  }
}

// A write failed: the peer is gone, and what was queued for it goes with it.
void Connection::peerGone() {
  peerDone_ = true;
  finish();
}

// Fills gather_ with the unwritten part of the queue; returns the count.
std::size_t Connection::gather() {
  std::size_t count = 0;
  std::uint64_t skip = frontSent_;
  for (const auto& frame : out_) {
    if (count + 2 > gather_.size()) break;
    if (skip < frame.head.size()) {
      gather_[count++] = asio::buffer(frame.head.data() + skip, frame.head.size() - skip);
      skip = 0;
    } else {
      skip -= frame.head.size();
    }
    if (skip < frame.tail.size()) {
      gather_[count++] = asio::buffer(frame.tail.data() + skip, static_cast<std::size_t>(frame.tail.size() - skip));
    }
    skip = 0;
  }
  return count;
}

asio::const_buffer Connection::coalesce(std::size_t count) {
  if (count == 1 || gather_[0].size() >= kTlsCoalesce) return gather_[0];
  tlsOut_.clear();
  for (std::size_t i = 0; i < count && tlsOut_.size() < kTlsCoalesce; ++i) {
    const auto* p = static_cast<const unsigned char*>(gather_[i].data());
    tlsOut_.insert(tlsOut_.end(), p, p + std::min(gather_[i].size(), kTlsCoalesce - tlsOut_.size()));
  }
  return asio::buffer(tlsOut_);
}

void Connection::consumeWritten(std::uint64_t n) {
  outBytes_ -= n;
  core_->releaseMemory(n);
  core_->bytesOut.fetch_add(n, std::memory_order_relaxed);
  while (n > 0 && !out_.empty()) {
    const std::uint64_t rest = out_.front().size() - frontSent_;
    if (n < rest) {
      frontSent_ += n;
      n = 0;
    } else {
      n -= rest;
      frontSent_ = 0;
      out_.pop_front();
    }
  }
}

// The Bye frame is out: the sending side ends, and the connection waits
// for the peer to close (within the close grace).
void Connection::byeWritten() {
  if (byeFlushed_) return;
  byeFlushed_ = true;
  boost::system::error_code ignored;
  // With TLS too: the Bye's records are written whole, and the peer that
  // has read them needs no more than the end of the stream.
  stream_.socket().shutdown(asio::ip::tcp::socket::shutdown_send, ignored);
  if (peerDone_) {
    finish();
  } else {
    startDrain();
  }
}

void Connection::onWrite(const boost::system::error_code& ec, std::size_t n) {
  writing_ = false;
  if (finished_) {
    out_.clear();
    return;
  }
  if (ec) {
    peerGone();
    return;
  }
  consumeWritten(n);
  if (!out_.empty()) {
    startWrite();
    if (writing_ || finished_ || !out_.empty()) return;
  }
  if (closing_) {
    byeWritten();
    return;
  }
  // Reading may have waited for the answers to drain.
  goOn();
}

}  // namespace Ipc::detail
