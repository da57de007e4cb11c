#pragma once
// A command processor and commands for tests of the transport. Each tag
// stands for one behaviour of a processor, good or faulty.

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "framework/svc_stub.h"
#include "framework/thread_annotations.h"

namespace transport_test {

enum TestTag : std::uint8_t {
  kEcho = 10,        // answers its request string
  kBlock = 11,       // waits until the test opens the gate, then answers
  kProgress = 12,    // a progress stream from a thread of its own
  kThrowOther = 13,  // the processor throws something that is no std::exception
  kSilent = 14,      // the processor returns without an answer
  kBig = 15,         // answers as many bytes as its request string says, as a shared tail
  kHangup = 16,      // ends the connection through onTransferError
  kSlot = 17,        // puts a tracked ConnInf into the connection's slot ("keep": and keeps the socket)
  kFactoryThrows = 18,
  kFinishFails = 21,   // finishRequest refuses the request ("deferred <text>")
  kFinishBlocks = 22,  // finishRequest waits until the test opens the gate; then an echo
};

class FakeProcessor;

class TestCmd final : public Ipc::CmdI {
 public:
  TestCmd(std::uint8_t tag, std::shared_ptr<FakeProcessor> processor)
      : tag_(tag), name_("Test" + std::to_string(tag)), processor_(std::move(processor)) {}

  std::uint8_t tag() const noexcept override { return tag_; }
  const std::string& name() const noexcept override { return name_; }
  void accept(Ipc::CmdProcessorI&) override {}
  std::shared_ptr<Ipc::CmdProcessorI> processor() const noexcept override;
  void readRequest(wire::Reader& in) override { text = in.str(); }
  void finishRequest() override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override { out.str(text); }
  void readAnswer(wire::Reader& in) override { answer = in.str(); }
  bool streamsProgress() const noexcept override { return tag_ == kProgress; }

  std::string text;
  std::string answer;
  SharedMemBuffer big;

 private:
  std::uint8_t tag_;
  std::string name_;
  std::shared_ptr<FakeProcessor> processor_;
};

// Counts its live instances, to show that a connection's slot is released.
class TrackedConnInf final : public Ipc::ConnInf {
 public:
  explicit TrackedConnInf(std::atomic<int>& live) : live_(live) { ++live_; }
  ~TrackedConnInf() override { --live_; }

 private:
  std::atomic<int>& live_;
};

class FakeProcessor final : public Ipc::CmdProcessorI {
 public:
  ~FakeProcessor() override;

  Ipc::SvcStub* server = nullptr;
  std::atomic<int> created{0};
  std::atomic<int> processed{0};
  std::atomic<int> disconnects{0};
  std::atomic<int> liveSlots{0};
  // The socket of the last kSlot "keep" command, kept as a maintenance thread keeps
  // its command's.
  std::shared_ptr<Ipc::Socket> keptSocket;

  void processCmd(std::shared_ptr<Ipc::CmdI> cmd) override;
  void onDisconnect(const std::shared_ptr<Ipc::Socket>& socket) override;

  // Lets every blocked command (and later ones) go on.
  void openGate();
  // Waits until a command with this request text has started.
  bool waitStarted(const std::string& text, std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // Waits until the event has happened.
  bool waitFor(const std::string& event, std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // A kFinishBlocks command's finishRequest: records "finish:<text>" and
  // waits for the gate.
  void holdInFinish(const std::string& text) EXCLUDES(mutex_);
  // "start:<text>", "end:<text>" and "finish:<text>" in the order they happened.
  std::vector<std::string> events() const;
  // Waits until the progress threads have ended.
  void joinThreads();

  Ipc::CmdFactory factory();

 private:
  void record(const std::string& event) EXCLUDES(mutex_);

  mutable sys::Mutex mutex_;
  std::condition_variable changed_;  // with mutex_: the gate opened, or an event came
  bool gateOpen_ GUARDED_BY(mutex_) = false;
  std::vector<std::string> events_ GUARDED_BY(mutex_);
  std::vector<std::thread> threads_ GUARDED_BY(mutex_);
};

}  // namespace transport_test
