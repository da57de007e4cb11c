#include "framework/cmd.h"

namespace Ipc {

wire::OutFrame CmdI::answerFrame() const {
  wire::OutFrame out;
  wire::beginFrame(out.head, tag(), wire::FrameKind::Answer);
  wire::Writer w(out.head, out.tail);
  writeAnswer(w);
  wire::endFrame(out);
  return out;
}

wire::OutFrame CmdI::requestFrame() const {
  wire::OutFrame out;
  wire::beginFrame(out.head, tag(), wire::FrameKind::Request);
  wire::Writer w(out.head, out.tail);
  writeRequest(w);
  wire::endFrame(out);
  return out;
}

void CmdI::onTransferError(const std::string& text) {
  if (socket_) socket_->close(text);
}

const std::string& PingPong::name() const noexcept {
  static const std::string n = "PingPong";
  return n;
}

}  // namespace Ipc
