#pragma once
// The process's limit on open files.
//
// Every session holds a SQLite connection, and every connection keeps two
// file descriptors open (the database file and its write-ahead log; the
// shared-memory index is shared per file). With MaxActiveDBs databases of
// MaxActiveClientsPerDB sessions each, the default soft limit of 1024 is far
// too low, so the engine raises the soft limit to the hard limit when it
// starts. The hard limit itself is the system's: under systemd, set
// LimitNOFILE= in the unit (see docs/architecture.md).
//
// Thread safety: any thread. Failures: none thrown.

#include <cstdint>

namespace engine {

struct OpenFileLimit {
  std::uint64_t before = 0;  // soft limit found
  std::uint64_t after = 0;   // soft limit now
  std::uint64_t hard = 0;
};

// Raises the soft limit to the hard limit. Returns what it found and did.
OpenFileLimit raiseOpenFileLimit() noexcept;

}  // namespace engine
