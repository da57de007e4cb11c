// A connection's share of the server's memory budget: the bytes it has
// queued for its client and the reservation of the large request frame it
// receives or runs; waiting for the budget and resuming.

#include <boost/asio/post.hpp>

#include "framework/connection.h"
#include "framework/transport_core.h"

namespace Ipc::detail {

bool Connection::admitted(std::uint64_t bytes) {
  MemoryBudget& budget = core_->budget;
  if (bytes == 0 && budget.admitsAtOnce()) {
    waitingMemory_ = false;
    return true;
  }
  // The wait owns the connection: a connection that waits has no read,
  // write or timer in flight, which otherwise keep it alive. finish()
  // withdraws the wait, and the server's stop finishes every connection.
  auto wake = [self = shared_from_this()] { self->resumeAfterWait(); };
  if (!budget.admit(this, bytes, std::move(wake))) {
    if (!waitingMemory_) core_->noteMemoryWait();
    waitingMemory_ = true;
    return false;
  }
  waitingMemory_ = false;
  reserved_ += bytes;
  return true;
}

void Connection::resumeAfterWait() {
  // Always queued, even from this connection's own strand: the release that
  // calls this may be in the middle of the write queue's bookkeeping.
  std::lock_guard lock(postMutex_);
  if (!accepting_) return;
  boost::asio::post(stream_.socket().get_executor(), [self = shared_from_this()] {
    if (!self->finished_) self->onMemoryFreed();
  });
}

void Connection::onMemoryFreed() {
  if (!waitingMemory_) return;
  waitingMemory_ = false;
  goOn();
}

void Connection::addQueued(std::uint64_t bytes) {
  outBytes_ += bytes;
  core_->budget.charge(bytes);
}

void Connection::releaseReserved() {
  if (reserved_ == 0) return;
  core_->releaseMemory(reserved_);
  reserved_ = 0;
}

void Connection::leaveBudget() {
  // The wait withdrawn may hold the last other reference.
  const auto self = shared_from_this();
  core_->budget.forget(this);
  waitingMemory_ = false;
  releaseReserved();
  if (outBytes_ > 0) core_->releaseMemory(outBytes_);
  outBytes_ = 0;
}

}  // namespace Ipc::detail
