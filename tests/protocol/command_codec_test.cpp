// Encoding of every command: the client's request reaches the server's
// command intact, the server's answer reaches the client's command intact,
// and malformed payloads are refused without harm.

#include <gtest/gtest.h>

#include <cstring>
#include <functional>

#include "protocol/commands.h"
#include "protocol/fake_socket.h"
#include "protocol/record_wire.h"

namespace {

using namespace Ipc::DB;
using Ipc::PackInfo;
using Ipc::PackInfoPartial;
using Ipc::UseInfo;
using testing_support::splitFrame;

// The bytes of a frame, kept in a buffer that readers may share.
struct Received {
  std::uint8_t tag;
  wire::FrameKind kind;
  std::shared_ptr<unsigned char> payload;
  std::size_t size;
  wire::Reader reader() const { return wire::Reader(payload, size); }
};

Received receive(const wire::OutFrame& frame) {
  const auto f = splitFrame(frame.head + std::string(frame.tail.view()));
  std::shared_ptr<unsigned char> owner(ExportedUCharAlloc::alloc(f.payload.size() + 1), ExportedUCharAlloc());
  std::memcpy(owner.get(), f.payload.data(), f.payload.size());
  return {f.tag, f.kind, owner, f.payload.size()};
}

// Client request -> server command of the same class.
template <class C>
std::shared_ptr<C> toServer(const C& client) {
  const Received r = receive(client.requestFrame());
  EXPECT_EQ(r.tag, C::kTag);
  EXPECT_EQ(r.kind, wire::FrameKind::Request);
  auto server = std::make_shared<C>();
  wire::Reader in = r.reader();
  server->readRequest(in);
  return server;
}

// Server answer -> the client's command.
template <class C>
void toClient(const C& server, C& client) {
  const Received r = receive(server.answerFrame());
  EXPECT_EQ(r.tag, C::kTag);
  EXPECT_EQ(r.kind, wire::FrameKind::Answer);
  wire::Reader in = r.reader();
  client.readAnswer(in);
}

PackInfo fullRecord(const std::string& id) {
  PackInfoPartial p;
  p.name = "Name \xc3\xa9";
  p.owner = "";
  p.created = -1;
  p.modified = INT64_MAX;
  p.docCount = -7;
  p.uses.append(UseInfo(UseInfo::LockForUpload, "host", "user", 4000000000u, 1700000000));
  p.uses.append(UseInfo(static_cast<UseInfo::State>(55), "", "", 0));
  return PackInfo(id, std::string("f\0x", 3), INT32_MAX, p);
}

TEST(CommandCodec, ConnectAndItsTwoAnswers) {
  Connect c;
  c.setRequest("Main\\Sub", 0xFFFFFFFFu);
  auto s = toServer(c);
  EXPECT_EQ(s->dbName(), "Main\\Sub");
  EXPECT_EQ(s->openMode(), 0xFFFFFFFFu);

  s->setResp("Database Foo does not exist");
  toClient(*s, c);
  EXPECT_TRUE(c.respFailed());
  EXPECT_EQ(c.respError(), "Database Foo does not exist");

  s->setResp();
  toClient(*s, c);
  EXPECT_FALSE(c.respFailed());
  EXPECT_EQ(c.respError(), "");

  s->setResp("");  // a failure with an empty text is still a failure
  toClient(*s, c);
  EXPECT_TRUE(c.respFailed());
}

TEST(CommandCodec, ConfigurationParts) {
  GetCfgPart g;
  g.setRequest("layout");
  auto gs = toServer(g);
  EXPECT_EQ(gs->key(), "layout");
  toClient(*gs, g);
  EXPECT_TRUE(g.respCfg().empty());  // no part is not an empty object
  gs->setResp(json::Object());
  toClient(*gs, g);
  ASSERT_TRUE(g.respCfg().isObject());
  EXPECT_EQ(json::Object(g.respCfg()).size(), 0u);
  const json::Object obj = json::strToObject(R"({"a": [1, "x\u0000y", {"b": null}], "c": 1.5})");
  gs->setResp(obj);
  toClient(*gs, g);
  EXPECT_EQ(g.respCfg(), obj);

  SetCfgPart set;
  set.setRequest("layout", obj);
  auto ss = toServer(set);
  EXPECT_EQ(ss->key(), "layout");
  EXPECT_FALSE(ss->deleteData());
  EXPECT_EQ(ss->jCfgData(), obj);
  set.setDeleteRequest("old");
  ss = toServer(set);
  EXPECT_EQ(ss->key(), "old");
  EXPECT_TRUE(ss->deleteData());
  EXPECT_EQ(ss->jCfgData().size(), 0u);

  CfgIds ids;
  ids.setRequest("ab");
  auto is = toServer(ids);
  EXPECT_EQ(is->prefix(), "ab");
  is->setResp({"ab", "", "abc"});
  toClient(*is, ids);
  EXPECT_EQ(ids.respList(), (std::vector<std::string>{"ab", "", "abc"}));

  DBNames names;
  auto ns = toServer(names);
  ns->setResp({"root.db", "a\\b"});
  toClient(*ns, names);
  EXPECT_EQ(names.respList(), (std::vector<std::string>{"root.db", "a\\b"}));
}

TEST(CommandCodec, DataFilesTravelWithoutCopies) {
  const std::size_t size = 4 << 20;
  MemBuffer bytes(size);
  for (std::size_t i = 0; i < size; ++i) bytes.data()[i] = static_cast<unsigned char>(i * 7);
  const SharedMemBuffer content(MemBuffer::copyOf(bytes.data(), size));

  SetData put;
  put.setRequest("doc-1", "page 1.tif", content);
  const wire::OutFrame frame = put.requestFrame();
  EXPECT_EQ(frame.tail.data(), content.data());  // the request frame shares the content
  const Received r = receive(frame);
  SetData server;
  wire::Reader in = r.reader();
  server.readRequest(in);
  EXPECT_EQ(server.id(), "doc-1");
  EXPECT_EQ(server.fileName(), "page 1.tif");
  ASSERT_EQ(server.data().size(), size);
  EXPECT_EQ(server.data().view(), content.view());
  // The server's data points into the received frame.
  EXPECT_GE(server.data().data(), r.payload.get());
  EXPECT_LT(server.data().data(), r.payload.get() + r.size);

  GetData get;
  get.setRequest("doc-1", "page 1.tif");
  auto gs = toServer(get);
  EXPECT_EQ(gs->id(), "doc-1");
  EXPECT_EQ(gs->fileName(), "page 1.tif");
  toClient(*gs, get);
  EXPECT_TRUE(get.respData().empty());  // a missing file
  const unsigned char* raw = bytes.data();
  gs->setResp(std::move(bytes));
  EXPECT_EQ(gs->answerFrame().tail.data(), raw);  // handed over, not copied
  toClient(*gs, get);
  EXPECT_EQ(get.respData().view(), content.view());
}

TEST(CommandCodec, PackRecordsWithEveryFieldPresentOrAbsent) {
  UpdatePackInfo up;
  const PackInfo full = fullRecord("P-1");
  up.setRequest(full);
  auto us = toServer(up);
  EXPECT_EQ(*us->pInf(), full);
  EXPECT_TRUE(us->pInf()->allValid());

  const PackInfo bare("P-2");  // only the id
  up.setRequest(bare);
  us = toServer(up);
  EXPECT_EQ(*us->pInf(), bare);
  EXPECT_FALSE(us->pInf()->folderValid());
  EXPECT_FALSE(us->pInf()->statusValid());
  EXPECT_EQ(us->pInf()->name, PackInfoPartial::STR_INVALID);

  toClient(*us, up);
  EXPECT_EQ(up.respInfo(), nullptr);
  us->setResp(std::make_shared<PackInfo>(full));
  toClient(*us, up);
  ASSERT_NE(up.respInfo(), nullptr);
  EXPECT_EQ(*up.respInfo(), full);

  GetPackInfo one;
  one.setRequest("P-1");
  auto os = toServer(one);
  EXPECT_EQ(os->id(), "P-1");
  toClient(*os, one);
  EXPECT_EQ(one.respInfo(), nullptr);
  os->setResp(std::make_shared<PackInfo>(bare));
  toClient(*os, one);
  ASSERT_NE(one.respInfo(), nullptr);
  EXPECT_EQ(*one.respInfo(), bare);

  GetPackInfos list;
  list.setRequest("2024");
  auto ls = toServer(list);
  EXPECT_EQ(ls->folder(), "2024");
  toClient(*ls, list);  // no list set: answered as an empty one
  ASSERT_NE(list.respInfos(), nullptr);
  EXPECT_TRUE(list.respInfos()->empty());
  ls->setResp(std::make_shared<Ipc::PackInfos>(Ipc::PackInfos{full, bare, fullRecord("P-3")}));
  toClient(*ls, list);
  ASSERT_EQ(list.respInfos()->size(), 3u);
  EXPECT_EQ((*list.respInfos())[0], full);
  EXPECT_EQ((*list.respInfos())[1], bare);
}

TEST(CommandCodec, SaveAndFetchPacks) {
  const SharedMemBuffer content(MemBuffer::copyOf("pack content"));
  SavePack save;
  save.setRequest(fullRecord("P-1"), content);
  EXPECT_EQ(save.requestFrame().tail.data(), content.data());
  auto ss = toServer(save);
  EXPECT_EQ(ss->inf(), fullRecord("P-1"));
  EXPECT_EQ(ss->packData().view(), "pack content");
  save.setRequest(PackInfo("P-2"), SharedMemBuffer());
  ss = toServer(save);
  EXPECT_TRUE(ss->packData().empty());

  GetPack get;
  PackInfo request("P-1");
  request.uses.append(UseInfo(UseInfo::OpenForEdit, "ws-1", "anna", 321));
  get.setRequest(request);
  auto gs = toServer(get);
  EXPECT_EQ(gs->inf(), request);
  toClient(*gs, get);
  EXPECT_EQ(get.respInfo(), nullptr);
  EXPECT_TRUE(get.respData().empty());
  gs->setResp(std::make_shared<PackInfo>(fullRecord("P-1")), content);
  EXPECT_EQ(gs->answerFrame().tail.data(), content.data());
  toClient(*gs, get);
  ASSERT_NE(get.respInfo(), nullptr);
  EXPECT_EQ(*get.respInfo(), fullRecord("P-1"));
  EXPECT_EQ(get.respData().view(), "pack content");
  gs->setResp(std::make_shared<PackInfo>(fullRecord("P-1")), SharedMemBuffer());
  toClient(*gs, get);
  EXPECT_NE(get.respInfo(), nullptr);
  EXPECT_TRUE(get.respData().empty());

  ChangeDocId change;
  change.setRequest("old", "new");
  auto cs = toServer(change);
  EXPECT_EQ(cs->oldId(), "old");
  EXPECT_EQ(cs->newId(), "new");

  ErasePack erase;
  erase.setRequest("P-9");
  EXPECT_EQ(toServer(erase)->id(), "P-9");
}

TEST(CommandCodec, MaintenanceRequests) {
  Backup b;
  b.setRequest("/srv/backups/", true);
  auto bs = toServer(b);
  EXPECT_EQ(bs->pth(), "/srv/backups/");
  EXPECT_TRUE(bs->all());
  EXPECT_TRUE(bs->streamsProgress());

  Restore r;
  r.setRequest("", false);
  auto rs = toServer(r);
  EXPECT_EQ(rs->pth(), "");
  EXPECT_FALSE(rs->all());

  Cleanup c;
  c.setRequest({"b", "a", ""});
  EXPECT_EQ(toServer(c)->usedIds(), (std::set<std::string>{"", "a", "b"}));
}

// Requests of every command as a client would send them.
std::vector<std::shared_ptr<Ipc::CmdI>> sampleRequests() {
  std::vector<std::shared_ptr<Ipc::CmdI>> out;
  out.push_back(std::make_shared<Ipc::PingPong>());
  auto connect = std::make_shared<Connect>();
  connect->setRequest("db", 1);
  out.push_back(connect);
  auto getCfg = std::make_shared<GetCfgPart>();
  getCfg->setRequest("k");
  out.push_back(getCfg);
  auto setCfg = std::make_shared<SetCfgPart>();
  setCfg->setRequest("k", json::strToObject(R"({"a":[1,2]})"));
  out.push_back(setCfg);
  auto delCfg = std::make_shared<SetCfgPart>();
  delCfg->setDeleteRequest("k");
  out.push_back(delCfg);
  auto ids = std::make_shared<CfgIds>();
  ids->setRequest("p");
  out.push_back(ids);
  auto getData = std::make_shared<GetData>();
  getData->setRequest("i", "f");
  out.push_back(getData);
  auto setData = std::make_shared<SetData>();
  setData->setRequest("i", "f", SharedMemBuffer(MemBuffer::copyOf("abc")));
  out.push_back(setData);
  auto infos = std::make_shared<GetPackInfos>();
  infos->setRequest("f");
  out.push_back(infos);
  auto info = std::make_shared<GetPackInfo>();
  info->setRequest("p");
  out.push_back(info);
  auto update = std::make_shared<UpdatePackInfo>();
  update->setRequest(fullRecord("p"));
  out.push_back(update);
  auto save = std::make_shared<SavePack>();
  save->setRequest(fullRecord("p"), SharedMemBuffer(MemBuffer::copyOf("xy")));
  out.push_back(save);
  auto change = std::make_shared<ChangeDocId>();
  change->setRequest("a", "b");
  out.push_back(change);
  auto getPack = std::make_shared<GetPack>();
  getPack->setRequest(fullRecord("p"));
  out.push_back(getPack);
  auto erase = std::make_shared<ErasePack>();
  erase->setRequest("p");
  out.push_back(erase);
  auto backup = std::make_shared<Backup>();
  backup->setRequest("t", true);
  out.push_back(backup);
  auto restore = std::make_shared<Restore>();
  restore->setRequest("t", false);
  out.push_back(restore);
  auto cleanup = std::make_shared<Cleanup>();
  cleanup->setRequest({"x", "y"});
  out.push_back(cleanup);
  out.push_back(std::make_shared<DBNames>());
  return out;
}

bool refused(Ipc::CmdI& cmd, const std::string& payload, bool request) {
  try {
    wire::Reader in(payload);
    if (request) {
      cmd.readRequest(in);
    } else {
      cmd.readAnswer(in);
    }
    return false;
  } catch (const wire::DecodeError&) {
    return true;
  } catch (const json::Exc&) {
    return true;
  }
}

TEST(CommandCodec, EveryTruncatedOrExtendedRequestIsRefused) {
  std::set<std::uint8_t> covered;
  for (const auto& sample : sampleRequests()) {
    covered.insert(sample->tag());
    const std::string payload = splitFrame(sample->requestFrame().head + std::string(sample->requestFrame().tail.view())).payload;
    auto fresh = makeCommand(sample->tag(), nullptr);
    ASSERT_NE(fresh, nullptr);
    for (std::size_t cut = 0; cut < payload.size(); ++cut) {
      EXPECT_TRUE(refused(*fresh, payload.substr(0, cut), true)) << sample->name() << " cut at " << cut;
    }
    EXPECT_TRUE(refused(*fresh, payload + '\0', true)) << sample->name() << " with a trailing byte";
    EXPECT_FALSE(refused(*fresh, payload, true)) << sample->name();
  }
  EXPECT_EQ(covered.size(), kCommandTable.size());
}

TEST(CommandCodec, EveryTruncatedAnswerIsRefused) {
  // Answers with content in every field.
  auto connect = std::make_shared<Connect>();
  connect->setResp("no");
  auto getCfg = std::make_shared<GetCfgPart>();
  getCfg->setResp(json::strToObject(R"({"a":1})"));
  auto ids = std::make_shared<CfgIds>();
  ids->setResp({"a", "bc"});
  auto getData = std::make_shared<GetData>();
  getData->setResp(MemBuffer::copyOf("data"));
  auto infos = std::make_shared<GetPackInfos>();
  infos->setResp(std::make_shared<Ipc::PackInfos>(Ipc::PackInfos{fullRecord("a"), PackInfo("b")}));
  auto info = std::make_shared<GetPackInfo>();
  info->setResp(std::make_shared<PackInfo>(fullRecord("a")));
  auto getPack = std::make_shared<GetPack>();
  getPack->setResp(std::make_shared<PackInfo>(fullRecord("a")), SharedMemBuffer(MemBuffer::copyOf("c")));
  auto names = std::make_shared<DBNames>();
  names->setResp({"x"});
  for (const std::shared_ptr<Ipc::CmdI>& answer :
       std::vector<std::shared_ptr<Ipc::CmdI>>{connect, getCfg, ids, getData, infos, info, getPack, names}) {
    const wire::OutFrame f = answer->answerFrame();
    const std::string payload = splitFrame(f.head + std::string(f.tail.view())).payload;
    auto fresh = makeCommand(answer->tag(), nullptr);
    for (std::size_t cut = 0; cut < payload.size(); ++cut) {
      EXPECT_TRUE(refused(*fresh, payload.substr(0, cut), false)) << answer->name() << " cut at " << cut;
    }
    EXPECT_TRUE(refused(*fresh, payload + '\x01', false)) << answer->name();
    EXPECT_FALSE(refused(*fresh, payload, false)) << answer->name();
  }
}

std::string bytesOf(const std::function<void(wire::Writer&)>& write) {
  std::string s;
  wire::Writer w(s);
  write(w);
  return s;
}

TEST(CommandCodec, MalformedFieldsAreRefused) {
  SetCfgPart set;
  // Deleting with data, storing without data, data that is not an object,
  // data that is not JSON.
  const auto cfg = [](bool del, int present, const std::string& text) {
    return bytesOf([&](wire::Writer& w) {
      w.str("k");
      w.boolean(del);
      w.u8(static_cast<std::uint8_t>(present));
      if (present) w.str(text);
    });
  };
  EXPECT_TRUE(refused(set, cfg(true, 1, "{}"), true));
  EXPECT_TRUE(refused(set, cfg(false, 0, ""), true));
  EXPECT_TRUE(refused(set, cfg(false, 1, "[1]"), true));
  EXPECT_TRUE(refused(set, cfg(false, 1, "{\"a\":"), true));
  EXPECT_TRUE(refused(set, cfg(false, 2, "{}"), true));  // presence byte other than 0/1
  EXPECT_FALSE(refused(set, cfg(false, 1, "{}"), true));

  // Pack records: unknown presence bits, the absent markers sent as present
  // values, and a use count the message cannot hold.
  const auto pack = [](std::uint8_t bits, const std::function<void(wire::Writer&)>& fields, std::uint32_t uses) {
    return bytesOf([&](wire::Writer& w) {
      w.str("id");
      w.u8(bits);
      fields(w);
      w.u32(uses);
    });
  };
  UpdatePackInfo up;
  EXPECT_FALSE(refused(up, pack(0, [](wire::Writer&) {}, 0), true));
  EXPECT_TRUE(refused(up, pack(0x80, [](wire::Writer&) {}, 0), true));
  EXPECT_TRUE(refused(up, pack(Ipc::wirefmt::kFolder, [](wire::Writer& w) { w.str(PackInfoPartial::STR_INVALID); }, 0), true));
  EXPECT_TRUE(refused(up, pack(Ipc::wirefmt::kStatus, [](wire::Writer& w) { w.i32(PackInfoPartial::LONG_INVALID); }, 0), true));
  EXPECT_TRUE(refused(up, pack(Ipc::wirefmt::kCreated, [](wire::Writer& w) { w.i64(PackInfoPartial::TIME_INVALID); }, 0), true));
  EXPECT_TRUE(refused(up, pack(0, [](wire::Writer&) {}, 0xFFFFFFFFu), true));

  // Lists whose count the message cannot hold are refused before anything
  // is reserved.
  Cleanup cleanup;
  EXPECT_TRUE(refused(cleanup, bytesOf([](wire::Writer& w) { w.u32(0x40000000u); }), true));
  GetPackInfos infos;
  EXPECT_TRUE(refused(infos, bytesOf([](wire::Writer& w) { w.u32(0xFFFFFFFFu); }), false));
  // A byte string that claims more than the message holds.
  SetData data;
  EXPECT_TRUE(refused(data, bytesOf([](wire::Writer& w) {
                        w.str("i");
                        w.str("f");
                        w.u64(~0ULL);
                      }),
                      true));
}

}  // namespace
