// Handlers of the commands that bind a connection to a database, read and
// write its configuration parts and data files, and list the databases.

#include <filesystem>
#include <memory>
#include <stdexcept>
#include <string>
#include <system_error>
#include <vector>

#include "engine/db_instances.h"
#include "framework/log.h"
#include "ipc/listener.h"
#include "settings/names.h"
#include "store/catalog.h"
#include "store/db_local.h"

namespace Ipc::DB {

void Listener::process(Connect& cmd) {
  const std::string& dbName = cmd.dbName();
  // A name that would leave the database root, or give an existing
  // database a second key, is refused before anything is opened or made;
  // the connection keeps whatever binding it had.
  std::string why;
  if (!pool_->paths().acceptsName(dbName, &why)) {
    Log::Lock(Log::Notice).logStreamLine() << "Connect refused the database name \"" << dbName << "\": " << why;
    cmd.setResp("Database name " + dbName + " is not valid");
    return;
  }
  const auto& socket = cmd.socket();
  if (!socket) throw std::runtime_error("Connect without a connection");
  std::unique_ptr<Ipc::ConnInf>& slot = socket->connInf();
  auto* bound = dynamic_cast<ConnDB*>(slot.get());
  if (bound && bound->db.name() == ::DB::folderName(dbName)) {
    // Already bound to this database: an open binding stays as it is, one
    // that was only selected (mode 2) is opened now as the mode asks.
    if (bound->db.isOpen() || cmd.openMode() > 1) {
      cmd.setResp();
      return;
    }
  } else {
    // The previous binding goes first, giving its session back; the new one
    // stays installed, closed, if opening fails below.
    slot.reset();
    slot = std::make_unique<ConnDB>(pool_, dbName);
  }
  ::DB::DBLocal& db = static_cast<ConnDB&>(*slot).db;
  switch (cmd.openMode()) {
    case 0:
      db.exists(false);
      break;
    case 1:
      if (!db.exists(true)) {
        cmd.setResp("Database " + dbName + " does not exist");
        return;
      }
      break;
    default:
      break;  // bound without opening
  }
  cmd.setResp();
}

void Listener::process(DBNames& cmd) {
  // A server that has not created any database yet has no root folder:
  // that is an empty list, not a failure.
  cmd.setResp(::DB::databaseKeys(pool_->env(), pool_->paths()));
}

void Listener::process(GetCfgPart& cmd) {
  // Keys are shared with pack contents: bytes that are not a JSON object
  // make the parser throw, which ends this connection and nothing else.
  cmd.setResp(dbOfConn(cmd).cfgPartText(cmd.key()));
}

void Listener::process(SetCfgPart& cmd) {
  ::DB::DBLocal& db = dbOfConn(cmd);
  if (cmd.deleteData()) {
    db.removeMetaBlob(cmd.key());
  } else {
    // The wrapper's compact text, as its stream output writes it.
    const std::string text = cmd.jCfgData().dump();
    db.saveMetaBlob(text.data(), text.size(), cmd.key());
  }
  cmd.setResp();
}

void Listener::process(CfgIds& cmd) { cmd.setResp(dbOfConn(cmd).metaBlobsWithPrefix(cmd.prefix())); }

void Listener::process(GetData& cmd) { cmd.setResp(dbOfConn(cmd).loadDataBlob(cmd.id(), cmd.fileName())); }

void Listener::process(SetData& cmd) {
  const SharedMemBuffer& content = cmd.data();
  dbOfConn(cmd).saveDataBlob(content.data(), content.size(), cmd.id(), cmd.fileName());
}

}  // namespace Ipc::DB
