#pragma once
// The server's command processor: builds a command for every received tag,
// runs it through the handler of its class, hands it back to the command
// server for the answer, and turns a failed handler into a log line and the
// end of that client's connection.
//
// Always owned by a shared pointer (use create()); commands keep it alive.
// Holds no mutable state of its own and takes no lock: commands of one
// connection run one after another, so a connection's state is touched by
// one thread at a time.

#include <cstdint>
#include <memory>

#include "framework/svc_stub.h"

namespace Ipc::DB {

class Listener;  // completed by the command-processing layer

// Builds the Listener and its command server on the port (0: any free
// port); throws std::runtime_error when the port cannot be bound.
std::shared_ptr<Listener> createListener(std::uint16_t port, bool forceIp4);
// The Listener's command server.
Ipc::SvcStub& serverOf(Listener& listener);

}  // namespace Ipc::DB
