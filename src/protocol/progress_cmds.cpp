#include "protocol/progress_cmds.h"

#include "protocol/record_wire.h"

namespace Ipc::DB {

void ProgressCmdsBase::writeProgress(wire::Writer& out, std::uint32_t percent, const std::string& text) {
  out.u32(percent);
  out.str(text);
}

std::pair<std::uint32_t, std::string> ProgressCmdsBase::readProgress(wire::Reader& in) {
  const std::uint32_t percent = in.u32();
  std::string text = in.str();
  in.expectEnd();
  return {percent, std::move(text)};
}

void ProgressCmdsBase::sendProgress(std::uint32_t percent, const std::string& text) {
  sys::MutexLock lock(mutex_);
  if (ended_ || !socket()) return;
  wire::OutFrame frame;
  wire::beginFrame(frame.head, tag(), wire::FrameKind::Progress);
  wire::Writer w(frame.head);
  writeProgress(w, percent, text);
  wire::endFrame(frame);
  socket()->send(std::move(frame));
}

void ProgressCmdsBase::firstProgressMsg(const std::string& text) { sendProgress(0, text); }

void ProgressCmdsBase::sendMoreProgress(std::uint32_t percent, const std::string& text) { sendProgress(percent, text); }

void ProgressCmdsBase::sendNoMoreProgress() { endStream(nullptr); }

void ProgressCmdsBase::endStreamAndConnection(const std::string& byeReason) { endStream(&byeReason); }

void ProgressCmdsBase::endStream(const std::string* byeReason) {
  sys::MutexLock lock(mutex_);
  if (ended_) return;
  ended_ = true;
  if (!socket()) return;
  wire::OutFrame frame;
  wire::beginFrame(frame.head, tag(), wire::FrameKind::ProgressEnd);
  wire::endFrame(frame);
  socket()->send(std::move(frame));
  // The connection runs these in this order: the end of the stream goes
  // out, the connection is closing, and only then is the command done, so
  // no request behind it is taken.
  if (byeReason) socket()->close(*byeReason);
  socket()->commandDone();
}

void Cleanup::readRequest(wire::Reader& in) {
  const std::vector<std::string> list = in.strList();
  in.expectEnd();
  usedIds_ = std::set<std::string>(list.begin(), list.end());
}

void Cleanup::writeRequest(wire::Writer& out) const {
  out.strList(std::vector<std::string>(usedIds_.begin(), usedIds_.end()));
}

}  // namespace Ipc::DB
