#pragma once
// The one table of the protocol's commands: tag, class and name. The
// Listener's factory, the client, the fuzz target and the documentation
// check all read it, so adding a command means one line here, its class and
// its processor operation.

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string_view>

#include "framework/cmd.h"

// X(tag, Class) for every database command, in tag order. The class name is
// also the command's name in log lines.
#define CVDB_DB_COMMANDS(X) \
  X(3, Connect)             \
  X(4, GetCfgPart)          \
  X(5, SetCfgPart)          \
  X(6, CfgIds)              \
  X(7, GetData)             \
  X(8, SetData)             \
  X(9, GetPackInfos)        \
  X(10, GetPackInfo)        \
  X(11, UpdatePackInfo)     \
  X(12, SavePack)           \
  X(13, ChangeDocId)        \
  X(14, GetPack)            \
  X(15, ErasePack)          \
  X(16, Backup)             \
  X(17, Restore)            \
  X(18, Cleanup)            \
  X(19, DBNames)

namespace Ipc::DB {

class CmdProcessorDBI;

#define CVDB_DECLARE_CMD(tag, Class) class Class;
CVDB_DB_COMMANDS(CVDB_DECLARE_CMD)
#undef CVDB_DECLARE_CMD

// Tag and name of a command class, from the table.
template <class C>
struct CmdTraits;
#define CVDB_CMD_TRAITS(t, Class)                     \
  template <>                                         \
  struct CmdTraits<Class> {                           \
    static constexpr std::uint8_t kTag = t;           \
    static constexpr std::string_view kName = #Class; \
  };
CVDB_DB_COMMANDS(CVDB_CMD_TRAITS)
#undef CVDB_CMD_TRAITS

struct CmdEntry {
  std::uint8_t tag;
  std::string_view name;
};

#define CVDB_COUNT_CMD(tag, Class) +1
inline constexpr std::size_t kDbCommandCount = 0 CVDB_DB_COMMANDS(CVDB_COUNT_CMD);
#undef CVDB_COUNT_CMD

// Every command the server knows, the keep-alive first.
#define CVDB_CMD_ENTRY(t, Class) CmdEntry{t, #Class},
inline constexpr std::array<CmdEntry, kDbCommandCount + 1> kCommandTable{
    {CmdEntry{Ipc::PingPong::kTag, "PingPong"}, CVDB_DB_COMMANDS(CVDB_CMD_ENTRY)}};
#undef CVDB_CMD_ENTRY

// A new command for a known tag, built with the processor (PingPong is
// built without one); null for any other tag.
std::shared_ptr<CmdI> makeCommand(std::uint8_t tag, std::shared_ptr<CmdProcessorDBI> processor);

}  // namespace Ipc::DB
