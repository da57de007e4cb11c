// The subcommands of cvdb, one per server command (and a few conveniences
// on top of GetPack).

#include <jansson.h>
#include <CLI/CLI.hpp>

#include <chrono>
#include <cstdio>
#include <fstream>

#include "client/cvdb/tool.h"

namespace cvdb::tool {
namespace {

// Every value the command line can carry; bound by reference to CLI11's
// options, so it lives as long as the app.
struct Args {
  std::string key, value, file, prefix;
  std::string id, fileName, input = "-", output = "-";
  std::string folder, newId;
  std::optional<std::string> setFolder, name, owner, created, modified;
  std::optional<std::int32_t> status, docs;
  std::string content;
  bool openForEdit = false, close = false, lock = false, unlock = false;
  std::optional<std::string> useHost, useUser;
  std::uint32_t useProcess = 0;
  std::string target;
  bool all = false;
  std::vector<std::string> used;
  std::string usedFile;
  // Read by the actions' prepare step.
  json::Object part;
  SharedMemBuffer contentBytes;
  std::set<std::string> usedSet;
};

void printOk(const Globals& g, const std::string& text) {
  if (g.json) {
    std::printf("{\"ok\":true}\n");
  } else {
    std::printf("%s\n", text.c_str());
  }
}

void printList(const Globals& g, const std::vector<std::string>& list, const char* none) {
  if (g.json) {
    json::Value a = json::Value::steal(json_array());
    for (const auto& s : list) json_array_append_new(a.get(), json_stringn(s.data(), s.size()));
    std::printf("%s\n", a.dump().c_str());
    return;
  }
  for (const auto& s : list) std::printf("%s\n", s.c_str());
  if (list.empty()) std::printf("%s\n", none);
}

void printRecord(const Globals& g, const Ipc::PackInfoPtr& p, const std::string& id, std::FILE* out = stdout) {
  if (g.json) {
    std::fprintf(out, "%s\n", p ? packToJson(*p).dump().c_str() : "null");
  } else if (p) {
    printPackDetails(*p, out);
  } else {
    std::fprintf(out, "no pack \"%s\"\n", id.c_str());
  }
}

std::int64_t nowSeconds() {
  return std::chrono::duration_cast<std::chrono::seconds>(std::chrono::system_clock::now().time_since_epoch()).count();
}

std::int64_t parseTime(const std::string& text) {
  if (text == "now") return nowSeconds();
  try {
    std::size_t used = 0;
    const long long v = std::stoll(text, &used);
    if (used == text.size()) return v;
  } catch (const std::exception&) {
  }
  throw UsageError("\"" + text + "\" is not a time (seconds since 1970 or \"now\")");
}

std::string currentUser() {
  const char* user = std::getenv("USER");
  return user ? user : "";
}

// The optional record fields shared by pack update and pack save.
void addRecordOptions(CLI::App* cmd, Args& a) {
  cmd->add_option("--name", a.name, "Display name");
  cmd->add_option("--owner", a.owner, "Owner");
  cmd->add_option("--created", a.created, "Creation time: seconds since 1970, or now");
  cmd->add_option("--modified", a.modified, "Modification time: seconds since 1970, or now");
  cmd->add_option("--docs", a.docs, "Number of documents");
}

void applyRecordOptions(const Args& a, Ipc::PackInfo& p) {
  if (a.setFolder) p.setFolder(*a.setFolder);
  if (a.status) p.setStatus(*a.status);
  if (a.name) p.name = *a.name;
  if (a.owner) p.owner = *a.owner;
  if (a.created) p.created = parseTime(*a.created);
  if (a.modified) p.modified = parseTime(*a.modified);
  if (a.docs) p.docCount = *a.docs;
}

// The use entry of pack get, lock and unlock: this machine and user unless
// the command line says otherwise.
Ipc::UseInfo useEntry(const Args& a, Ipc::UseInfo::State state) {
  Ipc::UseInfo u = localUse(state);
  u.process = a.useProcess;
  if (a.useHost) u.host = *a.useHost;
  if (a.useUser) u.user = *a.useUser;
  return u;
}

void addUseOptions(CLI::App* cmd, Args& a) {
  cmd->add_option("--host", a.useHost, "Host name recorded in the use entry (default: this machine)");
  cmd->add_option("--user", a.useUser, "User name recorded in the use entry (default: $USER)");
  cmd->add_option("--process", a.useProcess, "Process id recorded in the use entry")->capture_default_str();
}

void addConfig(CLI::App& app, const Globals& g, Action& chosen, Args& a) {
  auto* cfg = app.add_subcommand("cfg", "Configuration parts (JSON objects)");
  cfg->require_subcommand(1);

  auto* get = cfg->add_subcommand("get", "Print a configuration part");
  get->add_option("KEY", a.key)->required();
  get->callback([&] {
    chosen = {true, [&](Client& c) {
                const json::Value v = c.getCfg(a.key);
                if (g.json) {
                  std::printf("%s\n", v.empty() ? "null" : v.dump().c_str());
                } else if (v.empty()) {
                  std::printf("no configuration part \"%s\"\n", a.key.c_str());
                } else {
                  std::printf("%s\n", prettyJson(v).c_str());
                }
                return kOk;
              }};
  });

  auto* set = cfg->add_subcommand("set", "Store a configuration part");
  set->add_option("KEY", a.key)->required();
  auto* value = set->add_option("JSON", a.value, "The part as JSON text, or - for standard input");
  set->add_option("--file", a.file, "Read the part from this file")->excludes(value);
  set->callback([&] {
    chosen = {true,
              [&](Client& c) {
                c.setCfg(a.key, a.part);
                printOk(g, "stored \"" + a.key + "\"");
                return kOk;
              },
              [&] {
                if (a.value.empty() && a.file.empty()) throw UsageError("cfg set needs JSON, --file F or -");
                std::string text;
                if (!a.file.empty() || a.value == "-") {
                  text = std::string(readInput(a.file.empty() ? "-" : a.file).view());
                } else {
                  text = a.value;
                }
                try {
                  a.part = json::strToObject(text);
                } catch (const json::Exc& e) {
                  throw UsageError(std::string("the part must be one JSON object: ") + e.what());
                }
              }};
  });

  auto* rm = cfg->add_subcommand("rm", "Delete a configuration part");
  rm->add_option("KEY", a.key)->required();
  rm->callback([&] {
    chosen = {true, [&](Client& c) {
                c.deleteCfg(a.key);
                printOk(g, "deleted \"" + a.key + "\"");
                return kOk;
              }};
  });

  auto* ls = cfg->add_subcommand("ls", "List configuration keys (pack ids included)");
  ls->add_option("PREFIX", a.prefix);
  ls->callback([&] {
    chosen = {true, [&](Client& c) {
                printList(g, c.cfgIds(a.prefix), "(no keys)");
                return kOk;
              }};
  });
}

void addData(CLI::App& app, const Globals& g, Action& chosen, Args& a) {
  auto* data = app.add_subcommand("data", "Data files");
  data->require_subcommand(1);

  auto* get = data->add_subcommand("get", "Fetch a data file");
  get->add_option("ID", a.id)->required();
  get->add_option("FILE", a.fileName)->required();
  get->add_option("-o,--output", a.output, "Write the content here instead of standard output");
  get->callback([&] {
    chosen = {true, [&](Client& c) {
                const SharedMemBuffer content = c.getData(a.id, a.fileName);
                writeOutput(a.output, content);
                if (a.output != "-") {
                  if (g.json) {
                    std::printf("{\"bytes\":%llu}\n", static_cast<unsigned long long>(content.size()));
                  } else {
                    std::printf("%llu bytes written to %s\n", static_cast<unsigned long long>(content.size()),
                                a.output.c_str());
                  }
                }
                return kOk;
              }};
  });

  auto* put = data->add_subcommand("put", "Store a data file");
  put->add_option("ID", a.id)->required();
  put->add_option("FILE", a.fileName)->required();
  put->add_option("IN", a.input, "File to send, or - for standard input")->capture_default_str();
  put->callback([&] {
    chosen = {true,
              [&](Client& c) {
                const auto size = a.contentBytes.size();
                c.setData(a.id, a.fileName, a.contentBytes);
                printOk(g, "stored " + std::to_string(size) + " bytes as " + a.id + "/" + a.fileName);
                return kOk;
              },
              [&] { a.contentBytes = readInput(a.input); }};
  });
}

void addPackReads(CLI::App* pack, const Globals& g, Action& chosen, Args& a) {
  auto* ls = pack->add_subcommand("ls", "List pack records");
  ls->add_option("FOLDER", a.folder, "Only this folder");
  ls->callback([&] {
    chosen = {true, [&](Client& c) {
                const Ipc::PackInfos list = c.packInfos(a.folder);
                if (g.json) {
                  json::Value arr = json::Value::steal(json_array());
                  for (const auto& p : list) json_array_append(arr.get(), packToJson(p).Value::get());
                  std::printf("%s\n", arr.dump().c_str());
                } else {
                  printPackTable(list);
                }
                return kOk;
              }};
  });

  auto* info = pack->add_subcommand("info", "Show one pack record");
  info->add_option("ID", a.id)->required();
  info->callback([&] {
    chosen = {true, [&](Client& c) {
                printRecord(g, c.packInfo(a.id), a.id);
                return kOk;
              }};
  });

  auto* get =
      pack->add_subcommand("get", "Fetch a pack's content, optionally opening, closing, locking or unlocking it");
  get->add_option("ID", a.id)->required();
  get->add_option("-o,--output", a.output, "Write the content here instead of standard output");
  auto* open = get->add_flag("--open-for-edit", a.openForEdit, "Register as an editor of the pack");
  auto* close = get->add_flag("--close", a.close, "Remove this editor entry");
  auto* lock = get->add_flag("--lock", a.lock, "Take the upload lock");
  auto* unlock = get->add_flag("--unlock", a.unlock, "Release the upload lock");
  open->excludes(close)->excludes(lock)->excludes(unlock);
  close->excludes(lock)->excludes(unlock);
  lock->excludes(unlock);
  addUseOptions(get, a);
  get->callback([&] {
    chosen = {true, [&](Client& c) {
                std::optional<Ipc::UseInfo> use;
                if (a.openForEdit) use = useEntry(a, Ipc::UseInfo::OpenForEdit);
                if (a.close) use = useEntry(a, Ipc::UseInfo::CloseEdit);
                if (a.lock) use = useEntry(a, Ipc::UseInfo::LockForUpload);
                if (a.unlock) use = useEntry(a, Ipc::UseInfo::EndUpload);
                const PackFetch fetched = c.getPack(a.id, use);
                writeOutput(a.output, fetched.content);
                // The record goes where the content does not.
                printRecord(g, fetched.info, a.id, a.output == "-" ? stderr : stdout);
                return kOk;
              }};
  });

  for (const bool locking : {true, false}) {
    auto* cmd = pack->add_subcommand(locking ? "lock" : "unlock",
                                     locking ? "Take a pack's upload lock" : "Release a pack's upload lock");
    cmd->add_option("ID", a.id)->required();
    addUseOptions(cmd, a);
    cmd->callback([&, locking] {
      chosen = {true, [&, locking](Client& c) {
                  const auto use = useEntry(a, locking ? Ipc::UseInfo::LockForUpload : Ipc::UseInfo::EndUpload);
                  const PackFetch fetched = c.getPack(a.id, use);
                  if (g.json) {
                    printRecord(g, fetched.info, a.id);
                  } else if (!fetched.info) {
                    std::printf("no pack \"%s\"\n", a.id.c_str());
                  } else {
                    std::printf("%s \"%s\" for host \"%s\"\n", locking ? "locked" : "unlocked", a.id.c_str(),
                                use.host.c_str());
                  }
                  return kOk;
                }};
    });
  }
}

void addPackWrites(CLI::App* pack, const Globals& g, Action& chosen, Args& a) {
  auto* update = pack->add_subcommand("update", "Change fields of a pack record (a complete record creates it)");
  update->add_option("ID", a.id)->required();
  update->add_option("--folder", a.setFolder, "Folder");
  update->add_option("--status", a.status, "Status number");
  addRecordOptions(update, a);
  update->callback([&] {
    chosen = {true, [&](Client& c) {
                Ipc::PackInfo p(a.id);
                applyRecordOptions(a, p);
                printRecord(g, c.updatePackInfo(p), a.id);
                return kOk;
              }};
  });

  auto* save = pack->add_subcommand("save", "Store a pack's record and content");
  save->add_option("ID", a.id)->required();
  save->add_option("--folder", a.setFolder, "Folder")->required();
  save->add_option("--status", a.status, "Status number")->required();
  addRecordOptions(save, a);
  save->add_option("--content", a.content, "File with the content, or - for standard input")->required();
  save->callback([&] {
    chosen = {true,
              [&](Client& c) {
                Ipc::PackInfo p(a.id);
                applyRecordOptions(a, p);
                // The server creates a pack only from a complete record: a
                // new pack gets defaults for what the command line left out.
                const std::int64_t now = nowSeconds();
                if (!c.packInfo(a.id)) {
                  if (!a.name) p.name = a.id;
                  if (!a.owner) p.owner = currentUser();
                  if (!a.created) p.created = now;
                  if (!a.docs) p.docCount = 0;
                }
                if (!a.modified) p.modified = now;
                const auto size = a.contentBytes.size();
                c.savePack(p, a.contentBytes);
                printOk(g, "saved \"" + a.id + "\" with " + std::to_string(size) + " bytes");
                return kOk;
              },
              [&] { a.contentBytes = readInput(a.content); }};
  });

  auto* rm = pack->add_subcommand("rm", "Erase a pack's record and content");
  rm->add_option("ID", a.id)->required();
  rm->callback([&] {
    chosen = {true, [&](Client& c) {
                c.erasePack(a.id);
                printOk(g, "erased \"" + a.id + "\"");
                return kOk;
              }};
  });

  auto* change = pack->add_subcommand("change-id", "Copy the data files of one document id to another");
  change->add_option("OLD", a.id)->required();
  change->add_option("NEW", a.newId)->required();
  change->callback([&] {
    chosen = {true, [&](Client& c) {
                c.changeDocId(a.id, a.newId);
                printOk(g, "copied the data of \"" + a.id + "\" to \"" + a.newId + "\"");
                return kOk;
              }};
  });
}

void addMaintenance(CLI::App& app, const Globals& g, Action& chosen, Args& a) {
  for (const bool isBackup : {true, false}) {
    auto* cmd = app.add_subcommand(isBackup ? "backup" : "restore", isBackup ? "Back the database (or all databases) up"
                                                                             : "Restore from backup archives");
    cmd->add_option("TARGET", a.target, "Archive file or folder on the server (default: its backup folder)");
    cmd->add_flag("--all", a.all, isBackup ? "Every database" : "Every archive of the folder");
    cmd->callback([&, isBackup] {
      chosen = {true, [&, isBackup](Client& c) {
                  return runMaintenance(g.json, [&](const ProgressFn& progress) {
                    if (isBackup) {
                      c.backup(a.target, a.all, progress);
                    } else {
                      c.restore(a.target, a.all, progress);
                    }
                  });
                }};
    });
  }

  auto* cleanup = app.add_subcommand("cleanup", "Remove data that no pack uses");
  cleanup->add_option("--used", a.used, "An id whose data is still in use (repeatable)");
  cleanup->add_option("--used-file", a.usedFile, "File with one used id per line");
  cleanup->callback([&] {
    chosen = {true,
              [&](Client& c) {
                return runMaintenance(g.json, [&](const ProgressFn& progress) { c.cleanup(a.usedSet, progress); });
              },
              [&] {
                a.usedSet.insert(a.used.begin(), a.used.end());
                if (a.usedFile.empty()) return;
                std::ifstream in(a.usedFile);
                if (!in) throw UsageError("cannot open \"" + a.usedFile + "\"");
                for (std::string line; std::getline(in, line);) {
                  if (!line.empty() && line.back() == '\r') line.pop_back();
                  if (!line.empty()) a.usedSet.insert(line);
                }
              }};
  });
}

}  // namespace

std::shared_ptr<void> addSubcommands(CLI::App& app, const Globals& g, Action& chosen) {
  auto args = std::make_shared<Args>();
  Args& a = *args;

  auto* ping = app.add_subcommand("ping", "Check that the server answers");
  ping->callback([&] {
    chosen = {false, [&](Client& c) {
                const auto start = std::chrono::steady_clock::now();
                c.ping();
                const double ms =
                    std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
                if (g.json) {
                  std::printf("{\"ok\":true,\"ms\":%.3f}\n", ms);
                } else {
                  std::printf("pong from %s:%u in %.3f ms\n", g.host.c_str(), g.port, ms);
                }
                return kOk;
              }};
  });

  auto* dbs = app.add_subcommand("dbs", "List the databases");
  dbs->callback([&] {
    chosen = {false, [&](Client& c) {
                printList(g, c.dbNames(), "(no databases)");
                return kOk;
              }};
  });

  addConfig(app, g, chosen, a);
  addData(app, g, chosen, a);
  auto* pack = app.add_subcommand("pack", "Pack records, contents, editors and upload locks");
  pack->require_subcommand(1);
  addPackReads(pack, g, chosen, a);
  addPackWrites(pack, g, chosen, a);
  addMaintenance(app, g, chosen, a);
  return args;
}

}  // namespace cvdb::tool
