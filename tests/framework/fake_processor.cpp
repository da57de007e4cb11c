#include "fake_processor.h"

#include <algorithm>
#include <cstring>
#include <stdexcept>

namespace transport_test {

std::shared_ptr<Ipc::CmdProcessorI> TestCmd::processor() const noexcept { return processor_; }

void TestCmd::writeAnswer(wire::Writer& out) const {
  if (tag_ == kBig) {
    out.sharedBytes(big);
  } else {
    out.str(answer);
  }
}

void TestCmd::finishRequest() {
  if (tag_ == kFinishFails) throw wire::DecodeError("deferred " + text);
  if (tag_ == kFinishBlocks) processor_->holdInFinish(text);
}

FakeProcessor::~FakeProcessor() { joinThreads(); }

namespace {

wire::OutFrame progressFrame(std::uint8_t tag, wire::FrameKind kind, std::uint32_t percent, const std::string& text) {
  wire::OutFrame f;
  wire::beginFrame(f.head, tag, kind);
  if (kind == wire::FrameKind::Progress) {
    wire::Writer w(f.head);
    w.u32(percent);
    w.str(text);
  }
  wire::endFrame(f);
  return f;
}

}  // namespace

void FakeProcessor::processCmd(std::shared_ptr<Ipc::CmdI> cmd) {
  ++processed;
  auto& c = static_cast<TestCmd&>(*cmd);
  record("start:" + c.text);
  switch (c.tag()) {
    case kEcho:
    case kFinishBlocks:
      c.answer = c.text;
      break;
    case kBlock: {
      sys::MutexLock lock(mutex_);
      changed_.wait(lock.native(), [this]() REQUIRES(mutex_) { return gateOpen_; });
      c.answer = c.text;
      break;
    }
    case kProgress: {
      const auto socket = cmd->socket();
      socket->send(progressFrame(c.tag(), wire::FrameKind::Progress, 0, "start"));
      sys::MutexLock lock(mutex_);
      threads_.emplace_back([cmd, socket] {
        for (std::uint32_t p = 25; p <= 75; p += 25) {
          socket->send(progressFrame(cmd->tag(), wire::FrameKind::Progress, p, "step " + std::to_string(p)));
        }
        socket->send(progressFrame(cmd->tag(), wire::FrameKind::ProgressEnd, 0, {}));
        socket->commandDone();
      });
      break;
    }
    case kThrowOther:
      throw 42;
    case kSilent:
      record("end:" + c.text);
      return;
    case kBig: {
      const auto size = std::stoull(c.text);
      MemBuffer b(size);
      for (std::uint64_t i = 0; i < size; ++i) b.data()[i] = static_cast<unsigned char>(i * 7);
      c.big = SharedMemBuffer(std::move(b));
      break;
    }
    case kHangup:
      record("end:" + c.text);
      cmd->onTransferError("Hung up by the processor");
      return;
    case kSlot: {
      cmd->socket()->connInf() = std::make_unique<TrackedConnInf>(liveSlots);
      if (c.text == "keep") {
        sys::MutexLock lock(mutex_);
        keptSocket = cmd->socket();
      }
      break;
    }
    default:
      throw std::logic_error("no behaviour for tag " + std::to_string(c.tag()));
  }
  record("end:" + c.text);
  server->onRespReady(cmd);
}

void FakeProcessor::onDisconnect(const std::shared_ptr<Ipc::Socket>&) { ++disconnects; }

void FakeProcessor::openGate() {
  sys::MutexLock lock(mutex_);
  gateOpen_ = true;
  changed_.notify_all();
}

bool FakeProcessor::waitStarted(const std::string& text, std::chrono::milliseconds timeout) {
  return waitFor("start:" + text, timeout);
}

bool FakeProcessor::waitFor(const std::string& event, std::chrono::milliseconds timeout) {
  sys::MutexLock lock(mutex_);
  return changed_.wait_for(lock.native(), timeout, [&]() REQUIRES(mutex_) {
    return std::find(events_.begin(), events_.end(), event) != events_.end();
  });
}

void FakeProcessor::holdInFinish(const std::string& text) {
  record("finish:" + text);
  sys::MutexLock lock(mutex_);
  changed_.wait(lock.native(), [this]() REQUIRES(mutex_) { return gateOpen_; });
}

std::vector<std::string> FakeProcessor::events() const {
  sys::MutexLock lock(mutex_);
  return events_;
}

void FakeProcessor::record(const std::string& event) {
  sys::MutexLock lock(mutex_);
  events_.push_back(event);
  changed_.notify_all();
}

void FakeProcessor::joinThreads() {
  std::vector<std::thread> threads;
  {
    sys::MutexLock lock(mutex_);
    threads.swap(threads_);
  }
  for (auto& t : threads) t.join();
}

Ipc::CmdFactory FakeProcessor::factory() {
  std::weak_ptr<FakeProcessor> weak = std::static_pointer_cast<FakeProcessor>(shared_from_this());
  return [weak](std::uint8_t tag) -> std::shared_ptr<Ipc::CmdI> {
    auto self = weak.lock();
    if (!self) throw std::bad_weak_ptr();
    ++self->created;
    if (tag == 1) return std::make_shared<Ipc::PingPong>();
    if (tag == kFactoryThrows) throw std::bad_weak_ptr();
    if ((tag >= kEcho && tag <= kSlot) || tag == kFinishFails || tag == kFinishBlocks) {
      return std::make_shared<TestCmd>(tag, self);
    }
    --self->created;
    return nullptr;
  };
}

}  // namespace transport_test
