#pragma once
// Where the client port's TLS material lives, and which mode it gives.
//
// With certFile and keyFile set the port speaks TLS only; with clientCaFile
// set as well, only clients that present a certificate signed by one of
// its CAs are served (mutual TLS). Everything empty: plain TCP.

#include <string>

namespace Ipc {

struct TlsFiles {
  // The server's certificate chain (PEM, the server's own certificate
  // first) and its private key (PEM, not encrypted).
  std::string certFile;
  std::string keyFile;
  // CA certificates (PEM) that clients' certificates must chain to.
  std::string clientCaFile;

  bool enabled() const noexcept { return !certFile.empty() && !keyFile.empty(); }
  bool mutual() const noexcept { return enabled() && !clientCaFile.empty(); }
  // "plain TCP", "TLS" or "mutual TLS".
  const char* modeName() const noexcept { return mutual() ? "mutual TLS" : enabled() ? "TLS" : "plain TCP"; }
};

// Loads the files as the server would; throws std::runtime_error naming the
// file that cannot be read or used (or the key that does not match the
// certificate). Does nothing when TLS is off.
void checkTlsFiles(const TlsFiles& files);

}  // namespace Ipc
