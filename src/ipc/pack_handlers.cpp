// Handlers of the pack commands: records, contents, use entries and the
// copy of a document's data to a new id.

#include "ipc/handler_support.h"
#include "ipc/listener.h"

namespace Ipc::DB {

void Listener::process(GetPackInfos& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(GetPackInfo& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(UpdatePackInfo& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(SavePack& cmd) {
  // The handler holds its own share of the content for its whole run.
  const SharedMemBuffer content = cmd.packData();
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(ChangeDocId& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(GetPack& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(ErasePack& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

}  // namespace Ipc::DB
