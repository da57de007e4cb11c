#pragma once
// A connection without a network for command and processor tests: keeps
// every frame sent, the end of the connection and the commandDone calls.

#include <string>
#include <vector>

#include "framework/cmd.h"
#include "framework/frame.h"
#include "framework/thread_annotations.h"
#include "framework/wire.h"

namespace testing_support {

struct SentFrame {
  std::uint8_t tag = 0;
  wire::FrameKind kind = wire::FrameKind::Request;
  std::string payload;
};

// Splits one complete frame (length, tag, kind, payload).
inline SentFrame splitFrame(const std::string& bytes) {
  if (bytes.size() < wire::kHeaderSize) throw std::runtime_error("short frame");
  const auto* h = reinterpret_cast<const unsigned char*>(bytes.data());
  if (wire::frameLength(h) != bytes.size() - wire::kLengthSize) throw std::runtime_error("frame length mismatch");
  return {h[4], static_cast<wire::FrameKind>(h[5]), bytes.substr(wire::kHeaderSize)};
}

class FakeSocket : public Ipc::Socket {
 public:
  void send(wire::OutFrame frame) override {
    sys::MutexLock lock(mutex_);
    if (closed_) return;
    frames_.push_back(splitFrame(frame.head + std::string(frame.tail.view())));
  }
  void close(const std::string& reason) override {
    sys::MutexLock lock(mutex_);
    if (closed_) return;
    closed_ = true;
    reason_ = reason;
  }
  void commandDone() override {
    sys::MutexLock lock(mutex_);
    ++done_;
  }
  std::string peer() const override { return "127.0.0.1:1"; }
  bool isOpen() const override {
    sys::MutexLock lock(mutex_);
    return !closed_;
  }

  std::vector<SentFrame> frames() const {
    sys::MutexLock lock(mutex_);
    return frames_;
  }
  std::string closeReason() const {
    sys::MutexLock lock(mutex_);
    return reason_;
  }
  int doneCalls() const {
    sys::MutexLock lock(mutex_);
    return done_;
  }

 private:
  mutable sys::Mutex mutex_;
  std::vector<SentFrame> frames_ GUARDED_BY(mutex_);
  bool closed_ GUARDED_BY(mutex_) = false;
  std::string reason_ GUARDED_BY(mutex_);
  int done_ GUARDED_BY(mutex_) = 0;
};

}  // namespace testing_support
