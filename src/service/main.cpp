// cvdbserver: the Corvina database server, run in the foreground (under
// systemd or from a terminal). See `cvdbserver --help`.

#include <memory>

#include "framework/platform.h"
#include "framework/service_host.h"
#include "service/db_svc.h"

int main(int argc, char** argv) {
  Service::Host& host = Service::inst();
  // The command line decides the folders (--home, --log-dir) before the log
  // moves into its service subfolder.
  if (auto code = host.prepare(argc, argv)) return *code;
  Platform::inst().changeLogDir(Platform::inst().logDir() / "svc");
  return host.main(argc, argv, std::make_unique<DBServer::DBSvc>());
}
