#pragma once
// The command server: accepts TCP connections (plain, or TLS only when
// Options::tls says so), reads request frames, builds
// commands through the factory and hands them to their processor.
//
// Serving starts in the constructor (which throws std::runtime_error when the
// port cannot be bound or the TLS files cannot be used) and lasts until signalStop(); waitToFinish() then
// returns once every connection is closed and every command that was being
// processed has ended.
//
// Threads: socket I/O and commands run on an elastic set of I/O threads,
// one command of a connection at a time. Whenever a command would leave no
// thread free for the other connections, another thread is started, so a
// command that blocks stalls no other connection. Every member may be
// called from any thread.
// Failures: malformed frames, stalled frames and exhausted resources end the
// connection concerned (or refuse it) and are reported through the IPC error
// handler; they never affect other connections.

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>

#include "framework/cmd.h"
#include "framework/frame.h"
#include "framework/tls_files.h"

namespace Ipc {

// Builds a command for a tag, or returns null for an unknown tag.
using CmdFactory = std::function<std::shared_ptr<CmdI>(std::uint8_t tag)>;
// Receives the transport's problem reports (a null socket for problems that
// belong to no connection). Without one, they are logged at priority 4 as
// "Ipc " + text.
using IpcErrorHandler = std::function<void(const std::shared_ptr<Socket>&, const std::string&)>;

class SvcStub {
 public:
  // The default of Options::memoryBudget.
  static constexpr std::uint64_t kDefaultMemoryBudget = std::uint64_t{256} << 20;

  // Tuning of the transport; the defaults are the server's.
  struct Options {
    // A frame that makes no progress in either direction for this long ends
    // its connection.
    std::chrono::milliseconds stallTimeout{wire::kStallTimeoutSeconds * 1000};
    // How long a closing connection waits for its Bye frame to go out and
    // for the peer to close before the socket is closed anyway.
    std::chrono::milliseconds closeGrace{500};
    // How long a stop lets the commands that are running finish and send
    // their answers before their connections are closed anyway. The
    // service unit's stop timeout must leave room for it.
    std::chrono::milliseconds stopGrace{20000};
    // I/O threads kept for the server's life; 0 means as many as cores, at
    // least 2. More are started while commands occupy them all.
    unsigned ioThreads = 0;
    // Most threads at once; beyond, connections wait for a command to end.
    std::size_t maxThreads = 2048;
    // A thread beyond ioThreads that has run nothing for this long ends.
    std::chrono::milliseconds spareIdle{30000};
    // When every I/O thread has been in commands this long and none has
    // finished one, another thread is started: the longest that other
    // connections wait for blocked commands.
    std::chrono::microseconds blockedAfter{1000};
    // Bytes that the connections may hold in buffers, all together: answers
    // queued for clients, and large request frames from their first byte
    // (their whole announced length) until their command has ended. Beyond
    // it no new request is taken until the usage falls back; answers of
    // commands already running are queued all the same. 0: no limit.
    std::uint64_t memoryBudget = kDefaultMemoryBudget;
    // How long after a large amount of buffer memory has been released the
    // allocator is asked to return its free memory to the system (0: never).
    std::chrono::milliseconds trimDelay{1000};
    // TLS of every connection (TlsFiles); plain TCP when empty. A client
    // that has not completed its handshake within stallTimeout is closed.
    TlsFiles tls;
  };

  // port 0 binds a free port (see port()). With forceIp4 false the server
  // listens on IPv6 and IPv4 (a dual-stack socket), else on IPv4 only.
  SvcStub(std::uint16_t port, bool forceIp4, CmdFactory factory, IpcErrorHandler onError = {});
  SvcStub(std::uint16_t port, bool forceIp4, CmdFactory factory, IpcErrorHandler onError, Options options);
  // Stops and waits as signalStop() and waitToFinish() do. On one of the
  // server's own I/O threads it does not wait: the threads end by themselves.
  ~SvcStub();
  SvcStub(const SvcStub&) = delete;
  SvcStub& operator=(const SvcStub&) = delete;

  // The bound port.
  std::uint16_t port() const noexcept;

  // Stops accepting and reading requests and ends every connection: at
  // once when it runs no command or a progress stream (which its processor
  // stops), else once the running command has sent its answer (within
  // Options::stopGrace), so that a client never gets a Bye for a request
  // that was carried out. Returns false when the server was already
  // stopping.
  bool signalStop();
  // Blocks until the server has stopped after signalStop().
  void waitToFinish();

  // Connections currently open (for diagnostics and tests).
  std::size_t connectionCount() const;
  // Bytes counted against Options::memoryBudget, and connections waiting
  // for it to fall (for diagnostics and tests).
  std::uint64_t bufferedBytes() const;
  std::size_t connectionsWaitingForMemory() const;
  // The budget's limit in bytes (MemoryBudget::kUnlimited without one).
  std::uint64_t memoryLimit() const;
  // Bytes read from and written to client sockets since the start.
  std::uint64_t bytesReceived() const;
  std::uint64_t bytesSent() const;

  // Sends the answer of a processed command and lets its connection go on
  // with the next request. For progress commands the answer is their
  // progress stream, so this only marks the processing as done. Called on
  // the command's own I/O thread, it is meant as processCmd's last step:
  // the answer is written once processCmd has returned.
  void onRespReady(const std::shared_ptr<CmdI>& cmd);

 private:
  class Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace Ipc
