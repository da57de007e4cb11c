// The Listener's command server, kept apart from the dispatching code so
// that a Listener can be tested without a network.

#include <future>
#include <stdexcept>

#include "ipc/listener.h"

namespace Ipc::DB {

std::shared_ptr<Listener> createListener(std::uint16_t port, bool forceIp4, std::shared_ptr<::DB::DBInstances> pool,
                                         Ipc::SvcStub::Options options) {
  // The command server serves from its construction on, so a command may be
  // processed before the constructor has returned: its answer waits until
  // the server is known.
  std::promise<Ipc::SvcStub*> serverKnown;
  std::shared_future<Ipc::SvcStub*> server = serverKnown.get_future().share();
  auto listener = std::make_shared<Listener>(
      Listener::Passkey(), [server](const std::shared_ptr<Ipc::CmdI>& cmd) { server.get()->onRespReady(cmd); },
      std::move(pool));

  const std::weak_ptr<Listener> weak = listener;
  // The factory and the error handler reach the Listener only through its
  // shared ownership: the command server may outlive the last owner.
  auto factory = [weak](std::uint8_t tag) { return std::shared_ptr<Listener>(weak)->makeCmd(tag); };
  auto onError = [weak](const std::shared_ptr<Ipc::Socket>& socket, const std::string& text) {
    if (auto l = weak.lock()) l->onIpcError(socket, text);
  };
  try {
    listener->server_ = std::make_shared<Ipc::SvcStub>(port, forceIp4, std::move(factory), std::move(onError), options);
  } catch (...) {
    serverKnown.set_exception(std::current_exception());
    throw;
  }
  serverKnown.set_value(listener->server_.get());
  return listener;
}

Ipc::SvcStub& serverOf(Listener& listener) {
  if (!listener.server_) throw std::logic_error("this Listener has no command server");
  return *listener.server_;
}

}  // namespace Ipc::DB
