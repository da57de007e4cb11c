// cvdbserver: the Corvina database server, run in the foreground (under
// systemd or from a terminal). See `cvdbserver --help`.

#include <malloc.h>

#include <memory>

#include "framework/platform.h"
#include "framework/service_host.h"
#include "service/db_svc.h"

namespace {

// A large answer (a listing of thousands of pack records is megabytes)
// is built in fresh memory each time. By default glibc gives such blocks
// back to the system when they are freed, and the next answer pays again
// for every page it touches (a listing of 10,000 records spent a sixth of
// its time in page faults). Keeping up to 64 MiB of freed memory per arena,
// and serving blocks up to 32 MiB from the heap, lets answers reuse it;
// bigger values (configuration parts, pack contents) still come from and go
// back to the system at once.
void tuneAllocator() {
  mallopt(M_MMAP_THRESHOLD, 32 * 1024 * 1024);
  mallopt(M_TRIM_THRESHOLD, 64 * 1024 * 1024);
}

}  // namespace

int main(int argc, char** argv) {
  tuneAllocator();
  Service::Host& host = Service::inst();
  // The command line decides the folders (--home, --log-dir) before the log
  // moves into its service subfolder.
  if (auto code = host.prepare(argc, argv)) return *code;
  Platform::inst().changeLogDir(Platform::inst().logDir() / "svc");
  return host.main(argc, argv, std::make_unique<DBServer::DBSvc>());
}
