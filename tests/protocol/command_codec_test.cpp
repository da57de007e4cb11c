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
  server->finishRequest();
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

TEST(CommandCodec, AnswersWhoseAbsenceMeansSomething) {
  Connect c;
  c.setRequest("Main\\Sub", 0xFFFFFFFFu);
  auto s = toServer(c);
  EXPECT_EQ(s->dbName(), "Main\\Sub");
  EXPECT_EQ(s->openMode(), 0xFFFFFFFFu);
  s->setResp();
  toClient(*s, c);
  EXPECT_FALSE(c.respFailed());
  s->setResp("");  // a failure with an empty text is still a failure
  toClient(*s, c);
  EXPECT_TRUE(c.respFailed());

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

  SetCfgPart set;
  set.setDeleteRequest("old");
  auto ss = toServer(set);
  EXPECT_EQ(ss->key(), "old");
  EXPECT_TRUE(ss->deleteData());

  UpdatePackInfo up;
  const PackInfo bare("P-2");  // only the id
  up.setRequest(bare);
  auto us = toServer(up);
  EXPECT_EQ(*us->pInf(), bare);
  EXPECT_FALSE(us->pInf()->folderValid());
  EXPECT_FALSE(us->pInf()->statusValid());
  EXPECT_EQ(us->pInf()->name, PackInfoPartial::STR_INVALID);
  toClient(*us, up);
  EXPECT_EQ(up.respInfo(), nullptr);

  GetPackInfo one;
  one.setRequest("P-1");
  toClient(*toServer(one), one);
  EXPECT_EQ(one.respInfo(), nullptr);

  GetPackInfos list;
  list.setRequest("2024");
  toClient(*toServer(list), list);  // no list set: answered as an empty one
  ASSERT_NE(list.respInfos(), nullptr);
  EXPECT_TRUE(list.respInfos()->empty());

  GetPack get;
  get.setRequest(PackInfo("P-1"));
  auto ps = toServer(get);
  toClient(*ps, get);
  EXPECT_EQ(get.respInfo(), nullptr);
  EXPECT_TRUE(get.respData().empty());
  ps->setResp(std::make_shared<PackInfo>(fullRecord("P-1")), SharedMemBuffer());
  toClient(*ps, get);
  EXPECT_NE(get.respInfo(), nullptr);
  EXPECT_TRUE(get.respData().empty());

  Backup backup;
  backup.setRequest("/srv/backups/", true);
  EXPECT_TRUE(toServer(backup)->streamsProgress());
  Cleanup cleanup;
  cleanup.setRequest({"b", "a", "", "a"});
  EXPECT_EQ(toServer(cleanup)->usedIds(), (std::set<std::string>{"", "a", "b"}));
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
  ASSERT_EQ(server.data().size(), size);
  EXPECT_EQ(server.data().view(), content.view());
  // The server's data points into the received frame.
  EXPECT_GE(server.data().data(), r.payload.get());
  EXPECT_LT(server.data().data(), r.payload.get() + r.size);

  GetData get;
  get.setRequest("doc-1", "page 1.tif");
  auto gs = toServer(get);
  toClient(*gs, get);
  EXPECT_TRUE(get.respData().empty());  // a missing file
  const unsigned char* raw = bytes.data();
  gs->setResp(std::move(bytes));
  EXPECT_EQ(gs->answerFrame().tail.data(), raw);  // handed over, not copied
  toClient(*gs, get);
  EXPECT_EQ(get.respData().view(), content.view());

  SavePack save;
  save.setRequest(fullRecord("P-1"), content);
  EXPECT_EQ(save.requestFrame().tail.data(), content.data());
  GetPack pack;
  pack.setRequest(PackInfo("P-1"));
  auto ps = toServer(pack);
  ps->setResp(std::make_shared<PackInfo>(fullRecord("P-1")), content);
  EXPECT_EQ(ps->answerFrame().tail.data(), content.data());
}

// A command of class C, set up by the function.
template <class C, class F>
std::shared_ptr<Ipc::CmdI> made(F setUp) {
  auto c = std::make_shared<C>();
  setUp(*c);
  return c;
}

const char* const kCfgText = R"({"a": [1, "x\u0000y", {"b": null}], "c": 1.5})";

// Requests of every command as a client would send them.
std::vector<std::shared_ptr<Ipc::CmdI>> sampleRequests() {
  const auto none = [](auto&) {};
  return {
      made<Ipc::PingPong>(none),
      made<Connect>([](Connect& c) { c.setRequest("Main\\Sub", 0xFFFFFFFFu); }),
      made<GetCfgPart>([](GetCfgPart& c) { c.setRequest("k"); }),
      made<SetCfgPart>([](SetCfgPart& c) { c.setRequest("k", json::strToObject(kCfgText)); }),
      made<SetCfgPart>([](SetCfgPart& c) { c.setDeleteRequest("k"); }),
      made<CfgIds>([](CfgIds& c) { c.setRequest("p"); }),
      made<GetData>([](GetData& c) { c.setRequest("i", "f"); }),
      made<SetData>([](SetData& c) { c.setRequest("i", "f", SharedMemBuffer(MemBuffer::copyOf("abc"))); }),
      made<GetPackInfos>([](GetPackInfos& c) { c.setRequest("f"); }),
      made<GetPackInfo>([](GetPackInfo& c) { c.setRequest("p"); }),
      made<UpdatePackInfo>([](UpdatePackInfo& c) { c.setRequest(fullRecord("p")); }),
      made<SavePack>([](SavePack& c) { c.setRequest(fullRecord("p"), SharedMemBuffer(MemBuffer::copyOf("xy"))); }),
      made<ChangeDocId>([](ChangeDocId& c) { c.setRequest("a", "b"); }),
      made<GetPack>([](GetPack& c) { c.setRequest(fullRecord("p")); }),
      made<ErasePack>([](ErasePack& c) { c.setRequest("p"); }),
      made<Backup>([](Backup& c) { c.setRequest("t", true); }),
      made<Restore>([](Restore& c) { c.setRequest("t", false); }),
      made<Cleanup>([](Cleanup& c) {
        c.setRequest({"x", "", "y"});
      }),
      made<DBNames>(none),
  };
}

bool refused(Ipc::CmdI& cmd, const std::string& payload, bool request) {
  try {
    wire::Reader in(payload);
    if (request) {
      cmd.readRequest(in);
      cmd.finishRequest();
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

std::string payloadOf(const wire::OutFrame& f) { return splitFrame(f.head + std::string(f.tail.view())).payload; }

// Every request and answer read back whole writes the same bytes again, so
// no field is lost, swapped or altered on the way; cut short or extended by
// a byte, it is refused.
TEST(CommandCodec, EveryRequestRoundTripsAndEveryTruncatedOrExtendedOneIsRefused) {
  std::set<std::uint8_t> covered;
  for (const auto& sample : sampleRequests()) {
    covered.insert(sample->tag());
    const std::string payload = payloadOf(sample->requestFrame());
    auto fresh = makeCommand(sample->tag(), nullptr);
    ASSERT_NE(fresh, nullptr);
    for (std::size_t cut = 0; cut < payload.size(); ++cut) {
      EXPECT_TRUE(refused(*fresh, payload.substr(0, cut), true)) << sample->name() << " cut at " << cut;
    }
    EXPECT_TRUE(refused(*fresh, payload + '\0', true)) << sample->name() << " with a trailing byte";
    EXPECT_FALSE(refused(*fresh, payload, true)) << sample->name();
    EXPECT_EQ(payloadOf(fresh->requestFrame()), payload) << sample->name();
  }
  EXPECT_EQ(covered.size(), kCommandTable.size());
}

TEST(CommandCodec, EveryAnswerRoundTripsAndEveryTruncatedOrExtendedOneIsRefused) {
  // Answers with content in every field.
  const auto info = [] { return std::make_shared<PackInfo>(fullRecord("a")); };
  for (const std::shared_ptr<Ipc::CmdI>& answer : std::vector<std::shared_ptr<Ipc::CmdI>>{
           made<Connect>([](Connect& c) { c.setResp("no"); }),
           made<GetCfgPart>([](GetCfgPart& c) { c.setResp(json::strToObject(kCfgText)); }), made<CfgIds>([](CfgIds& c) {
             c.setResp({"ab", "", "abc"});
           }),
           made<GetData>([](GetData& c) { c.setResp(MemBuffer::copyOf("data")); }),
           made<GetPackInfos>([](GetPackInfos& c) {
             c.setResp(std::make_shared<Ipc::PackInfos>(Ipc::PackInfos{fullRecord("a"), PackInfo("b")}));
           }),
           made<GetPackInfo>([&](GetPackInfo& c) { c.setResp(info()); }),
           made<GetPack>([&](GetPack& c) { c.setResp(info(), SharedMemBuffer(MemBuffer::copyOf("c"))); }),
           made<DBNames>([](DBNames& c) {
             c.setResp({"root.db", "a\\b"});
           })}) {
    const std::string payload = payloadOf(answer->answerFrame());
    auto fresh = makeCommand(answer->tag(), nullptr);
    for (std::size_t cut = 0; cut < payload.size(); ++cut) {
      EXPECT_TRUE(refused(*fresh, payload.substr(0, cut), false)) << answer->name() << " cut at " << cut;
    }
    EXPECT_TRUE(refused(*fresh, payload + '\x01', false)) << answer->name();
    EXPECT_FALSE(refused(*fresh, payload, false)) << answer->name();
    EXPECT_EQ(payloadOf(fresh->answerFrame()), payload) << answer->name();
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
  EXPECT_FALSE(refused(up,
                       pack(
                           0, [](wire::Writer&) {}, 0),
                       true));
  EXPECT_TRUE(refused(up,
                      pack(
                          0x80, [](wire::Writer&) {}, 0),
                      true));
  EXPECT_TRUE(refused(up,
                      pack(
                          Ipc::wirefmt::kFolder, [](wire::Writer& w) { w.str(PackInfoPartial::STR_INVALID); }, 0),
                      true));
  EXPECT_TRUE(refused(up,
                      pack(
                          Ipc::wirefmt::kStatus, [](wire::Writer& w) { w.i32(PackInfoPartial::LONG_INVALID); }, 0),
                      true));
  EXPECT_TRUE(refused(up,
                      pack(
                          Ipc::wirefmt::kCreated, [](wire::Writer& w) { w.i64(PackInfoPartial::TIME_INVALID); }, 0),
                      true));
  EXPECT_TRUE(refused(up,
                      pack(
                          0, [](wire::Writer&) {}, 0xFFFFFFFFu),
                      true));
  // Texts kept inside the stored JSON record must be UTF-8; the refusal
  // names the field.
  try {
    const std::string latin1 = pack(
        Ipc::wirefmt::kName, [](wire::Writer& w) { w.str("caf\xE9"); }, 0);
    wire::Reader in(latin1);
    up.readRequest(in);
    ADD_FAILURE() << "a name in Latin-1 was accepted";
  } catch (const wire::DecodeError& e) {
    EXPECT_STREQ(e.what(), "pack name is not valid UTF-8");
  }
  EXPECT_FALSE(refused(up,
                       pack(
                           Ipc::wirefmt::kName, [](wire::Writer& w) { w.str("caf\xC3\xA9 \xF0\x9F\x93\xA6"); }, 0),
                       true));
  EXPECT_TRUE(refused(up, bytesOf([](wire::Writer& w) {
                        w.str("id");
                        w.u8(0);
                        w.u32(1);
                        w.i32(1);
                        w.str("host\xFF");
                        w.str("user");
                        w.u32(1);
                        w.i64(0);
                      }),
                      true));

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

// SetCfgPart on the server: readRequest checks the framing and keeps the
// JSON text, shared with the frame; finishRequest parses it and lets the
// frame go. Each refusal comes from the step that can see it, with the
// same text as when the whole request was read at once.
TEST(CommandCodec, SetCfgPartLeavesItsJsonTextToFinishRequest) {
  struct Case {
    bool del;
    int present;
    std::string text;
    std::string trailing;
    const char* refusedBy;  // "read", "finish" or nothing
    std::string why;
  };
  const std::string big = "{\"a\":\"" + std::string(200000, 'x') + "\"}";
  const std::vector<Case> cases{
      {false, 1, big, "", nullptr, ""},
      {true, 0, "", "", nullptr, ""},
      {false, 1, "{\"a\":", "", "finish", "JSON error: unexpected token near end of file at line 1, column 5"},
      {false, 1, "[1]", "", "finish", "JSON error: Wrong type: array. Expected type: object"},
      {false, 1, "\"x\"", "", "finish", "JSON error: Wrong type: string. Expected type: object"},
      {false, 1, "", "", "finish", "JSON error: unexpected token near end of file at line 1, column 0"},
      {false, 1, "{\"a\":\"caf\xE9\"}", "", "finish",
       "JSON error: unable to decode byte 0xe9 near '\"caf' at line 1, column 9"},
      {true, 1, "{}", "", "finish", "SetCfgPart deletes and carries data"},
      // Deleting with a text that is not JSON: the text is what is wrong.
      {true, 1, "{", "", "finish", "JSON error: string or '}' expected near end of file at line 1, column 1"},
      {false, 0, "", "", "read", "SetCfgPart carries no data"},
      {false, 2, "{}", "", "read", "boolean field holds 2"},
      {false, 1, "{}", "z", "read", "1 unexpected trailing byte(s)"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.text.substr(0, 20) + (c.del ? " (delete)" : ""));
    const std::string payload = bytesOf([&](wire::Writer& w) {
                                  w.str("k");
                                  w.boolean(c.del);
                                  w.u8(static_cast<std::uint8_t>(c.present));
                                  if (c.present) w.str(c.text);
                                }) +
                                c.trailing;
    std::shared_ptr<unsigned char> frame(ExportedUCharAlloc::alloc(payload.size()), ExportedUCharAlloc());
    std::memcpy(frame.get(), payload.data(), payload.size());
    const std::weak_ptr<unsigned char> frameAlive = frame;
    SetCfgPart cmd;
    const auto step = [&](const char* name, const std::function<void()>& run) {
      try {
        run();
      } catch (const std::exception& e) {
        EXPECT_STREQ(name, c.refusedBy) << e.what();
        EXPECT_EQ(e.what(), c.why);
        return false;
      }
      return true;
    };
    if (!step("read", [&] {
          wire::Reader in(std::move(frame), payload.size());
          cmd.readRequest(in);
        })) {
      continue;
    }
    // Read, the command holds the frame's bytes (those of a text); finished,
    // it does not.
    EXPECT_EQ(frameAlive.expired(), c.text.empty());
    if (!step("finish", [&] { cmd.finishRequest(); })) continue;
    EXPECT_EQ(c.refusedBy, nullptr);
    EXPECT_TRUE(frameAlive.expired());
    EXPECT_EQ(cmd.key(), "k");
    EXPECT_EQ(cmd.deleteData(), c.del);
    EXPECT_EQ(cmd.jCfgData(), c.del ? json::Object() : json::strToObject(c.text));
  }
}

}  // namespace
