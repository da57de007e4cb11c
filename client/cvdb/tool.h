#pragma once
// Pieces of the cvdb command-line tool shared by its source files.

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "client/client.h"
#include "framework/buffers.h"
#include "framework/json.h"
#include "protocol/pack_info.h"

namespace CLI {
class App;
}

namespace cvdb::tool {

// Exit statuses.
inline constexpr int kOk = 0;
inline constexpr int kFailed = 1;       // the server refused or failed the command, or ended the connection
inline constexpr int kUsage = 2;        // bad command line or local input
inline constexpr int kUnreachable = 3;  // no connection to the server

// A failure of the tool's own (bad local input, unwritable file): exit
// status kUsage with the message.
class UsageError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

struct Globals {
  std::string host = "127.0.0.1";
  std::uint16_t port = 45678;
  std::optional<std::string> db;
  std::uint32_t openMode = 0;
  bool json = false;
  unsigned timeoutSeconds = 60;
  // TLS: on with --tls (or any of the files); the CA file verifies the
  // server (empty: the system's trusted CAs), the certificate and key
  // identify the client.
  bool tls = false;
  std::string caFile;
  std::string certFile;
  std::string keyFile;
};

// What a subcommand does once the command line is parsed.
struct Action {
  bool needsDb = true;
  std::function<int(Client&)> run;
  // Reads local input before anything goes to the server, so that a bad
  // file or text changes nothing there.
  std::function<void()> prepare = {};
};

// Adds every subcommand to app; the chosen one's action lands in chosen.
// The result holds the values the options are bound to: keep it as long as
// app.
[[nodiscard]] std::shared_ptr<void> addSubcommands(CLI::App& app, const Globals& globals, Action& chosen);

// Input and output of contents: a path, or "-" for the standard streams.
SharedMemBuffer readInput(const std::string& pathOrDash);
void writeOutput(const std::string& pathOrDash, const SharedMemBuffer& content);

// Presentation.
json::Object packToJson(const Ipc::PackInfo& p);
std::string formatTime(std::int64_t secondsSinceEpoch);
std::string stateName(Ipc::UseInfo::State s);
void printPackTable(const Ipc::PackInfos& list);
void printPackDetails(const Ipc::PackInfo& p, std::FILE* out);
std::string prettyJson(const json::Value& v);
// Progress of a maintenance command: a bar on standard error when it is a
// terminal, plain lines there otherwise, JSON lines on standard output with
// --json.
ProgressFn progressPrinter(bool jsonLines);
// Runs a maintenance operation with progressPrinter and ends the bar's line.
int runMaintenance(bool jsonLines, const std::function<void(const ProgressFn&)>& operation);

}  // namespace cvdb::tool
