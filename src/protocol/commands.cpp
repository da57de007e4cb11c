#include "protocol/commands.h"

namespace Ipc::DB {

std::shared_ptr<CmdI> makeCommand(std::uint8_t tag, std::shared_ptr<CmdProcessorDBI> processor) {
  switch (tag) {
    case Ipc::PingPong::kTag:
      return std::make_shared<Ipc::PingPong>();
#define CVDB_MAKE_CMD(t, Class) \
  case t:                       \
    return std::make_shared<Class>(std::move(processor));
      CVDB_DB_COMMANDS(CVDB_MAKE_CMD)
#undef CVDB_MAKE_CMD
    default:
      return nullptr;
  }
}

}  // namespace Ipc::DB
