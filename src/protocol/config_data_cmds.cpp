#include "protocol/config_data_cmds.h"

#include <utility>

#include "protocol/record_wire.h"

namespace Ipc::DB {

void Connect::setRequest(std::string dbName, std::uint32_t openMode) {
  dbName_ = std::move(dbName);
  openMode_ = openMode;
}

void Connect::readRequest(wire::Reader& in) {
  dbName_ = in.str();
  openMode_ = in.u32();
  in.expectEnd();
}

void Connect::writeRequest(wire::Writer& out) const {
  out.str(dbName_);
  out.u32(openMode_);
}

void Connect::writeAnswer(wire::Writer& out) const {
  out.boolean(failed_);
  if (failed_) out.str(error_);
}

void Connect::readAnswer(wire::Reader& in) {
  failed_ = in.boolean();
  error_ = failed_ ? in.str() : std::string();
  in.expectEnd();
}

void GetCfgPart::readRequest(wire::Reader& in) {
  key_ = in.str();
  in.expectEnd();
}

void GetCfgPart::writeRequest(wire::Writer& out) const { out.str(key_); }

void GetCfgPart::writeAnswer(wire::Writer& out) const {
  if (!text_) {
    wirefmt::writeJson(out, resp_);
    return;
  }
  // The json? field of wirefmt::writeJson from the text it would dump.
  out.boolean(!text_->empty());
  if (!text_->empty()) out.str(*text_);
}

void GetCfgPart::readAnswer(wire::Reader& in) {
  resp_ = wirefmt::readJson(in);
  in.expectEnd();
}

void SetCfgPart::setRequest(std::string key, json::Object data) {
  key_ = std::move(key);
  delete_ = false;
  data_ = std::move(data);
}

void SetCfgPart::setDeleteRequest(std::string key) {
  key_ = std::move(key);
  delete_ = true;
  data_ = json::Object();
}

void SetCfgPart::readRequest(wire::Reader& in) {
  key_ = in.str();
  delete_ = in.boolean();
  // The json? field of wirefmt::readJson, its text kept unparsed.
  textPending_ = in.boolean();
  text_ = textPending_ ? in.sharedStr() : SharedMemBuffer();
  in.expectEnd();
  data_ = json::Object();
  if (!textPending_ && !delete_) throw wire::DecodeError("SetCfgPart carries no data");
}

void SetCfgPart::finishRequest() {
  if (!textPending_) return;
  textPending_ = false;
  // The frame's bytes go once parsed, before the command runs.
  SharedMemBuffer text;
  std::swap(text, text_);
  // Parsed first even when deleting, so that a text that is not JSON is
  // refused for that, whatever else is wrong with the request.
  const json::Value v = json::strToValue(text.view());
  if (delete_) throw wire::DecodeError("SetCfgPart deletes and carries data");
  data_ = json::Object(v);  // json::Exc unless an object
}

void SetCfgPart::writeRequest(wire::Writer& out) const {
  out.str(key_);
  out.boolean(delete_);
  wirefmt::writeJson(out, delete_ ? json::Value() : json::Value(data_));
}

void CfgIds::readRequest(wire::Reader& in) {
  prefix_ = in.str();
  in.expectEnd();
}

void CfgIds::writeRequest(wire::Writer& out) const { out.str(prefix_); }

void CfgIds::writeAnswer(wire::Writer& out) const { out.strList(resp_); }

void CfgIds::readAnswer(wire::Reader& in) {
  resp_ = in.strList();
  in.expectEnd();
}

void GetData::setRequest(std::string id, std::string fileName) {
  id_ = std::move(id);
  fileName_ = std::move(fileName);
}

void GetData::readRequest(wire::Reader& in) {
  id_ = in.str();
  fileName_ = in.str();
  in.expectEnd();
}

void GetData::writeRequest(wire::Writer& out) const {
  out.str(id_);
  out.str(fileName_);
}

void GetData::writeAnswer(wire::Writer& out) const { out.sharedBytes(resp_); }

void GetData::readAnswer(wire::Reader& in) {
  resp_ = in.sharedBytes();
  in.expectEnd();
}

void SetData::setRequest(std::string id, std::string fileName, SharedMemBuffer data) {
  id_ = std::move(id);
  fileName_ = std::move(fileName);
  data_ = std::move(data);
}

void SetData::readRequest(wire::Reader& in) {
  id_ = in.str();
  fileName_ = in.str();
  data_ = in.sharedBytes();
  in.expectEnd();
}

void SetData::writeRequest(wire::Writer& out) const {
  out.str(id_);
  out.str(fileName_);
  out.sharedBytes(data_);
}

void DBNames::writeAnswer(wire::Writer& out) const { out.strList(resp_); }

void DBNames::readAnswer(wire::Reader& in) {
  resp_ = in.strList();
  in.expectEnd();
}

}  // namespace Ipc::DB
