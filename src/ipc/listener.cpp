#include "ipc/listener.h"

#include <chrono>
#include <stdexcept>

#include "framework/log.h"

namespace Ipc::DB {

Listener::ConnDB::ConnDB(std::shared_ptr<::DB::DBInstances> pool, std::string_view dbName)
    : db(std::move(pool), dbName) {}

Listener::ConnDB::~ConnDB() = default;

Listener::Listener(Passkey, Responder respond, std::shared_ptr<::DB::DBInstances> pool)
    : respond_(std::move(respond)), pool_(std::move(pool)) {}

Listener::~Listener() = default;

std::shared_ptr<Listener> Listener::createDetached(Responder respond, std::shared_ptr<::DB::DBInstances> pool) {
  return std::make_shared<Listener>(Passkey(), std::move(respond), std::move(pool));
}

std::shared_ptr<Ipc::CmdI> Listener::makeCmd(std::uint8_t tag) {
  // The commands share ownership of this Listener; shared_from_this throws
  // bad_weak_ptr once nobody owns it any more.
  auto self = std::static_pointer_cast<Listener>(shared_from_this());
  auto cmd = makeCommand(tag, std::move(self));
  if (!cmd) {
    Log::Lock entry(Log::Error);
    entry.logStreamLine() << "Ipc attempt to generate command with unknown tag: " << static_cast<char>(tag);
  }
  return cmd;
}

void Listener::processCmd(std::shared_ptr<Ipc::CmdI> cmd) {
  const auto started = std::chrono::steady_clock::now();
  bool failed = false;
  try {
    cmd->accept(*this);
    respond_(cmd);
  } catch (const std::exception& e) {
    failed = true;
    {
      Log::Lock entry(Log::Error);
      entry.logStreamLine() << "Dispatching command " << cmd->name() << " failed with " << e.what();
    }
    // Counted before the client learns of the failure: a scrape that
    // follows the ended connection finds it.
    stats_->record(cmd->tag(), cmd->name(), std::chrono::steady_clock::now() - started, failed);
    cmd->onTransferError("Terminating client connection due to processing error");
    return;
  }
  stats_->record(cmd->tag(), cmd->name(), std::chrono::steady_clock::now() - started, failed);
}

void Listener::onIpcError(const std::shared_ptr<Ipc::Socket>&, const std::string& text) {
  Log::Lock entry(Log::Warning);
  entry.logStreamLine() << "Ipc " << text;
}

::DB::DBLocal& Listener::dbOfConn(const Ipc::CmdI& cmd) {
  if (const auto& socket = cmd.socket()) {
    if (auto* conn = dynamic_cast<ConnDB*>(socket->connInf().get())) return conn->db;
  }
  throw std::runtime_error("No database associated with current connection. Connect command failed?");
}

}  // namespace Ipc::DB
