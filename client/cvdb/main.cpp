// cvdb: the command-line client of cvdbserver.

#include <CLI/CLI.hpp>

#include <cstdio>

#include "client/cvdb/tool.h"

int main(int argc, char** argv) {
  using namespace cvdb::tool;
  CLI::App app{"cvdb " CVDB_VERSION ": command-line client of the Corvina database server"};
  app.footer(
      "Exit status: 0 success; 1 the server refused or failed the command or ended the connection;\n"
      "2 bad command line or local input; 3 the server could not be reached.");
  app.set_version_flag("--version", CVDB_VERSION);
  app.require_subcommand(1);

  Globals globals;
  app.add_option("--host", globals.host, "Server host name or address")->capture_default_str();
  app.add_option("--port", globals.port, "Server TCP port")->capture_default_str();
  app.add_option("--db", globals.db, "Database name (\\ separates levels); needed by database commands");
  app.add_option("--open-mode", globals.openMode,
                 "How Connect opens the database: 0 open or create, 1 existing only, 2 select without opening")
      ->capture_default_str();
  app.add_flag("--json", globals.json, "Machine-readable output");
  app.add_option("--timeout", globals.timeoutSeconds, "Seconds to wait for the server before giving up")
      ->capture_default_str();
  app.add_flag("--tls", globals.tls,
               "Connect over TLS; the server's certificate must name --host and chain to --ca (default: the "
               "system's trusted CAs)");
  app.add_option("--ca", globals.caFile, "CA certificates (PEM) that verify the server; implies --tls")
      ->check(CLI::ExistingFile);
  app.add_option("--cert", globals.certFile, "Client certificate (PEM) for servers that require one; implies --tls")
      ->check(CLI::ExistingFile);
  app.add_option("--key", globals.keyFile, "Private key (PEM, not encrypted) of --cert")->check(CLI::ExistingFile);

  Action action;
  const auto bound = addSubcommands(app, globals, action);
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int rc = app.exit(e);
    return rc == 0 ? kOk : kUsage;
  }

  try {
    cvdb::ClientOptions options;
    options.host = globals.host;
    options.port = globals.port;
    options.connectTimeout = std::chrono::seconds(std::min(globals.timeoutSeconds, 10u));
    options.ioTimeout = std::chrono::seconds(globals.timeoutSeconds);
    if (globals.certFile.empty() != globals.keyFile.empty()) throw UsageError("--cert and --key go together");
    if (globals.tls || !globals.caFile.empty() || !globals.certFile.empty()) {
      cvdb::TlsOptions& tls = options.tls.emplace();
      tls.caFile = globals.caFile;
      tls.certFile = globals.certFile;
      tls.keyFile = globals.keyFile;
    }
    if (action.needsDb && !globals.db) throw UsageError("this command needs --db NAME");
    if (action.prepare) action.prepare();
    cvdb::Client client(options);
    if (action.needsDb) {
      const cvdb::ConnectResult connected = client.connect(*globals.db, globals.openMode);
      if (!connected) {
        std::fprintf(stderr, "cvdb: %s\n", connected.error.c_str());
        return kFailed;
      }
    }
    return action.run(client);
  } catch (const UsageError& e) {
    std::fprintf(stderr, "cvdb: %s\n", e.what());
    return kUsage;
  } catch (const cvdb::ConnectFailed& e) {
    std::fprintf(stderr, "cvdb: %s\n", e.what());
    return kUnreachable;
  } catch (const cvdb::OperationFailed& e) {
    std::fprintf(stderr, "cvdb: %s\n", e.reason().c_str());
    return kFailed;
  } catch (const cvdb::Error& e) {
    std::fprintf(stderr, "cvdb: %s\n", e.what());
    return kFailed;
  } catch (const json::Exc& e) {
    std::fprintf(stderr, "cvdb: %s\n", e.what());
    return kUsage;
  } catch (const std::exception& e) {
    std::fprintf(stderr, "cvdb: %s\n", e.what());
    return kFailed;
  }
}
