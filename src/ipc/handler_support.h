#pragma once
// Helpers shared by the Listener's handler files.

#include <stdexcept>
#include <string>

#include "framework/cmd.h"

namespace Ipc::DB {

// The failure of a handler whose store operation this build does not have
// yet: it ends the connection through the Listener's failure path.
[[noreturn]] inline void notAvailableYet(const Ipc::CmdI& cmd) {
  throw std::runtime_error(cmd.name() + " is not available in this build yet");
}

}  // namespace Ipc::DB
