#include "client/client.h"

#include <unistd.h>

#include <climits>
#include <cstdlib>

namespace cvdb {
namespace {

constexpr std::string_view kFailurePrefix = "DB operation failed with error: ";

std::string byeReason(const FrameSocket::Frame& f) {
  try {
    wire::Reader in = f.reader();
    std::string reason = in.str();
    return reason;
  } catch (const wire::DecodeError&) {
    return "(unreadable reason)";
  }
}

}  // namespace

Ipc::UseInfo localUse(Ipc::UseInfo::State state) {
  char host[HOST_NAME_MAX + 1] = {};
  if (::gethostname(host, sizeof(host) - 1) != 0) host[0] = 0;
  const char* user = std::getenv("USER");
  if (!user) user = std::getenv("LOGNAME");
  return Ipc::UseInfo(state, host, user ? user : "", static_cast<std::uint32_t>(::getpid()));
}

Client::Client(ClientOptions options)
    : options_(std::move(options)),
      socket_(std::make_unique<FrameSocket>(options_.host, options_.port, options_.connectTimeout,
                                            options_.tls ? &*options_.tls : nullptr)) {}

Client::~Client() = default;

void Client::close() noexcept {
  if (socket_) socket_->close();
}

FrameSocket& Client::open() {
  if (!isOpen()) throw ConnectionEnded("the connection is closed", false);
  return *socket_;
}

void Client::protocolError(const std::string& what) {
  close();
  throw ConnectionEnded("unexpected data from the server: " + what, false);
}

FrameSocket::Frame Client::next(std::uint8_t tag, std::chrono::milliseconds timeout) {
  FrameSocket::Frame f = open().receive(timeout);
  if (f.kind == wire::FrameKind::Bye) {
    const std::string reason = byeReason(f);
    close();
    throw ConnectionEnded(reason, true);
  }
  if (f.tag != tag)
    protocolError("a frame of tag " + std::to_string(f.tag) + " in the answer to tag " + std::to_string(tag));
  if (f.kind == wire::FrameKind::Refused) {
    std::string text;
    try {
      wire::Reader in = f.reader();
      text = in.str();
      in.expectEnd();
    } catch (const wire::DecodeError& e) {
      protocolError(e.what());
    }
    throw Refused(tag, text);
  }
  return f;
}

void Client::sendFrame(const wire::OutFrame& frame) {
  try {
    open().send(frame, options_.ioTimeout);
  } catch (const ConnectionEnded&) {
    // A server that ended the connection has usually sent a Bye first; its
    // reason says more than the broken pipe.
    try {
      FrameSocket::Frame f = socket_->receive(std::chrono::milliseconds(500));
      if (f.kind == wire::FrameKind::Bye) {
        const std::string reason = byeReason(f);
        close();
        throw ConnectionEnded(reason, true);
      }
    } catch (const ConnectionEnded& e) {
      if (e.byServer()) throw;
    }
    close();
    throw;
  }
}

void Client::run(Ipc::CmdI& cmd) {
  sendFrame(cmd.requestFrame());
  FrameSocket::Frame f = next(cmd.tag(), options_.ioTimeout);
  if (f.kind != wire::FrameKind::Answer) protocolError("frame kind " + std::to_string(static_cast<int>(f.kind)));
  try {
    wire::Reader in = f.reader();
    cmd.readAnswer(in);
  } catch (const wire::DecodeError& e) {
    protocolError(cmd.name() + " answer: " + e.what());
  } catch (const json::Exc& e) {
    protocolError(cmd.name() + " answer: " + e.what());
  }
}

void Client::runWithProgress(Ipc::DB::ProgressCmdsBase& cmd, const ProgressFn& onProgress) {
  sendFrame(cmd.requestFrame());
  std::optional<std::string> failure;
  while (true) {
    FrameSocket::Frame f;
    try {
      f = next(cmd.tag(), options_.progressTimeout);
    } catch (const ConnectionEnded& e) {
      // The server ends the connection after a failure message; report the
      // failure, which says more than the end.
      if (failure && e.byServer()) throw OperationFailed(*failure);
      throw;
    }
    if (f.kind == wire::FrameKind::ProgressEnd) {
      if (f.size != 0) protocolError("ProgressEnd with a payload");
      if (failure) {
        close();
        throw OperationFailed(*failure);
      }
      return;
    }
    if (f.kind != wire::FrameKind::Progress) protocolError("frame kind " + std::to_string(static_cast<int>(f.kind)));
    std::pair<std::uint32_t, std::string> progress;
    try {
      wire::Reader in = f.reader();
      progress = Ipc::DB::ProgressCmdsBase::readProgress(in);
    } catch (const wire::DecodeError& e) {
      protocolError(e.what());
    }
    if (progress.second.starts_with(kFailurePrefix)) failure = progress.second;
    if (onProgress) {
      try {
        onProgress(progress.first, progress.second);
      } catch (...) {
        // The rest of the stream would be read as the next answer.
        close();
        throw;
      }
    }
  }
}

std::string Client::request(std::uint8_t tag, std::string_view payload) {
  wire::OutFrame frame;
  wire::beginFrame(frame.head, tag, wire::FrameKind::Request);
  frame.head.append(payload);
  wire::endFrame(frame);
  sendFrame(frame);
  FrameSocket::Frame f = next(tag, options_.ioTimeout);
  if (f.kind != wire::FrameKind::Answer) protocolError("frame kind " + std::to_string(static_cast<int>(f.kind)));
  return std::string(reinterpret_cast<const char*>(f.payload.get()), f.size);
}

void Client::sendRaw(std::string_view bytes) {
  try {
    open().sendRaw(bytes.data(), bytes.size(), options_.ioTimeout);
  } catch (const ConnectionEnded&) {
    close();
    throw;
  }
}

void Client::awaitEnd() {
  while (true) {
    // Anything but a Bye (or the socket's end) is skipped.
    FrameSocket::Frame f = open().receive(options_.ioTimeout);
    if (f.kind == wire::FrameKind::Bye) {
      const std::string reason = byeReason(f);
      close();
      throw ConnectionEnded(reason, true);
    }
  }
}

void Client::ping() {
  Ipc::PingPong cmd;
  run(cmd);
}

ConnectResult Client::connect(const std::string& dbName, std::uint32_t openMode) {
  Ipc::DB::Connect cmd;
  cmd.setRequest(dbName, openMode);
  run(cmd);
  return {!cmd.respFailed(), cmd.respError()};
}

std::vector<std::string> Client::dbNames() {
  Ipc::DB::DBNames cmd;
  run(cmd);
  return cmd.respList();
}

json::Value Client::getCfg(const std::string& key) {
  Ipc::DB::GetCfgPart cmd;
  cmd.setRequest(key);
  run(cmd);
  return cmd.respCfg();
}

void Client::setCfg(const std::string& key, const json::Object& part) {
  Ipc::DB::SetCfgPart cmd;
  cmd.setRequest(key, part);
  run(cmd);
}

void Client::deleteCfg(const std::string& key) {
  Ipc::DB::SetCfgPart cmd;
  cmd.setDeleteRequest(key);
  run(cmd);
}

std::vector<std::string> Client::cfgIds(const std::string& prefix) {
  Ipc::DB::CfgIds cmd;
  cmd.setRequest(prefix);
  run(cmd);
  return cmd.respList();
}

SharedMemBuffer Client::getData(const std::string& id, const std::string& fileName) {
  Ipc::DB::GetData cmd;
  cmd.setRequest(id, fileName);
  run(cmd);
  return cmd.respData();
}

void Client::setData(const std::string& id, const std::string& fileName, SharedMemBuffer content) {
  Ipc::DB::SetData cmd;
  cmd.setRequest(id, fileName, std::move(content));
  run(cmd);
}

Ipc::PackInfos Client::packInfos(const std::string& folder) {
  Ipc::DB::GetPackInfos cmd;
  cmd.setRequest(folder);
  run(cmd);
  // The command dies here: its decoded list is moved out, not copied.
  return std::move(*cmd.respInfos());
}

Ipc::PackInfoPtr Client::packInfo(const std::string& id) {
  Ipc::DB::GetPackInfo cmd;
  cmd.setRequest(id);
  run(cmd);
  return cmd.respInfo();
}

Ipc::PackInfoPtr Client::updatePackInfo(const Ipc::PackInfo& info) {
  Ipc::DB::UpdatePackInfo cmd;
  cmd.setRequest(info);
  run(cmd);
  return cmd.respInfo();
}

void Client::savePack(const Ipc::PackInfo& info, SharedMemBuffer content) {
  Ipc::DB::SavePack cmd;
  cmd.setRequest(info, std::move(content));
  run(cmd);
}

PackFetch Client::getPack(const std::string& id, const std::optional<Ipc::UseInfo>& use) {
  Ipc::PackInfo request(id);
  if (use) request.uses.append(*use);
  return getPack(request);
}

PackFetch Client::getPack(const Ipc::PackInfo& request) {
  Ipc::DB::GetPack cmd;
  cmd.setRequest(request);
  run(cmd);
  return {cmd.respInfo(), cmd.respData()};
}

void Client::changeDocId(const std::string& oldId, const std::string& newId) {
  Ipc::DB::ChangeDocId cmd;
  cmd.setRequest(oldId, newId);
  run(cmd);
}

void Client::erasePack(const std::string& id) {
  Ipc::DB::ErasePack cmd;
  cmd.setRequest(id);
  run(cmd);
}

void Client::backup(const std::string& target, bool all, const ProgressFn& onProgress) {
  Ipc::DB::Backup cmd;
  cmd.setRequest(target, all);
  runWithProgress(cmd, onProgress);
}

void Client::restore(const std::string& target, bool all, const ProgressFn& onProgress) {
  Ipc::DB::Restore cmd;
  cmd.setRequest(target, all);
  runWithProgress(cmd, onProgress);
}

void Client::cleanup(const std::set<std::string>& usedIds, const ProgressFn& onProgress) {
  Ipc::DB::Cleanup cmd;
  cmd.setRequest(usedIds);
  runWithProgress(cmd, onProgress);
}

}  // namespace cvdb
