// Handlers of the pack commands: records, contents, use entries and the
// copy of a document's data to a new id. The rules of records and use
// lists live in the store; the handlers only carry values across.

#include <memory>
#include <utility>

#include "ipc/listener.h"
#include "store/db_local.h"

namespace Ipc::DB {

void Listener::process(GetPackInfos& cmd) { cmd.setResp(dbOfConn(cmd).infos(cmd.folder())); }

void Listener::process(GetPackInfo& cmd) { cmd.setResp(dbOfConn(cmd).infoFor(cmd.id())); }

void Listener::process(UpdatePackInfo& cmd) { cmd.setResp(dbOfConn(cmd).updateInfo(*cmd.pInf())); }

void Listener::process(SavePack& cmd) {
  // The handler holds its own share of the content for its whole run.
  const SharedMemBuffer content = cmd.packData();
  dbOfConn(cmd).savePackMeta(cmd.inf(), content.data(), content.size());
  cmd.setResp();
}

void Listener::process(ChangeDocId& cmd) {
  dbOfConn(cmd).copyDataFolder(cmd.oldId(), cmd.newId());
  cmd.setResp();
}

void Listener::process(GetPack& cmd) {
  ::DB::DBLocal::PackMeta found = dbOfConn(cmd).packMetadata(cmd.inf());
  // The answer takes the store's bytes over; the transport sends them from
  // there as the frame's tail.
  cmd.setResp(std::move(found.info), SharedMemBuffer(std::move(found.content)));
}

void Listener::process(ErasePack& cmd) {
  dbOfConn(cmd).removePack(cmd.id());
  cmd.setResp();
}

}  // namespace Ipc::DB
