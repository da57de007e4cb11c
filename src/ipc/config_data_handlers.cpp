// Handlers of the commands that bind a connection to a database, read and
// write its configuration parts and data files, and list the databases.

#include <filesystem>
#include <system_error>

#include "ipc/handler_support.h"
#include "ipc/listener.h"
#include "service/config.h"
#include "service/names.h"

namespace Ipc::DB {

void Listener::process(Connect& cmd) { notAvailableYet(cmd); }

void Listener::process(DBNames& cmd) {
  namespace fs = std::filesystem;
  const DBConfig& config = DBConfig::inst();
  const fs::path root(config.DBRoot);
  std::vector<std::string> names;
  // A server that has not created any database yet has no root folder:
  // that is an empty list, not a failure.
  std::error_code ec;
  if (!fs::is_directory(root, ec)) {
    cmd.setResp(std::move(names));
    return;
  }
  for (const fs::directory_entry& top : fs::directory_iterator(root)) {
    if (!top.is_directory() || !::DB::isDBFolderName(top.path().filename().string())) continue;
    for (const fs::directory_entry& e : fs::recursive_directory_iterator(top.path())) {
      if (e.is_regular_file() && e.path().filename().string() == config.DBFileName) {
        names.push_back(::DB::nameFromRelativeFolder(e.path().parent_path().lexically_relative(root).generic_string()));
      }
    }
  }
  cmd.setResp(std::move(names));
}

void Listener::process(GetCfgPart& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(SetCfgPart& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(CfgIds& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(GetData& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

void Listener::process(SetData& cmd) {
  dbOfConn(cmd);
  notAvailableYet(cmd);
}

}  // namespace Ipc::DB
