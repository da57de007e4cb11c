#pragma once
// Common base of the database command classes.
//
// A command is built from a shared pointer to its processor on the server
// (the client builds it without one), carries its request fields and its
// answer, and encodes both (docs/protocol.md). The request is filled either
// by readRequest (server) or by the class's setRequest (client); the answer
// by the class's setResp (server) or by readAnswer (client).
// Thread safety: one thread at a time per command (see Ipc::CmdI).
// Failures: readRequest and readAnswer throw wire::DecodeError (json::Exc
// for JSON text); accept() throws std::bad_cast for a processor that is not
// a database command processor.

#include <memory>
#include <string>
#include <typeinfo>

#include "framework/cmd.h"
#include "protocol/cmd_table.h"
#include "protocol/processor.h"

namespace Ipc::DB {

class DbCmdBase : public Ipc::CmdI {
 public:
  explicit DbCmdBase(std::shared_ptr<CmdProcessorDBI> processor = nullptr) noexcept
      : processor_(std::move(processor)) {}

  std::shared_ptr<Ipc::CmdProcessorI> processor() const noexcept override { return processor_; }

 protected:
  static CmdProcessorDBI& asDb(Ipc::CmdProcessorI& p) { return dynamic_cast<CmdProcessorDBI&>(p); }

 private:
  std::shared_ptr<CmdProcessorDBI> processor_;
};

// Tag, name and dispatch of one class, from the command table.
template <class Derived, class Base = DbCmdBase>
class DbCmd : public Base {
 public:
  static constexpr std::uint8_t kTag = CmdTraits<Derived>::kTag;
  using Base::Base;

  std::uint8_t tag() const noexcept override { return kTag; }
  const std::string& name() const noexcept override {
    static const std::string n(CmdTraits<Derived>::kName);
    return n;
  }
  void accept(Ipc::CmdProcessorI& p) override { Base::asDb(p).process(static_cast<Derived&>(*this)); }
};

}  // namespace Ipc::DB
