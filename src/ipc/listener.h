#pragma once
// The server's command processor: builds a command for every received tag,
// runs it through the handler of its class, hands it back to the command
// server for the answer, and turns a failed handler into a log line and the
// end of that client's connection.
//
// Always owned by a shared pointer (use createListener); commands keep it
// alive, and the command server's factory reaches it only through that
// ownership (once the Listener is no longer owned, the factory throws
// std::bad_weak_ptr). Holds no mutable state of its own and takes no lock:
// commands of one connection run one after another, so a connection's
// state is touched by one thread at a time.
// Failures: a handler that throws a standard exception ends its connection
// (see processCmd); nothing a client sends can make the Listener throw.

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "framework/svc_stub.h"
#include "ipc/command_stats.h"
#include "ipc/maintenance_runner.h"
#include "protocol/commands.h"
#include "protocol/processor.h"
#include "store/db_local.h"

namespace Ipc::DB {

class Listener final : public CmdProcessorDBI {
 public:
  // The database binding of one connection, kept in the connection's
  // connInf slot. Created by Connect; destroyed with the connection or when
  // a Connect for another database replaces it. It owns the connection's
  // store (db), built closed from the client's database name; destroying
  // the binding gives the store's session back.
  class ConnDB : public Ipc::ConnInf {
   public:
    ConnDB(std::shared_ptr<::DB::DBInstances> pool, std::string_view dbName);
    ~ConnDB() override;

    ::DB::DBLocal db;
  };

  // Where a processed command goes for its answer: the command server's
  // onRespReady.
  using Responder = std::function<void(const std::shared_ptr<Ipc::CmdI>&)>;

  // For tests: a Listener without a command server whose processed commands
  // go to respond instead.
  static std::shared_ptr<Listener> createDetached(Responder respond, std::shared_ptr<::DB::DBInstances> pool);

  ~Listener() override;
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  // A new command for the tag, built with this Listener as its processor
  // (PingPong without one); null, and the line "Ipc attempt to generate
  // command with unknown tag: " + the tag byte (priority 3), for any tag
  // that is not a command.
  std::shared_ptr<Ipc::CmdI> makeCmd(std::uint8_t tag);

  // Runs the command's handler and hands the command to the command server
  // for its answer. A standard exception is logged as "Dispatching command "
  // + name + " failed with " + what() (priority 3) and ends the connection
  // with "Terminating client connection due to processing error"; no answer
  // is sent. Other exceptions propagate.
  void processCmd(std::shared_ptr<Ipc::CmdI> cmd) override;

  // What the commands did so far (requests, failures, handler times).
  const CommandStats& stats() const noexcept { return *stats_; }
  // Maintenance operations running now.
  std::size_t maintenanceRunning() const { return maintenance_.running(); }

  // Logs "Ipc " + text (priority 4).
  void onIpcError(const std::shared_ptr<Ipc::Socket>& socket, const std::string& text) override;

  // The service's stop: asks every running maintenance operation to stop
  // at its next safe point and waits for them (bounded); later maintenance
  // commands fail with "Server is stopping". Call before the pool stops.
  void stopMaintenance();

  // The store of the command's connection (its binding's db), looked up
  // anew by each command; throws std::runtime_error "No database
  // associated with current connection. Connect command failed?" when the
  // connection has no binding.
  static ::DB::DBLocal& dbOfConn(const Ipc::CmdI& cmd);

  // Handlers, grouped as their source files are: maintenance, packs,
  // configuration and data.
  void process(DBNames& cmd) override;
  void process(Cleanup& cmd) override;
  void process(Restore& cmd) override;
  void process(Backup& cmd) override;
  void process(ErasePack& cmd) override;
  void process(GetPack& cmd) override;
  void process(ChangeDocId& cmd) override;
  void process(SavePack& cmd) override;
  void process(UpdatePackInfo& cmd) override;
  void process(GetPackInfo& cmd) override;
  void process(GetPackInfos& cmd) override;
  void process(SetData& cmd) override;
  void process(GetData& cmd) override;
  void process(CfgIds& cmd) override;
  void process(SetCfgPart& cmd) override;
  void process(GetCfgPart& cmd) override;
  void process(Connect& cmd) override;

 private:
  // Only the Listener's own factories can build one (make_shared needs a
  // public constructor).
  class Passkey {
    explicit Passkey() = default;
    friend class Listener;
    friend std::shared_ptr<Listener> createListener(std::uint16_t port, bool forceIp4,
                                                    std::shared_ptr<::DB::DBInstances> pool,
                                                    Ipc::SvcStub::Options options);
  };

 public:
  Listener(Passkey, Responder respond, std::shared_ptr<::DB::DBInstances> pool);

 private:
  friend std::shared_ptr<Listener> createListener(std::uint16_t port, bool forceIp4,
                                                  std::shared_ptr<::DB::DBInstances> pool,
                                                  Ipc::SvcStub::Options options);
  friend Ipc::SvcStub& serverOf(Listener& listener);

  // What a maintenance command runs on its thread, on the connection's
  // store: ownership of the callback passes to it.
  using MaintenanceWork =
      std::function<void(::DB::DBLocal&, std::unique_ptr<::DB::DBProgressCallback>, std::stop_token)>;
  // Sends the start text, then runs work on a maintenance thread; the
  // client receives, in this order, the start text, everything the work
  // reports, on failure one message at 100 with "DB operation failed with
  // error: " and the failure's text, and the end of the stream. A failure
  // (also "No database associated with current connection. Connect command
  // failed?" for a connection without a database) is logged as "Async
  // command X failed with ..." and ends the connection after the stream.
  void runAsync(ProgressCmdsBase& cmd, const std::string& startText, MaintenanceWork work);

  Responder respond_;
  // The databases' pool, with their paths and the Env: what every
  // connection's store works with.
  const std::shared_ptr<::DB::DBInstances> pool_;
  MaintenanceRunner maintenance_;
  // Shared with the maintenance threads, which may outlive the Listener.
  std::shared_ptr<CommandStats> stats_ = std::make_shared<CommandStats>();
  std::shared_ptr<Ipc::SvcStub> server_;  // null for a detached Listener
};

// Builds the Listener and its command server on the port (0: any free
// port), serving the databases of the pool; throws std::runtime_error when
// the port cannot be bound. options tune the transport (the memory budget).
std::shared_ptr<Listener> createListener(std::uint16_t port, bool forceIp4, std::shared_ptr<::DB::DBInstances> pool,
                                         Ipc::SvcStub::Options options = {});
// The Listener's command server; throws std::logic_error for a detached
// Listener.
Ipc::SvcStub& serverOf(Listener& listener);

}  // namespace Ipc::DB
