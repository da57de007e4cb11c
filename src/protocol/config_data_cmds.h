#pragma once
// Commands that bind a connection to a database and read and write its
// configuration parts and data files, and the database list.

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "framework/buffers.h"
#include "framework/json.h"
#include "protocol/db_cmd.h"

namespace Ipc::DB {

// Tag 3: binds the connection to a database.
class Connect final : public DbCmd<Connect> {
 public:
  using DbCmd::DbCmd;

  const std::string& dbName() const noexcept { return dbName_; }
  // 0: open, creating if missing; 1: open an existing one only; other
  // values: select the database without opening it.
  std::uint32_t openMode() const noexcept { return openMode_; }
  void setRequest(std::string dbName, std::uint32_t openMode);

  // Success, or failure with the server's text.
  void setResp() {
    failed_ = false;
    error_.clear();
  }
  void setResp(std::string error) {
    failed_ = true;
    error_ = std::move(error);
  }
  bool respFailed() const noexcept { return failed_; }
  const std::string& respError() const noexcept { return error_; }

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override;

 private:
  std::string dbName_;
  std::uint32_t openMode_ = 0;
  bool failed_ = false;
  std::string error_;
};

// Tag 4: reads one configuration part.
class GetCfgPart final : public DbCmd<GetCfgPart> {
 public:
  using DbCmd::DbCmd;

  const std::string& key() const noexcept { return key_; }
  void setRequest(std::string key) { key_ = std::move(key); }

  // The stored object, or an empty value when there is none.
  void setResp(json::Value v) {
    resp_ = std::move(v);
    text_.reset();
  }
  // The server's answer as the object's compact text, shared with the
  // store's read cache: written as it is, with no parse or dump on the
  // way ("" when there is no part).
  void setResp(std::shared_ptr<const std::string> text) {
    resp_ = json::Value();
    text_ = std::move(text);
  }
  // The client's answer (readAnswer), or what setResp(json::Value) set.
  const json::Value& respCfg() const noexcept { return resp_; }

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override;

 private:
  std::string key_;
  json::Value resp_;
  std::shared_ptr<const std::string> text_;
};

// Tag 5: writes or deletes one configuration part.
//
// On the server, readRequest checks the fields' framing and keeps the JSON
// text's bytes, shared with the request frame; finishRequest parses them.
// A part runs to hundreds of megabytes, and its parse (with the UTF-8
// check) then takes seconds, which belong on the command's thread and not
// on the I/O thread that cut the frame.
class SetCfgPart final : public DbCmd<SetCfgPart> {
 public:
  using DbCmd::DbCmd;

  const std::string& key() const noexcept { return key_; }
  bool deleteData() const noexcept { return delete_; }
  // The object to store; an empty object when deleteData(). On the server,
  // set by finishRequest.
  const json::Object& jCfgData() const noexcept { return data_; }
  void setRequest(std::string key, json::Object data);
  void setDeleteRequest(std::string key);

  void setResp() {}

  void readRequest(wire::Reader& in) override;
  void finishRequest() override;
  void writeAnswer(wire::Writer&) const override {}
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override { in.expectEnd(); }

 private:
  std::string key_;
  bool delete_ = false;
  json::Object data_;
  // Between readRequest and finishRequest: the request carries a JSON text,
  // and its bytes (released once parsed).
  bool textPending_ = false;
  SharedMemBuffer text_;
};

// Tag 6: lists the configuration keys that begin with a prefix.
class CfgIds final : public DbCmd<CfgIds> {
 public:
  using DbCmd::DbCmd;

  const std::string& prefix() const noexcept { return prefix_; }
  void setRequest(std::string prefix) { prefix_ = std::move(prefix); }

  void setResp(std::vector<std::string> keys) { resp_ = std::move(keys); }
  const std::vector<std::string>& respList() const noexcept { return resp_; }

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override;

 private:
  std::string prefix_;
  std::vector<std::string> resp_;
};

// Tag 7: reads one data file.
class GetData final : public DbCmd<GetData> {
 public:
  using DbCmd::DbCmd;

  const std::string& id() const noexcept { return id_; }
  const std::string& fileName() const noexcept { return fileName_; }
  void setRequest(std::string id, std::string fileName);

  // The file's bytes (empty for a missing file); they travel to the wire
  // without another copy.
  void setResp(MemBuffer&& content) { resp_ = SharedMemBuffer(std::move(content)); }
  const SharedMemBuffer& respData() const noexcept { return resp_; }

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override;

 private:
  std::string id_;
  std::string fileName_;
  SharedMemBuffer resp_;
};

// Tag 8: writes one data file.
class SetData final : public DbCmd<SetData> {
 public:
  using DbCmd::DbCmd;

  const std::string& id() const noexcept { return id_; }
  const std::string& fileName() const noexcept { return fileName_; }
  // The file content as received (shares the request frame's bytes).
  const SharedMemBuffer& data() const noexcept { return data_; }
  void setRequest(std::string id, std::string fileName, SharedMemBuffer data);

  void readRequest(wire::Reader& in) override;
  void writeAnswer(wire::Writer&) const override {}
  void writeRequest(wire::Writer& out) const override;
  void readAnswer(wire::Reader& in) override { in.expectEnd(); }

 private:
  std::string id_;
  std::string fileName_;
  SharedMemBuffer data_;
};

// Tag 19: lists the databases below the database root.
class DBNames final : public DbCmd<DBNames> {
 public:
  using DbCmd::DbCmd;

  void setResp(std::vector<std::string> names) { resp_ = std::move(names); }
  const std::vector<std::string>& respList() const noexcept { return resp_; }

  void readRequest(wire::Reader& in) override { in.expectEnd(); }
  void writeAnswer(wire::Writer& out) const override;
  void writeRequest(wire::Writer&) const override {}
  void readAnswer(wire::Reader& in) override;

 private:
  std::vector<std::string> resp_;
};

}  // namespace Ipc::DB
