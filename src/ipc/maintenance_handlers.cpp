// Handlers of the maintenance commands (backup, restore, cleanup). They
// answer with a progress stream and run their operation on a thread of
// their own.

#include "ipc/handler_support.h"
#include "ipc/listener.h"

namespace Ipc::DB {

void Listener::process(Backup& cmd) { notAvailableYet(cmd); }

void Listener::process(Restore& cmd) { notAvailableYet(cmd); }

void Listener::process(Cleanup& cmd) { notAvailableYet(cmd); }

}  // namespace Ipc::DB
