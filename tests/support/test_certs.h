#pragma once
// Certificates made at test time with OpenSSL, written as PEM files into a
// folder: nothing secret is kept in the repository, and nothing expires
// between runs.
//
//   TempDir dir;
//   testing_support::TestPki pki(dir.path());
//   config: "TlsCertFile": pki.server.cert, "TlsKeyFile": pki.server.key
//
// All keys are EC P-256, certificates SHA-256, valid from a day ago for a
// year unless said otherwise.

#include <filesystem>
#include <string>

namespace testing_support {

struct TestPki {
  struct Pair {
    std::string cert;  // PEM file of the certificate
    std::string key;   // PEM file of its key, not encrypted
  };

  // Makes every certificate below in dir; throws std::runtime_error with
  // OpenSSL's reason on failure.
  explicit TestPki(const std::filesystem::path& dir);

  std::string caFile;       // the CA of the server and of the good clients
  std::string otherCaFile;  // a CA that nobody here trusts
  Pair server;              // from caFile, for localhost, 127.0.0.1 and ::1
  Pair otherServer;         // from otherCaFile, for the same names
  Pair client;              // from caFile, for client use
  Pair otherClient;         // from otherCaFile
  Pair expiredClient;       // from caFile, expired a day ago
};

}  // namespace testing_support
