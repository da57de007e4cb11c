#include "protocol/pack_cmds.h"

#include "protocol/record_wire.h"

namespace Ipc::DB {

void GetPackInfos::readRequest(wire::Reader& in) {
  folder_ = in.str();
  in.expectEnd();
}

void GetPackInfos::writeRequest(wire::Writer& out) const { out.str(folder_); }

void GetPackInfos::writeAnswer(wire::Writer& out) const {
  static const PackInfos kNone;
  wirefmt::writePackInfos(out, resp_ ? *resp_ : kNone);
}

void GetPackInfos::readAnswer(wire::Reader& in) {
  resp_ = wirefmt::readPackInfos(in);
  in.expectEnd();
}

void GetPackInfo::readRequest(wire::Reader& in) {
  id_ = in.str();
  in.expectEnd();
}

void GetPackInfo::writeRequest(wire::Writer& out) const { out.str(id_); }

void GetPackInfo::writeAnswer(wire::Writer& out) const { wirefmt::writeOptPackInfo(out, resp_); }

void GetPackInfo::readAnswer(wire::Reader& in) {
  resp_ = wirefmt::readOptPackInfo(in);
  in.expectEnd();
}

void UpdatePackInfo::readRequest(wire::Reader& in) {
  info_ = wirefmt::readPackInfo(in);
  in.expectEnd();
}

void UpdatePackInfo::writeRequest(wire::Writer& out) const { wirefmt::writePackInfo(out, info_); }

void UpdatePackInfo::writeAnswer(wire::Writer& out) const { wirefmt::writeOptPackInfo(out, resp_); }

void UpdatePackInfo::readAnswer(wire::Reader& in) {
  resp_ = wirefmt::readOptPackInfo(in);
  in.expectEnd();
}

void SavePack::setRequest(PackInfo info, SharedMemBuffer content) {
  info_ = std::move(info);
  data_ = std::move(content);
}

void SavePack::readRequest(wire::Reader& in) {
  info_ = wirefmt::readPackInfo(in);
  data_ = in.sharedBytes();
  in.expectEnd();
}

void SavePack::writeRequest(wire::Writer& out) const {
  wirefmt::writePackInfo(out, info_);
  out.sharedBytes(data_);
}

void ChangeDocId::setRequest(std::string oldId, std::string newId) {
  oldId_ = std::move(oldId);
  newId_ = std::move(newId);
}

void ChangeDocId::readRequest(wire::Reader& in) {
  oldId_ = in.str();
  newId_ = in.str();
  in.expectEnd();
}

void ChangeDocId::writeRequest(wire::Writer& out) const {
  out.str(oldId_);
  out.str(newId_);
}

void GetPack::setResp(PackInfoPtr info, SharedMemBuffer content) {
  resp_ = std::move(info);
  content_ = std::move(content);
}

void GetPack::readRequest(wire::Reader& in) {
  info_ = wirefmt::readPackInfo(in);
  in.expectEnd();
}

void GetPack::writeRequest(wire::Writer& out) const { wirefmt::writePackInfo(out, info_); }

void GetPack::writeAnswer(wire::Writer& out) const {
  wirefmt::writeOptPackInfo(out, resp_);
  out.sharedBytes(content_);
}

void GetPack::readAnswer(wire::Reader& in) {
  resp_ = wirefmt::readOptPackInfo(in);
  content_ = in.sharedBytes();
  in.expectEnd();
}

void ErasePack::readRequest(wire::Reader& in) {
  id_ = in.str();
  in.expectEnd();
}

void ErasePack::writeRequest(wire::Writer& out) const { out.str(id_); }

}  // namespace Ipc::DB
