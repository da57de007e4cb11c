#pragma once
// What the load generator sends: the workloads against cvdbserver, and
// their counterparts against Redis for the comparisons.
//
// A cvdbserver workload is a list of commands with their requests set,
// which a connection sends in turn (writers alternate between two values,
// so that every write changes the stored bytes: SQLite writes nothing for
// an unchanged row, and the commit then has nothing to sync). Each
// connection works on a key of its own ("bench-<n>"), so writers meet only
// in the database's write lock.
//
// Thread safety: the tables are constant; the functions build new objects.

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "client/client.h"
#include "framework/cmd.h"

namespace loadgen {

struct Params {
  std::size_t size = 0;             // a value's, data file's or pack content's bytes
  std::size_t recordSize = 1024;    // bytes of a pack record's stored text
  std::size_t folderPacks = 10000;  // packs in the folder that getpackinfos lists
};

// The folder that getpackinfos lists, and the folder of every other pack.
inline constexpr const char* kListFolder = "bench-list";
inline constexpr const char* kPackFolder = "bench";

struct Workload {
  const char* name;
  const char* what;
  bool needsDb;
  std::size_t defaultSize;
  // Once per database before the run, on a client bound to it (may be empty).
  std::function<void(cvdb::Client&, const Params&)> prepareDb;
  // Once per connection before the run, on a client bound to its database.
  std::function<void(cvdb::Client&, const Params&, const std::string& key)> prepare;
  // The commands a connection sends in turn.
  std::function<std::vector<std::shared_ptr<Ipc::CmdI>>(const Params&, const std::string& key)> commands;
};

const std::vector<Workload>& workloads();

// A Redis workload in RESP: commands sent once per connection before the
// run (one reply each), and the requests sent in turn, each answered by
// `replies` replies.
struct RedisWorkload {
  const char* name;
  const char* what;
  std::size_t defaultSize;
  unsigned replies;
  std::function<std::vector<std::string>(const Params&, const std::string& key)> setup;
  std::function<std::vector<std::string>(const Params&, const std::string& key)> requests;
};

const std::vector<RedisWorkload>& redisWorkloads();

// A pack record whose stored text is about p.recordSize bytes; variants
// differ in status, times and document count.
Ipc::PackInfo packRecord(const std::string& id, const std::string& folder, int variant, const Params& p);

}  // namespace loadgen
