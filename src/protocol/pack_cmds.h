#pragma once
// Commands on packs: records, contents and use entries.

#include <string>

#include "framework/buffers.h"
#include "protocol/db_cmd.h"
#include "protocol/pack_info.h"

namespace Ipc::DB {

// Tag 9: the records of one folder (an empty folder: every record).
class GetPackInfos final : public DbCmd<GetPackInfos> {
 public:
  using DbCmd::DbCmd;

  const std::string& folder() const noexcept { return folder_; }
  void setRequest(std::string folder) { folder_ = std::move(folder); }

  // A null list is answered as an empty one.
  void setResp(PackInfosPtr list) { resp_ = std::move(list); }
  // Never null after readAnswer.
  const PackInfosPtr& respInfos() const noexcept { return resp_; }

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override;

 private:
  std::string folder_;
  PackInfosPtr resp_;
};

// Tag 10: one record, or none.
class GetPackInfo final : public DbCmd<GetPackInfo> {
 public:
  using DbCmd::DbCmd;

  const std::string& id() const noexcept { return id_; }
  void setRequest(std::string id) { id_ = std::move(id); }

  // Null when no record has the id.
  void setResp(PackInfoPtr info) { resp_ = std::move(info); }
  const PackInfoPtr& respInfo() const noexcept { return resp_; }

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override;

 private:
  std::string id_;
  PackInfoPtr resp_;
};

// Tag 11: applies a possibly partial record.
class UpdatePackInfo final : public DbCmd<UpdatePackInfo> {
 public:
  using DbCmd::DbCmd;

  const PackInfo* pInf() const noexcept { return &info_; }
  void setRequest(PackInfo info) { info_ = std::move(info); }

  // The record as the store wrote it (may be null).
  void setResp(PackInfoPtr info) { resp_ = std::move(info); }
  const PackInfoPtr& respInfo() const noexcept { return resp_; }

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override;

 private:
  PackInfo info_;
  PackInfoPtr resp_;
};

// Tag 12: stores a pack's record and content.
class SavePack final : public DbCmd<SavePack> {
 public:
  using DbCmd::DbCmd;

  const PackInfo& inf() const noexcept { return info_; }
  // The content as received (shares the request frame's bytes).
  const SharedMemBuffer& packData() const noexcept { return data_; }
  void setRequest(PackInfo info, SharedMemBuffer content);

  void setResp() {}

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer&) const override {}
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override { in.expectEnd(); }

 private:
  PackInfo info_;
  SharedMemBuffer data_;
};

// Tag 13: copies the data folder of one id to another id.
class ChangeDocId final : public DbCmd<ChangeDocId> {
 public:
  using DbCmd::DbCmd;

  const std::string& oldId() const noexcept { return oldId_; }
  const std::string& newId() const noexcept { return newId_; }
  void setRequest(std::string oldId, std::string newId);

  void setResp() {}

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer&) const override {}
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override { in.expectEnd(); }

 private:
  std::string oldId_;
  std::string newId_;
};

// Tag 14: fetches a pack; a use entry in the request opens, closes, locks
// or unlocks it at the same time.
class GetPack final : public DbCmd<GetPack> {
 public:
  using DbCmd::DbCmd;

  const PackInfo& inf() const noexcept { return info_; }
  void setRequest(PackInfo info) { info_ = std::move(info); }

  void setResp(PackInfoPtr info, SharedMemBuffer content);
  const PackInfoPtr& respInfo() const noexcept { return resp_; }
  const SharedMemBuffer& respData() const noexcept { return content_; }

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override;

 private:
  PackInfo info_;
  PackInfoPtr resp_;
  SharedMemBuffer content_;
};

// Tag 15: erases a pack's record and content.
class ErasePack final : public DbCmd<ErasePack> {
 public:
  using DbCmd::DbCmd;

  const std::string& id() const noexcept { return id_; }
  void setRequest(std::string id) { id_ = std::move(id); }

  void setResp() {}

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer&) const override {}
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override { in.expectEnd(); }

 private:
  std::string id_;
};

}  // namespace Ipc::DB
