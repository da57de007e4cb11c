#pragma once
// The processor interface of the database commands: one operation per
// command class. A command's accept() calls the operation of its class.
//
// Implementations run an operation on the thread that calls processCmd and
// report failures by throwing (see Ipc::CmdProcessorI).

#include "framework/cmd.h"
#include "protocol/cmd_table.h"

namespace Ipc::DB {

class CmdProcessorDBI : public Ipc::CmdProcessorI {
 public:
  // Declared in this order on purpose: it is the processor's slot order.
  virtual void process(DBNames& cmd) = 0;
  virtual void process(Cleanup& cmd) = 0;
  virtual void process(Restore& cmd) = 0;
  virtual void process(Backup& cmd) = 0;
  virtual void process(ErasePack& cmd) = 0;
  virtual void process(GetPack& cmd) = 0;
  virtual void process(ChangeDocId& cmd) = 0;
  virtual void process(SavePack& cmd) = 0;
  virtual void process(UpdatePackInfo& cmd) = 0;
  virtual void process(GetPackInfo& cmd) = 0;
  virtual void process(GetPackInfos& cmd) = 0;
  virtual void process(SetData& cmd) = 0;
  virtual void process(GetData& cmd) = 0;
  virtual void process(CfgIds& cmd) = 0;
  virtual void process(SetCfgPart& cmd) = 0;
  virtual void process(GetCfgPart& cmd) = 0;
  virtual void process(Connect& cmd) = 0;
};

}  // namespace Ipc::DB
