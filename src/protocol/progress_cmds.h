#pragma once
// Maintenance commands. Their answer is a stream of frames instead of one
// Answer frame: a first Progress message, more Progress messages (percent
// and text) while the operation runs, and a ProgressEnd frame.
//
// Thread safety: firstProgressMsg, sendMoreProgress and sendNoMoreProgress
// may be called from any thread, also after the connection has gone (the
// frames are then dropped). sendNoMoreProgress takes effect once; progress
// sent after it is dropped, so the end is always the stream's last frame.

#include <cstdint>
#include <set>
#include <string>
#include <utility>

#include "framework/thread_annotations.h"
#include "protocol/db_cmd.h"

namespace Ipc::DB {

class ProgressCmdsBase : public DbCmdBase {
 public:
  using DbCmdBase::DbCmdBase;

  bool streamsProgress() const noexcept override { return true; }

  // The stream's first message: percent 0 and the text.
  void firstProgressMsg(const std::string& text) EXCLUDES(mutex_);
  // One more message; percent runs from 0 to 100.
  void sendMoreProgress(std::uint32_t percent, const std::string& text) EXCLUDES(mutex_);
  // Ends the stream and lets the connection read its next request.
  void sendNoMoreProgress() EXCLUDES(mutex_);
  // Ends the stream and then the connection (Bye with the reason): requests
  // the client sent behind the command are neither run nor answered.
  void endStreamAndConnection(const std::string& byeReason) EXCLUDES(mutex_);

  // No Answer frame: the stream is the answer.
  void writeAnswer(wire::Writer&) const override {}
  void readAnswer(wire::Reader& in) override { in.expectEnd(); }

  // The payload of a Progress frame, for the receiving side.
  static std::pair<std::uint32_t, std::string> readProgress(wire::Reader& in);
  static void writeProgress(wire::Writer& out, std::uint32_t percent, const std::string& text);

 private:
  void sendProgress(std::uint32_t percent, const std::string& text) EXCLUDES(mutex_);
  // byeReason: null to go on with the next request.
  void endStream(const std::string* byeReason) EXCLUDES(mutex_);

  sys::Mutex mutex_;  // orders the frames of concurrent callers
  bool ended_ GUARDED_BY(mutex_) = false;
};

// Backup (tag 16) and Restore (tag 17) share their request: the archive file
// or folder (may be empty) and whether all databases are meant.
template <class Derived>
class ArchiveCmd : public DbCmd<Derived, ProgressCmdsBase> {
 public:
  using DbCmd<Derived, ProgressCmdsBase>::DbCmd;

  const std::string& pth() const noexcept { return target_; }
  bool all() const noexcept { return all_; }
  void setRequest(std::string target, bool all) {
    target_ = std::move(target);
    all_ = all;
  }

  void readRequest(wire::Reader& in) override {
    target_ = in.str();
    all_ = in.boolean();
    in.expectEnd();
  }
  void writeRequest(wire::Writer& out) const override {
    out.str(target_);
    out.boolean(all_);
  }

 private:
  std::string target_;
  bool all_ = false;
};

class Backup final : public ArchiveCmd<Backup> {
 public:
  using ArchiveCmd::ArchiveCmd;
};

class Restore final : public ArchiveCmd<Restore> {
 public:
  using ArchiveCmd::ArchiveCmd;
};

// Tag 18: removes data that no pack uses; usedIds are ids still in use.
class Cleanup final : public DbCmd<Cleanup, ProgressCmdsBase> {
 public:
  using DbCmd::DbCmd;

  const std::set<std::string>& usedIds() const noexcept { return usedIds_; }
  void setRequest(std::set<std::string> usedIds) { usedIds_ = std::move(usedIds); }

  void readRequest(wire::Reader& in) override;
  void writeRequest(wire::Writer& out) const override;

 private:
  std::set<std::string> usedIds_;
};

}  // namespace Ipc::DB
