#include "load_workloads.h"

#include <algorithm>

#include "load_loop.h"
#include "protocol/commands.h"

namespace loadgen {
namespace {

using Cmds = std::vector<std::shared_ptr<Ipc::CmdI>>;

// {"v":"xxx..."}: a configuration part whose compact text is size bytes.
json::Object cfgPart(std::size_t size, char fill) {
  return json::strToObject("{\"v\":\"" + std::string(size > 8 ? size - 8 : 0, fill) + "\"}");
}

SharedMemBuffer content(std::size_t size, char fill) {
  return SharedMemBuffer(MemBuffer::copyOf(std::string(size, fill)));
}

// The stored text of a record is its two texts plus about this much.
constexpr std::size_t kRecordOverhead = 90;

template <typename C, typename... Args>
std::shared_ptr<Ipc::CmdI> cmd(Args&&... args) {
  auto c = std::make_shared<C>();
  c->setRequest(std::forward<Args>(args)...);
  return c;
}

// The packs that getpackinfos lists carry a small content: only their
// records are read, and the folder is made once per database.
constexpr std::size_t kListedContent = 100;

void fillListFolder(cvdb::Client& c, const Params& p) {
  const std::size_t have = c.packInfos(kListFolder).size();
  const SharedMemBuffer data = content(kListedContent, 'l');
  for (std::size_t i = have; i < p.folderPacks; ++i) {
    c.savePack(packRecord("list-" + std::to_string(i), kListFolder, 0, p), data);
  }
}

std::vector<std::string> packFields(const std::string& key, int variant, const Params& p) {
  const Ipc::PackInfo r = packRecord(key, kPackFolder, variant, p);
  return {"id",       r.id(),
          "folder",   r.folder(),
          "status",   std::to_string(r.status()),
          "name",     r.name,
          "owner",    r.owner,
          "created",  std::to_string(r.created),
          "modified", std::to_string(r.modified),
          "docCount", std::to_string(r.docCount)};
}

std::string hset(const std::string& hashKey, const std::vector<std::string>& fields) {
  std::vector<std::string_view> args{"HSET", hashKey};
  for (const auto& f : fields) args.emplace_back(f);
  return resp(args);
}

std::string value(std::size_t size, char fill) { return std::string(size, fill); }

}  // namespace

Ipc::PackInfo packRecord(const std::string& id, const std::string& folder, int variant, const Params& p) {
  const std::size_t text = p.recordSize > kRecordOverhead ? p.recordSize - kRecordOverhead : 0;
  Ipc::PackInfoPartial partial;
  partial.name = std::string(text * 2 / 3, variant % 2 ? 'N' : 'n');
  partial.owner = std::string(text - text * 2 / 3, variant % 2 ? 'O' : 'o');
  partial.created = 1700000000;
  partial.modified = 1700000000 + variant;
  partial.docCount = 12 + variant;
  return Ipc::PackInfo(id, folder, variant, std::move(partial));
}

const std::vector<Workload>& workloads() {
  using Ipc::DB::GetCfgPart;
  using Ipc::DB::GetData;
  using Ipc::DB::GetPack;
  using Ipc::DB::GetPackInfo;
  using Ipc::DB::GetPackInfos;
  using Ipc::DB::SavePack;
  using Ipc::DB::SetCfgPart;
  using Ipc::DB::SetData;
  static const std::vector<Workload> table = {
      {"ping",
       "keep-alive (answered by the transport)",
       false,
       0,
       {},
       {},
       [](const Params&, const std::string&) { return Cmds{std::make_shared<Ipc::PingPong>()}; }},
      {"dbs",
       "list the databases",
       false,
       0,
       {},
       {},
       [](const Params&, const std::string&) { return Cmds{std::make_shared<Ipc::DB::DBNames>()}; }},
      {"getcfg",
       "read a configuration part of --size bytes",
       true,
       100,
       {},
       [](cvdb::Client& c, const Params& p, const std::string& key) { c.setCfg(key, cfgPart(p.size, 'x')); },
       [](const Params&, const std::string& key) { return Cmds{cmd<GetCfgPart>(key)}; }},
      {"setcfg",
       "write a configuration part of --size bytes (durable)",
       true,
       100,
       {},
       {},
       [](const Params& p, const std::string& key) {
         return Cmds{cmd<SetCfgPart>(key, cfgPart(p.size, 'x')), cmd<SetCfgPart>(key, cfgPart(p.size, 'y'))};
       }},
      {"getdata",
       "read a data file of --size bytes",
       true,
       4096,
       {},
       [](cvdb::Client& c, const Params& p, const std::string& key) { c.setData(key, "file", content(p.size, 'x')); },
       [](const Params&, const std::string& key) { return Cmds{cmd<GetData>(key, std::string("file"))}; }},
      {"setdata",
       "write a data file of --size bytes (durable)",
       true,
       4096,
       {},
       {},
       [](const Params& p, const std::string& key) {
         return Cmds{cmd<SetData>(key, std::string("file"), content(p.size, 'x')),
                     cmd<SetData>(key, std::string("file"), content(p.size, 'y'))};
       }},
      {"savepack",
       "save a pack: a record of --record-size bytes and --size bytes of content (durable)",
       true,
       10240,
       {},
       {},
       [](const Params& p, const std::string& key) {
         return Cmds{cmd<SavePack>(packRecord(key, kPackFolder, 0, p), content(p.size, 'x')),
                     cmd<SavePack>(packRecord(key, kPackFolder, 1, p), content(p.size, 'y'))};
       }},
      {"getpack",
       "fetch a pack's record and content",
       true,
       10240,
       {},
       [](cvdb::Client& c, const Params& p, const std::string& key) {
         c.savePack(packRecord(key, kPackFolder, 0, p), content(p.size, 'x'));
       },
       [](const Params&, const std::string& key) { return Cmds{cmd<GetPack>(Ipc::PackInfo(key))}; }},
      {"getpackinfo",
       "read a pack's record",
       true,
       10240,
       {},
       [](cvdb::Client& c, const Params& p, const std::string& key) {
         c.savePack(packRecord(key, kPackFolder, 0, p), content(p.size, 'x'));
       },
       [](const Params&, const std::string& key) { return Cmds{cmd<GetPackInfo>(key)}; }},
      {"getpackinfos",
       "list the records of a folder of --folder-packs packs",
       true,
       0,
       fillListFolder,
       {},
       [](const Params&, const std::string&) { return Cmds{cmd<GetPackInfos>(std::string(kListFolder))}; }},
  };
  return table;
}

const std::vector<RedisWorkload>& redisWorkloads() {
  static const std::vector<RedisWorkload> table = {
      {"ping", "PING", 0, 1, {}, [](const Params&, const std::string&) { return std::vector{resp({"PING"})}; }},
      {"getcfg", "GET of a --size bytes value", 100, 1,
       [](const Params& p, const std::string& key) {
         return std::vector{resp({"SET", key, value(p.size, 'x')})};
       },
       [](const Params&, const std::string& key) {
         return std::vector{resp({"GET", key})};
       }},
      {"setcfg",
       "SET of a --size bytes value",
       100,
       1,
       {},
       [](const Params& p, const std::string& key) {
         return std::vector{resp({"SET", key, value(p.size, 'x')}), resp({"SET", key, value(p.size, 'y')})};
       }},
      {"getpackinfo", "HGETALL of a hash with a pack record's fields", 10240, 1,
       [](const Params& p, const std::string& key) { return std::vector{hset("pack:" + key, packFields(key, 0, p))}; },
       [](const Params&, const std::string& key) {
         return std::vector{resp({"HGETALL", "pack:" + key})};
       }},
      {"getpack", "HGETALL of the record's hash and GET of --size bytes of content, sent together", 10240, 2,
       [](const Params& p, const std::string& key) {
         return std::vector{hset("pack:" + key, packFields(key, 0, p)),
                            resp({"SET", "packdata:" + key, value(p.size, 'x')})};
       },
       [](const Params&, const std::string& key) {
         return std::vector{resp({"HGETALL", "pack:" + key}) + resp({"GET", "packdata:" + key})};
       }},
      {"savepack",
       "MULTI, HSET of the record's fields, SET of --size bytes of content, EXEC",
       10240,
       4,
       {},
       [](const Params& p, const std::string& key) {
         std::vector<std::string> out;
         for (int v = 0; v < 2; ++v) {
           out.push_back(resp({"MULTI"}) + hset("pack:" + key, packFields(key, v, p)) +
                         resp({"SET", "packdata:" + key, value(p.size, v ? 'y' : 'x')}) + resp({"EXEC"}));
         }
         return out;
       }},
  };
  return table;
}

}  // namespace loadgen
