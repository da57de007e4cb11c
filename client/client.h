#pragma once
// The C++ client of cvdbserver: one method per command, typed results.
//
//   cvdb::Client c({.host = "127.0.0.1", .port = 45678});
//   c.connect("Plant\\Line 2");
//   json::Value layout = c.getCfg("layout");
//
//   cvdb::Client secure({.host = "db.example", .port = 45678,
//                        .tls = cvdb::TlsOptions{.caFile = "/etc/corvina/ca.pem"}});
//
// Ownership: a Client owns its connection, opened by the constructor and
// closed by close() or the destructor.
// Thread safety: none; use one Client per thread.
// Failures: see client/errors.h. Refused leaves the connection usable;
// every ConnectionEnded (and OperationFailed) leaves the Client closed, and
// every later call throws ConnectionEnded. A Connect that the server answers
// with an error is a result, not an exception.

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "client/errors.h"
#include "client/frame_socket.h"
#include "framework/buffers.h"
#include "framework/json.h"
#include "protocol/commands.h"
#include "protocol/pack_info.h"

namespace cvdb {

struct ClientOptions {
  std::string host = "127.0.0.1";
  std::uint16_t port = 45678;
  std::chrono::milliseconds connectTimeout{5000};
  // Longest wait for more bytes of a request or an answer.
  std::chrono::milliseconds ioTimeout{60000};
  // Longest wait between two messages of a progress stream; 0 waits as long
  // as the operation takes.
  std::chrono::milliseconds progressTimeout{0};
  // Set: the connection is TLS, and the server's certificate is verified
  // against options.tls->caFile (or the system's trusted CAs) and the host
  // name (client/tls_session.h). Unset: plain TCP.
  std::optional<TlsOptions> tls;
};

// Percent (0 to 100) and text of one progress message.
using ProgressFn = std::function<void(std::uint32_t percent, const std::string& text)>;

struct ConnectResult {
  bool ok = true;
  std::string error;  // the server's text when !ok
  explicit operator bool() const noexcept { return ok; }
};

struct PackFetch {
  Ipc::PackInfoPtr info;  // null when the pack does not exist
  SharedMemBuffer content;
};

// A use entry of this process: the host name, the user name (from the
// environment, may be empty) and the process id.
Ipc::UseInfo localUse(Ipc::UseInfo::State state);

class Client {
 public:
  explicit Client(ClientOptions options = {});
  ~Client();
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  // Keep-alive; returns when the server answered.
  void ping();
  // Binds the connection to a database; openMode 0 opens or creates it, 1
  // opens an existing one only, others select it without opening.
  ConnectResult connect(const std::string& dbName, std::uint32_t openMode = 0);
  std::vector<std::string> dbNames();

  // Configuration parts: an empty value when the key has none.
  json::Value getCfg(const std::string& key);
  void setCfg(const std::string& key, const json::Object& part);
  void deleteCfg(const std::string& key);
  std::vector<std::string> cfgIds(const std::string& prefix = "");

  // Data files: empty content when the file does not exist.
  SharedMemBuffer getData(const std::string& id, const std::string& fileName);
  void setData(const std::string& id, const std::string& fileName, SharedMemBuffer content);

  // Packs.
  Ipc::PackInfos packInfos(const std::string& folder = "");
  Ipc::PackInfoPtr packInfo(const std::string& id);
  Ipc::PackInfoPtr updatePackInfo(const Ipc::PackInfo& info);
  void savePack(const Ipc::PackInfo& info, SharedMemBuffer content);
  // Fetches a pack; with a use entry it opens, closes, locks or unlocks the
  // pack in the same step.
  PackFetch getPack(const std::string& id, const std::optional<Ipc::UseInfo>& use = std::nullopt);
  PackFetch getPack(const Ipc::PackInfo& request);
  void changeDocId(const std::string& oldId, const std::string& newId);
  void erasePack(const std::string& id);

  // Maintenance: returns when the operation succeeded; throws
  // OperationFailed with the server's message when it failed.
  void backup(const std::string& target, bool all, const ProgressFn& onProgress = {});
  void restore(const std::string& target, bool all, const ProgressFn& onProgress = {});
  void cleanup(const std::set<std::string>& usedIds, const ProgressFn& onProgress = {});

  // Sends the command's request and reads its answer into it.
  void run(Ipc::CmdI& cmd);
  // Sends a maintenance command and reads its progress stream.
  void runWithProgress(Ipc::DB::ProgressCmdsBase& cmd, const ProgressFn& onProgress);
  // Sends a request frame with any tag and payload and returns the payload
  // of its Answer frame (for tests and diagnostics).
  std::string request(std::uint8_t tag, std::string_view payload);
  // Sends bytes as they are (for tests of malformed input).
  void sendRaw(std::string_view bytes);
  // Waits for the server's next frame and reports how the connection ends
  // (throws ConnectionEnded); for tests.
  [[noreturn]] void awaitEnd();

  bool isOpen() const noexcept { return socket_ && socket_->isOpen(); }
  void close() noexcept;

 private:
  FrameSocket& open();
  void sendFrame(const wire::OutFrame& frame);
  // The next frame that belongs to the request with this tag; Bye, Refused
  // and frames of the wrong tag are turned into exceptions.
  FrameSocket::Frame next(std::uint8_t tag, std::chrono::milliseconds timeout);
  [[noreturn]] void protocolError(const std::string& what);

  ClientOptions options_;
  std::unique_ptr<FrameSocket> socket_;
};

}  // namespace cvdb
