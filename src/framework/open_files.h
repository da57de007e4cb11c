#pragma once
// The process's limit on open files.
//
// Every client connection holds a descriptor, every database session a
// SQLite connection with two more (the database file and its write-ahead
// log; the shared-memory index is shared per file). With MaxActiveDBs
// databases of MaxActiveClientsPerDB sessions each, the default soft limit
// of 1024 is far too low, so the service host raises the soft limit to the
// hard limit at start (the engine pool looks again when it is made, and
// warns when the limit is still too low). The hard limit itself is the
// system's: under systemd, set LimitNOFILE= in the unit (see
// docs/architecture.md).
//
// Thread safety: any thread. Failures: none thrown.

#include <cstdint>

namespace sys {

struct OpenFileLimit {
  std::uint64_t before = 0;  // soft limit found
  std::uint64_t after = 0;   // soft limit now
  std::uint64_t hard = 0;
};

// Raises the soft limit to the hard limit (to 1,048,576 when the hard limit
// is higher than the system lets a process have). Returns what it found and
// did.
OpenFileLimit raiseOpenFileLimit() noexcept;

}  // namespace sys
