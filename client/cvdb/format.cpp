// How the tool shows records, JSON and progress.

#include <jansson.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <vector>

#include "client/cvdb/tool.h"

namespace cvdb::tool {

std::string formatTime(std::int64_t t) {
  if (t == Ipc::PackInfoPartial::TIME_INVALID) return "-";
  const std::time_t tt = static_cast<std::time_t>(t);
  std::tm tm{};
  if (!::localtime_r(&tt, &tm)) return std::to_string(t);
  char text[32];
  std::strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S", &tm);
  return text;
}

std::string stateName(Ipc::UseInfo::State s) {
  switch (s) {
    case Ipc::UseInfo::OpenForEdit:
      return "OpenForEdit";
    case Ipc::UseInfo::LockForUpload:
      return "LockForUpload";
    case Ipc::UseInfo::CloseEdit:
      return "CloseEdit";
    case Ipc::UseInfo::EndUpload:
      return "EndUpload";
  }
  return std::to_string(static_cast<std::int32_t>(s));
}

json::Object packToJson(const Ipc::PackInfo& p) {
  using Ipc::PackInfoPartial;
  json::Object o;
  o.set("id", json::Value::string(p.id()));
  if (p.folderValid()) o.set("folder", json::Value::string(p.folder()));
  if (p.statusValid()) o.set("status", json::Value::integer(p.status()));
  p.serializeDBUpdate(o);  // name, owner, created, modified, docCount when present
  json::Value uses = json::Value::steal(json_array());
  for (const Ipc::UseInfo& u : p.uses) {
    json::Object e;
    e.set("state", json::Value::string(stateName(u.state)));
    e.set("host", json::Value::string(u.host));
    e.set("user", json::Value::string(u.user));
    e.set("process", json::Value::integer(u.process));
    if (u.time != Ipc::UseInfo::TIME_INVALID) e.set("time", json::Value::integer(u.time));
    json_array_append(uses.get(), e.Value::get());
  }
  o.set("uses", uses);
  return o;
}

std::string prettyJson(const json::Value& v) {
  if (v.empty()) return "";
  char* text = json_dumps(v.get(), JSON_INDENT(2) | JSON_ENCODE_ANY);
  if (!text) throw std::bad_alloc();
  std::string s(text);
  std::free(text);
  return s;
}

namespace {

std::string orDash(const std::string& s) { return s == Ipc::PackInfoPartial::STR_INVALID ? "-" : s; }
std::string orDash(std::int32_t n) { return n == Ipc::PackInfoPartial::LONG_INVALID ? "-" : std::to_string(n); }

std::string usesSummary(const Ipc::UseInfos& uses) {
  std::size_t editors = 0;
  for (const auto& u : uses) editors += u.state == Ipc::UseInfo::OpenForEdit;
  std::string s = std::to_string(editors) + " editing";
  if (const Ipc::UseInfo* lock = uses.findUploadInf()) s += ", locked by " + lock->host;
  return s;
}

}  // namespace

void printPackTable(const Ipc::PackInfos& list) {
  const std::vector<std::string> head = {"ID", "FOLDER", "STATUS", "NAME", "OWNER", "DOCS", "MODIFIED", "USE"};
  std::vector<std::vector<std::string>> rows;
  for (const auto& p : list) {
    rows.push_back({p.id(), orDash(p.folder()), orDash(p.status()), orDash(p.name), orDash(p.owner), orDash(p.docCount),
                    formatTime(p.modified), usesSummary(p.uses)});
  }
  std::vector<std::size_t> width(head.size());
  for (std::size_t c = 0; c < head.size(); ++c) {
    width[c] = head[c].size();
    for (const auto& r : rows) width[c] = std::max(width[c], r[c].size());
  }
  const auto line = [&](const std::vector<std::string>& cells) {
    std::string s;
    for (std::size_t c = 0; c < cells.size(); ++c) {
      s += cells[c];
      if (c + 1 < cells.size()) s.append(width[c] - cells[c].size() + 2, ' ');
    }
    std::printf("%s\n", s.c_str());
  };
  line(head);
  for (const auto& r : rows) line(r);
  if (rows.empty()) std::printf("(no packs)\n");
}

void printPackDetails(const Ipc::PackInfo& p, std::FILE* out) {
  std::fprintf(out, "id:        %s\n", p.id().c_str());
  std::fprintf(out, "folder:    %s\n", orDash(p.folder()).c_str());
  std::fprintf(out, "status:    %s\n", orDash(p.status()).c_str());
  std::fprintf(out, "name:      %s\n", orDash(p.name).c_str());
  std::fprintf(out, "owner:     %s\n", orDash(p.owner).c_str());
  std::fprintf(out, "documents: %s\n", orDash(p.docCount).c_str());
  std::fprintf(out, "created:   %s\n", formatTime(p.created).c_str());
  std::fprintf(out, "modified:  %s\n", formatTime(p.modified).c_str());
  if (p.uses.empty()) std::fprintf(out, "uses:      none\n");
  for (const auto& u : p.uses) {
    std::fprintf(out, "use:       %s host \"%s\" user \"%s\" process %u since %s\n", stateName(u.state).c_str(),
                 u.host.c_str(), u.user.c_str(), u.process, formatTime(u.time).c_str());
  }
}

ProgressFn progressPrinter(bool jsonLines) {
  if (jsonLines) {
    return [](std::uint32_t percent, const std::string& text) {
      json::Object o;
      o.set("percent", json::Value::integer(percent));
      o.set("text", json::Value::string(text));
      std::printf("%s\n", o.dump().c_str());
      std::fflush(stdout);
    };
  }
  if (::isatty(STDERR_FILENO)) {
    return [](std::uint32_t percent, const std::string& text) {
      const std::uint32_t p = std::min<std::uint32_t>(percent, 100);
      const std::size_t filled = p * 30 / 100;
      std::string bar(filled, '#');
      bar.append(30 - filled, '-');
      std::string shown = text.substr(0, 60);
      std::fprintf(stderr, "\r[%s] %3u%% %-60s", bar.c_str(), p, shown.c_str());
      std::fflush(stderr);
    };
  }
  return
      [](std::uint32_t percent, const std::string& text) { std::fprintf(stderr, "%3u%% %s\n", percent, text.c_str()); };
}

int runMaintenance(bool jsonLines, const std::function<void(const ProgressFn&)>& operation) {
  const bool bar = !jsonLines && ::isatty(STDERR_FILENO);
  bool shown = false;
  const ProgressFn print = progressPrinter(jsonLines);
  const auto endLine = [&] {
    if (bar && shown) std::fprintf(stderr, "\n");
  };
  try {
    operation([&](std::uint32_t percent, const std::string& text) {
      shown = true;
      print(percent, text);
    });
  } catch (...) {
    endLine();
    throw;
  }
  endLine();
  if (jsonLines) std::printf("{\"ok\":true}\n");
  return kOk;
}

}  // namespace cvdb::tool
