// The cost of a replicated write: 100-byte configuration parts upserted into
// a dqlite cluster, against the same upserts on a local SQLite file in WAL
// mode with synchronous=FULL, as the engine opens its databases
// (src/engine/connection.cpp).
//
//   dqlite_bench free-ports N
//   dqlite_bench node ID ADDRESS DIR
//   dqlite_bench form ADDRESS1 ADDRESS2 ...
//   dqlite_bench members ADDRESS
//   dqlite_bench write dqlite ADDRESS | local DIR  [--connections C] [--databases D]
//                [--seconds S] [--name PREFIX] [--no-gate]
//
// free-ports prints N TCP ports of the loopback that are free now. node runs
// one dqlite node (node 1 bootstraps a new cluster) until SIGTERM or SIGINT.
// form makes the nodes at the given addresses, node I at the I-th address,
// one cluster of voters: it finds the leader, adds every other node through
// it (ADD, then ASSIGN voter) and waits until the leader lists them all as
// voters. members prints the membership as the leader has it.
//
// write runs C connections for S seconds, each on its own thread with one
// write in flight: connection I writes to database I mod D, cycling over 64
// keys of its own ("c<I>-k<J>", as a BLOB like the meta table's id) with a
// 100-byte value that starts with the write's sequence number. It prints one
// line of JSON: writes, writes_per_sec, p50_us, p99_us, busy_retries and
// cpu_us, the processor time of this process while it wrote (the nodes'
// time is theirs: bench/dqlite-bench.sh adds it from /proc). On
// dqlite, each connection asks the server it is given for the leader,
// connects there, opens its database and prepares the upsert once. On the
// local side each connection has its own SQLite connection. On both sides a
// process-wide gate lets one write at a time into a database, as the
// engine's write gate does (a server on top of dqlite would keep it), in the
// order the writes arrived: a connection that has just written queues
// behind the others, as a client of the server waits for its answer before
// it sends again. Every write is its own transaction. --no-gate drops the
// gate: the local connections then wait in SQLite's busy handler, and the
// dqlite leader
// refuses a write while another transaction of the database is in flight
// (SQLITE_BUSY), which the connection sends again after a growing pause
// (0.1 ms doubling up to 5 ms); latencies include the retries.
//
// The check: every acknowledged write must have changed one row, and at the
// end every database must hold exactly the keys written to it, each with the
// value of the last write acknowledged for it (count(*) and the sum of the
// sequence numbers are read back). A mismatch fails the run (exit 1), so no
// figure is printed for writes that did not happen.
//
// The client speaks dqlite's wire protocol (version 1) directly: dqlite 1.11
// ships no C client. Messages are a header word (body size in 8-byte words,
// type, schema version) and a body of little-endian integers and
// NUL-terminated, word-padded text.

#include <arpa/inet.h>
extern "C" {  // dqlite.h declares no C linkage of its own
#include <dqlite.h>
}
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <filesystem>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kKeysPerConnection = 64;
constexpr std::size_t kValueBytes = 100;
constexpr const char* kSchema =
    "CREATE TABLE IF NOT EXISTS meta(id BLOB NOT NULL PRIMARY KEY CHECK(length(id) <= 255), blob BLOB) STRICT";
constexpr const char* kUpsert =
    "INSERT INTO meta(id, blob) VALUES(?, ?) ON CONFLICT(id) DO UPDATE SET blob=excluded.blob";
constexpr const char* kCheck = "SELECT count(*), coalesce(sum(CAST(substr(blob, 1, 12) AS INTEGER)), 0) FROM meta";

[[noreturn]] void fail(const std::string& what) { throw std::runtime_error(what); }

// ------------------------------------------------------------ wire protocol

namespace wire {

constexpr std::uint64_t kProtocolVersion = 1;

enum Request : std::uint8_t {
  kLeader = 0,
  kOpen = 3,
  kPrepare = 4,
  kExec = 5,
  kExecSql = 8,
  kQuerySql = 9,
  kAdd = 12,
  kAssign = 13,
  kCluster = 16,
};

enum Response : std::uint8_t {
  kFailure = 0,
  kServer = 1,
  kServers = 3,
  kDb = 4,
  kStmt = 5,
  kResult = 6,
  kRows = 7,
  kEmpty = 8,
};

constexpr std::uint64_t kRoleVoter = 0;
constexpr std::uint64_t kRowsDone = 0xffffffffffffffffULL;
constexpr std::uint64_t kRowsPart = 0xeeeeeeeeeeeeeeeeULL;
constexpr std::uint8_t kInteger = 1, kText = 3, kBlob = 4, kNull = 5;

const char* roleName(std::uint64_t role) {
  switch (role) {
    case 0:
      return "voter";
    case 1:
      return "standby";
    case 2:
      return "spare";
  }
  return "unknown";
}

class Body {
 public:
  void u8(std::uint8_t v) { bytes_.push_back(v); }
  void u32(std::uint32_t v) { put(&v, 4); }
  void u64(std::uint64_t v) { put(&v, 8); }
  void text(const std::string& s) {
    put(s.data(), s.size());
    bytes_.push_back(0);
    pad();
  }
  void blob(const void* data, std::size_t n) {
    u64(n);
    put(data, n);
    pad();
  }
  void pad() {
    while (bytes_.size() % 8 != 0) bytes_.push_back(0);
  }
  const std::vector<std::uint8_t>& bytes() const { return bytes_; }

 private:
  void put(const void* p, std::size_t n) {  // little-endian host (x86-64)
    const auto* b = static_cast<const std::uint8_t*>(p);
    bytes_.insert(bytes_.end(), b, b + n);
  }
  std::vector<std::uint8_t> bytes_;
};

class Cursor {
 public:
  explicit Cursor(const std::vector<std::uint8_t>& b) : b_(b) {}
  std::uint32_t u32() { return get<std::uint32_t>(); }
  std::uint64_t u64() { return get<std::uint64_t>(); }
  std::string text() {
    const auto* start = b_.data() + at_;
    const auto* end = static_cast<const std::uint8_t*>(std::memchr(start, 0, b_.size() - at_));
    if (end == nullptr) fail("dqlite: text without its end in a response");
    std::string s(reinterpret_cast<const char*>(start), end - start);
    at_ += (s.size() + 1 + 7) / 8 * 8;
    return s;
  }
  void skip(std::size_t n) { need(n), at_ += n; }
  bool done() const { return at_ >= b_.size(); }

 private:
  void need(std::size_t n) const {
    if (at_ + n > b_.size()) fail("dqlite: response shorter than its fields");
  }
  template <typename T>
  T get() {
    need(sizeof(T));
    T v;
    std::memcpy(&v, b_.data() + at_, sizeof(T));
    at_ += sizeof(T);
    return v;
  }
  const std::vector<std::uint8_t>& b_;
  std::size_t at_ = 0;
};

struct Failure : std::runtime_error {
  Failure(std::uint64_t c, const std::string& m) : std::runtime_error(m), code(c) {}
  std::uint64_t code;
  bool busy() const { return (code & 0xff) == SQLITE_BUSY; }
};

class Connection {
 public:
  explicit Connection(const std::string& address) : address_(address) {
    const auto colon = address.rfind(':');
    if (colon == std::string::npos) fail("dqlite: address without a port: " + address);
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_port = htons(static_cast<std::uint16_t>(std::stoi(address.substr(colon + 1))));
    if (inet_pton(AF_INET, address.substr(0, colon).c_str(), &sa.sin_addr) != 1) fail("dqlite: bad address " + address);
    fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd_ < 0) fail("dqlite: socket: " + std::string(std::strerror(errno)));
    const int one = 1;
    setsockopt(fd_, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    timeval timeout{30, 0};  // a cluster that stops answering fails the run
    setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    if (connect(fd_, reinterpret_cast<sockaddr*>(&sa), sizeof sa) != 0) {
      const std::string why = std::strerror(errno);
      close(fd_);
      fail("dqlite: cannot connect to " + address + ": " + why);
    }
    std::uint64_t version = kProtocolVersion;
    writeAll(&version, sizeof version);
  }
  ~Connection() { close(fd_); }
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  const std::string& address() const { return address_; }

  // Sends one request and reads its response; a FAILURE response throws.
  std::vector<std::uint8_t> call(Request type, const Body& body, Response expected) {
    const auto& b = body.bytes();
    std::vector<std::uint8_t> out(8 + b.size());
    const auto words = static_cast<std::uint32_t>(b.size() / 8);
    std::memcpy(out.data(), &words, 4);
    out[4] = type;
    std::copy(b.begin(), b.end(), out.begin() + 8);
    writeAll(out.data(), out.size());

    std::uint8_t header[8];
    readAll(header, sizeof header);
    std::uint32_t n = 0;
    std::memcpy(&n, header, 4);
    std::vector<std::uint8_t> reply(std::size_t{n} * 8);
    readAll(reply.data(), reply.size());
    if (header[4] == kFailure) {
      Cursor c(reply);
      const auto code = c.u64();
      throw Failure(code, "dqlite " + address_ + ": " + c.text() + " (code " + std::to_string(code) + ")");
    }
    if (header[4] != expected) {
      fail("dqlite " + address_ + ": response type " + std::to_string(header[4]) + " where " +
           std::to_string(expected) + " was expected");
    }
    return reply;
  }

 private:
  void writeAll(const void* p, std::size_t n) {
    const auto* b = static_cast<const std::uint8_t*>(p);
    while (n > 0) {
      const auto w = send(fd_, b, n, MSG_NOSIGNAL);
      if (w < 0 && errno == EINTR) continue;
      if (w <= 0) fail("dqlite " + address_ + ": send: " + std::strerror(errno));
      b += w;
      n -= static_cast<std::size_t>(w);
    }
  }
  void readAll(void* p, std::size_t n) {
    auto* b = static_cast<std::uint8_t*>(p);
    while (n > 0) {
      const auto r = recv(fd_, b, n, 0);
      if (r < 0 && errno == EINTR) continue;
      if (r == 0) fail("dqlite " + address_ + ": connection closed by the node");
      if (r < 0) fail("dqlite " + address_ + ": recv: " + std::strerror(errno));
      b += r;
      n -= static_cast<std::size_t>(r);
    }
  }
  std::string address_;
  int fd_ = -1;
};

struct Leader {
  std::uint64_t id = 0;
  std::string address;
};

Leader leaderOf(Connection& c) {
  Body b;
  b.u64(0);
  const auto reply = c.call(kLeader, b, kServer);
  Cursor r(reply);
  Leader l;
  l.id = r.u64();
  l.address = r.text();
  return l;
}

struct Member {
  std::uint64_t id;
  std::string address;
  std::uint64_t role;
};

std::vector<Member> membersOf(Connection& c) {
  Body b;
  b.u64(1);  // format 1: with the role
  const auto reply = c.call(kCluster, b, kServers);
  Cursor r(reply);
  std::vector<Member> members(r.u64());
  for (auto& m : members) {
    m.id = r.u64();
    m.address = r.text();
    m.role = r.u64();
  }
  return members;
}

// Asks the given node for the leader (waiting for an election) and
// connects to it.
std::unique_ptr<Connection> connectToLeader(const std::string& address) {
  const auto until = Clock::now() + std::chrono::seconds(20);
  for (;;) {
    auto c = std::make_unique<Connection>(address);
    const auto leader = leaderOf(*c);
    if (!leader.address.empty()) {
      if (leader.address == address) return c;
      auto l = std::make_unique<Connection>(leader.address);
      if (leaderOf(*l).address == leader.address) return l;
    }
    if (Clock::now() > until) fail("dqlite: no leader known to " + address + " after 20 s");
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
}

std::uint32_t openDatabase(Connection& c, const std::string& name) {
  Body b;
  b.text(name);
  b.u64(0);
  b.text("");  // the node's own VFS
  const auto reply = c.call(kOpen, b, kDb);
  return Cursor(reply).u32();
}

void execSql(Connection& c, std::uint32_t db, const std::string& sql) {
  Body b;
  b.u64(db);
  b.text(sql);  // no parameters: no tuple at all
  c.call(kExecSql, b, kResult);
}

// The first row of a query whose columns are all integers (or NULL, read
// as 0).
std::vector<std::int64_t> queryIntegers(Connection& c, std::uint32_t db, const std::string& sql) {
  Body b;
  b.u64(db);
  b.text(sql);
  const auto reply = c.call(kQuerySql, b, kRows);
  Cursor r(reply);
  const auto columns = r.u64();
  for (std::uint64_t i = 0; i < columns; ++i) r.text();
  const auto first = r.u64();  // the row's type header, or the end marker
  if (first == kRowsDone || first == kRowsPart) fail("dqlite: the query returned no row: " + sql);
  if (columns > 16) fail("dqlite: too many columns for one header word");
  std::vector<std::int64_t> values;
  for (std::uint64_t i = 0; i < columns; ++i) {
    const auto type = static_cast<std::uint8_t>((first >> (4 * i)) & 0xf);
    const auto v = static_cast<std::int64_t>(r.u64());
    if (type != kInteger && type != kNull) fail("dqlite: column of type " + std::to_string(type) + " in " + sql);
    values.push_back(type == kInteger ? v : 0);
  }
  return values;
}

}  // namespace wire

// ------------------------------------------------------------- subcommands

int freePorts(int n) {
  std::vector<int> fds;
  for (int i = 0; i < n; ++i) {
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof sa;
    if (fd < 0 || bind(fd, reinterpret_cast<sockaddr*>(&sa), sizeof sa) != 0 ||
        getsockname(fd, reinterpret_cast<sockaddr*>(&sa), &len) != 0) {
      fail("free-ports: " + std::string(std::strerror(errno)));
    }
    std::printf("%s%d", i == 0 ? "" : " ", ntohs(sa.sin_port));
    fds.push_back(fd);
  }
  std::printf("\n");
  for (const int fd : fds) close(fd);
  return 0;
}

int runNode(dqlite_node_id id, const std::string& address, const std::string& dir) {
  sigset_t stop;
  sigemptyset(&stop);
  sigaddset(&stop, SIGTERM);
  sigaddset(&stop, SIGINT);
  pthread_sigmask(SIG_BLOCK, &stop, nullptr);  // before dqlite's threads start

  dqlite_node* node = nullptr;
  int rc = dqlite_node_create(id, address.c_str(), dir.c_str(), &node);
  if (rc != 0) {
    std::fprintf(stderr, "node %llu: create failed (%d)%s%s\n", id, rc, node ? ": " : "",
                 node ? dqlite_node_errmsg(node) : "");
    return 1;
  }
  rc = dqlite_node_set_bind_address(node, address.c_str());
  if (rc == 0) rc = dqlite_node_start(node);
  if (rc != 0) {
    std::fprintf(stderr, "node %llu: start failed (%d): %s\n", id, rc, dqlite_node_errmsg(node));
    dqlite_node_destroy(node);
    return 1;
  }
  std::printf("node %llu ready on %s, data in %s\n", id, address.c_str(), dir.c_str());
  std::fflush(stdout);
  int sig = 0;
  sigwait(&stop, &sig);
  rc = dqlite_node_stop(node);
  dqlite_node_destroy(node);
  return rc == 0 ? 0 : 1;
}

void printMembers(const std::vector<wire::Member>& members) {
  for (const auto& m : members)
    std::printf("  node %llu %s %s\n", static_cast<unsigned long long>(m.id), m.address.c_str(),
                wire::roleName(m.role));
}

int members(const std::string& address) {
  auto leader = wire::connectToLeader(address);
  std::printf("leader %s\n", leader->address().c_str());
  printMembers(wire::membersOf(*leader));
  return 0;
}

int form(const std::vector<std::string>& addresses) {
  auto leader = wire::connectToLeader(addresses[0]);
  const auto self = wire::leaderOf(*leader);
  std::printf("leader: node %llu at %s\n", static_cast<unsigned long long>(self.id), self.address.c_str());
  for (std::size_t i = 0; i < addresses.size(); ++i) {
    const std::uint64_t id = i + 1;
    if (id == self.id) continue;
    const auto current = wire::membersOf(*leader);
    const auto it = std::find_if(current.begin(), current.end(), [&](const auto& m) { return m.id == id; });
    if (it == current.end()) {
      wire::Body add;
      add.u64(id);
      add.text(addresses[i]);
      leader->call(wire::kAdd, add, wire::kEmpty);
      std::printf("added node %llu (%s)\n", static_cast<unsigned long long>(id), addresses[i].c_str());
    }
    if (it == current.end() || it->role != wire::kRoleVoter) {
      wire::Body assign;
      assign.u64(id);
      assign.u64(wire::kRoleVoter);
      leader->call(wire::kAssign, assign, wire::kEmpty);
      std::printf("assigned node %llu the voter role\n", static_cast<unsigned long long>(id));
    }
  }
  // ASSIGN answers once the change is committed; the listing confirms it.
  const auto until = Clock::now() + std::chrono::seconds(20);
  for (;;) {
    const auto now = wire::membersOf(*leader);
    const auto voters = std::count_if(now.begin(), now.end(), [](const auto& m) { return m.role == wire::kRoleVoter; });
    if (static_cast<std::size_t>(voters) == addresses.size() && now.size() == addresses.size()) {
      std::printf("cluster of %zu voters:\n", now.size());
      printMembers(now);
      return 0;
    }
    if (Clock::now() > until) {
      std::fprintf(stderr, "form: the cluster did not reach %zu voters in 20 s:\n", addresses.size());
      printMembers(now);
      return 1;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
}

// ------------------------------------------------------------------- writes

// One write at a time, first come first served: the gate is handed to the
// longest waiter, and only that one is woken.
class Gate {
 public:
  void enter() {
    std::unique_lock lock(mutex_);
    if (!held_) {
      held_ = true;
      return;
    }
    Waiter me;
    waiters_.push_back(&me);
    me.turn.wait(lock, [&] { return me.handed; });
  }
  void leave() {
    std::lock_guard lock(mutex_);
    if (waiters_.empty()) {
      held_ = false;
      return;
    }
    Waiter* next = waiters_.front();
    waiters_.pop_front();
    next->handed = true;  // held_ stays true: it passes to the waiter
    next->turn.notify_one();
  }

 private:
  struct Waiter {
    std::condition_variable turn;
    bool handed = false;
  };
  std::mutex mutex_;
  std::deque<Waiter*> waiters_;
  bool held_ = false;
};

struct Entered {
  Gate* gate;
  explicit Entered(Gate* g) : gate(g) {
    if (gate != nullptr) gate->enter();
  }
  ~Entered() {
    if (gate != nullptr) gate->leave();
  }
  Entered(const Entered&) = delete;
  Entered& operator=(const Entered&) = delete;
};

struct Target {
  bool dqlite = false;
  std::string where;  // a node's address, or the folder of the local files
};

struct WriteOptions {
  int connections = 1;
  int databases = 1;
  double seconds = 5;
  std::string name = "bench";
  bool gate = true;
};

// What one connection did: latencies, and per key the sequence number of
// its last acknowledged write (0: never written).
struct Worker {
  std::vector<float> latencyUs;
  std::vector<std::uint64_t> lastSeq = std::vector<std::uint64_t>(kKeysPerConnection, 0);
  std::uint64_t writes = 0;
  std::uint64_t busyRetries = 0;
  std::string error;
};

std::string keyOf(int connection, int key) {
  char buf[32];
  std::snprintf(buf, sizeof buf, "c%d-k%d", connection, key);
  return buf;
}

void fillValue(char (&value)[kValueBytes], std::uint64_t seq) {
  std::memset(value, 'v', sizeof value);
  char head[16];
  std::snprintf(head, sizeof head, "%012llu", static_cast<unsigned long long>(seq));
  std::memcpy(value, head, 12);
}

std::string databaseName(const WriteOptions& o, int d) { return o.name + "-" + std::to_string(d); }

// One connection's loop; write(key, value, n) performs one acknowledged
// write and returns the number of busy refusals it retried.
template <typename WriteFn>
void loop(int index, Clock::time_point until, Worker& w, WriteFn write) {
  w.latencyUs.reserve(1 << 16);
  char value[kValueBytes];
  std::vector<std::string> keys;
  for (int k = 0; k < kKeysPerConnection; ++k) keys.push_back(keyOf(index, k));
  for (std::uint64_t seq = 1; Clock::now() < until; ++seq) {
    const int k = static_cast<int>((seq - 1) % kKeysPerConnection);
    fillValue(value, seq);
    const auto start = Clock::now();
    w.busyRetries += write(keys[k], value);
    w.latencyUs.push_back(std::chrono::duration<float, std::micro>(Clock::now() - start).count());
    w.lastSeq[k] = seq;
    ++w.writes;
  }
}

// The dqlite side.
void dqliteWorker(const std::string& address, const WriteOptions& o, int index, Clock::time_point until, Worker& w,
                  Gate& gate) {
  try {
    auto c = wire::connectToLeader(address);
    const auto db = wire::openDatabase(*c, databaseName(o, index % o.databases));
    wire::Body prep;
    prep.u64(db);
    prep.text(kUpsert);
    const auto reply = c->call(wire::kPrepare, prep, wire::kStmt);
    wire::Cursor r(reply);
    r.u32();
    const auto stmt = r.u32();
    loop(index, until, w, [&](const std::string& key, const char(&value)[kValueBytes]) {
      wire::Body b;
      b.u32(db);
      b.u32(stmt);
      b.u8(2);
      b.u8(wire::kBlob);
      b.u8(wire::kBlob);
      b.pad();
      b.blob(key.data(), key.size());
      b.blob(value, sizeof value);
      const Entered entered(o.gate ? &gate : nullptr);
      for (std::uint64_t busy = 0;; ++busy) {
        try {
          const auto result = c->call(wire::kExec, b, wire::kResult);
          wire::Cursor res(result);
          res.u64();
          if (const auto changed = res.u64(); changed != 1) {
            fail("an upsert changed " + std::to_string(changed) + " rows");
          }
          return busy;
        } catch (const wire::Failure& f) {
          if (!f.busy() || busy > 10000) throw;
          const auto pause = std::min<std::int64_t>(100LL << std::min<std::uint64_t>(busy, 10), 5000);
          std::this_thread::sleep_for(std::chrono::microseconds(pause / 2 + std::rand() % (pause / 2 + 1)));
        }
      }
    });
  } catch (const std::exception& e) {
    w.error = e.what();
  }
}

void prepareDqlite(const std::string& address, const WriteOptions& o) {
  // A connection holds one database: one connection for each.
  for (int d = 0; d < o.databases; ++d) {
    auto each = wire::connectToLeader(address);
    const auto db = wire::openDatabase(*each, databaseName(o, d));
    wire::execSql(*each, db, kSchema);
  }
}

std::vector<std::int64_t> checkDqlite(const std::string& address, const WriteOptions& o, int d) {
  auto c = wire::connectToLeader(address);
  const auto db = wire::openDatabase(*c, databaseName(o, d));
  return wire::queryIntegers(*c, db, kCheck);
}

// The local side.
struct Sqlite {
  sqlite3* db = nullptr;
  explicit Sqlite(const std::string& file) {
    const int rc =
        sqlite3_open_v2(file.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX, nullptr);
    if (rc != SQLITE_OK) fail("sqlite: cannot open " + file + ": " + sqlite3_errstr(rc));
    sqlite3_busy_timeout(db, 10000);
    exec("PRAGMA journal_mode=WAL");
    exec(
        "PRAGMA synchronous=FULL; PRAGMA cache_size=-256; PRAGMA journal_size_limit=67108864;"
        "PRAGMA secure_delete=FAST;");
  }
  ~Sqlite() { sqlite3_close_v2(db); }
  void exec(const char* sql) {
    if (sqlite3_exec(db, sql, nullptr, nullptr, nullptr) != SQLITE_OK)
      fail(std::string("sqlite: ") + sqlite3_errmsg(db));
  }
};

std::string localFile(const std::string& dir, const WriteOptions& o, int d) {
  return dir + "/" + databaseName(o, d) + ".sqlite";
}

void localWorker(const std::string& dir, const WriteOptions& o, int index, Clock::time_point until, Worker& w,
                 Gate& gate) {
  try {
    Sqlite s(localFile(dir, o, index % o.databases));
    sqlite3_stmt* stmt = nullptr;
    if (sqlite3_prepare_v3(s.db, kUpsert, -1, SQLITE_PREPARE_PERSISTENT, &stmt, nullptr) != SQLITE_OK) {
      fail(std::string("sqlite: ") + sqlite3_errmsg(s.db));
    }
    loop(index, until, w, [&](const std::string& key, const char(&value)[kValueBytes]) -> std::uint64_t {
      const Entered entered(o.gate ? &gate : nullptr);
      sqlite3_bind_blob(stmt, 1, key.data(), static_cast<int>(key.size()), SQLITE_STATIC);
      sqlite3_bind_blob(stmt, 2, value, sizeof value, SQLITE_STATIC);
      const int rc = sqlite3_step(stmt);
      sqlite3_reset(stmt);
      if (rc != SQLITE_DONE) fail(std::string("sqlite: upsert: ") + sqlite3_errstr(rc));
      if (const auto changed = sqlite3_changes(s.db); changed != 1) {
        fail("an upsert changed " + std::to_string(changed) + " rows");
      }
      return 0;
    });
    sqlite3_finalize(stmt);
  } catch (const std::exception& e) {
    w.error = e.what();
  }
}

std::vector<std::int64_t> checkLocal(const std::string& dir, const WriteOptions& o, int d) {
  Sqlite s(localFile(dir, o, d));
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(s.db, kCheck, -1, &stmt, nullptr) != SQLITE_OK) fail(sqlite3_errmsg(s.db));
  if (sqlite3_step(stmt) != SQLITE_ROW) fail("sqlite: the check returned no row");
  std::vector<std::int64_t> v{sqlite3_column_int64(stmt, 0), sqlite3_column_int64(stmt, 1)};
  sqlite3_finalize(stmt);
  return v;
}

int write(const Target& t, const WriteOptions& o) {
  if (t.dqlite) {
    prepareDqlite(t.where, o);
  } else {
    for (int d = 0; d < o.databases; ++d) {
      const auto file = localFile(t.where, o, d);
      if (std::filesystem::exists(file)) fail("local: " + file + " exists already; use a new --name");
      Sqlite(file).exec(kSchema);
    }
  }

  std::vector<Worker> workers(o.connections);
  std::vector<std::thread> threads;
  Gate gates[64];
  if (o.databases > 64) fail("write: at most 64 databases");
  const auto cpuUs = [] {
    rusage u{};
    getrusage(RUSAGE_SELF, &u);
    return (u.ru_utime.tv_sec + u.ru_stime.tv_sec) * 1000000LL + u.ru_utime.tv_usec + u.ru_stime.tv_usec;
  };
  const auto cpuAtStart = cpuUs();
  const auto start = Clock::now();
  const auto until = start + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(o.seconds));
  for (int i = 0; i < o.connections; ++i) {
    if (t.dqlite) {
      threads.emplace_back(dqliteWorker, std::cref(t.where), std::cref(o), i, until, std::ref(workers[i]),
                           std::ref(gates[i % o.databases]));
    } else {
      threads.emplace_back(localWorker, std::cref(t.where), std::cref(o), i, until, std::ref(workers[i]),
                           std::ref(gates[i % o.databases]));
    }
  }
  for (auto& th : threads) th.join();
  const double elapsed = std::chrono::duration<double>(Clock::now() - start).count();
  const auto cpu = cpuUs() - cpuAtStart;

  for (std::size_t i = 0; i < workers.size(); ++i) {
    if (!workers[i].error.empty()) fail("connection " + std::to_string(i) + ": " + workers[i].error);
  }

  // Every database must hold what was acknowledged, and nothing else.
  for (int d = 0; d < o.databases; ++d) {
    std::int64_t keys = 0, sum = 0;
    for (int i = d; i < o.connections; i += o.databases) {
      for (const auto seq : workers[i].lastSeq) {
        keys += seq > 0 ? 1 : 0;
        sum += static_cast<std::int64_t>(seq);
      }
    }
    const auto found = t.dqlite ? checkDqlite(t.where, o, d) : checkLocal(t.where, o, d);
    if (found[0] != keys || found[1] != sum) {
      fail("check of " + databaseName(o, d) + ": " + std::to_string(found[0]) + " rows with sequence sum " +
           std::to_string(found[1]) + ", expected " + std::to_string(keys) + " and " + std::to_string(sum));
    }
  }

  std::vector<float> all;
  std::uint64_t writes = 0, busy = 0;
  for (const auto& w : workers) {
    all.insert(all.end(), w.latencyUs.begin(), w.latencyUs.end());
    writes += w.writes;
    busy += w.busyRetries;
  }
  if (writes == 0) fail("write: no write was acknowledged");
  std::sort(all.begin(), all.end());
  const auto pct = [&](double p) { return all[std::min(all.size() - 1, static_cast<std::size_t>(p * all.size()))]; };
  std::printf(
      "{\"side\":\"%s\",\"connections\":%d,\"databases\":%d,\"writes\":%llu,\"writes_per_sec\":%.1f,"
      "\"p50_us\":%.0f,\"p99_us\":%.0f,\"busy_retries\":%llu,\"cpu_us\":%lld,\"gate\":%s,\"checked\":true}\n",
      t.dqlite ? "dqlite" : "local", o.connections, o.databases, static_cast<unsigned long long>(writes),
      writes / elapsed, pct(0.50), pct(0.99), static_cast<unsigned long long>(busy), static_cast<long long>(cpu),
      o.gate ? "true" : "false");
  return 0;
}

int usage() {
  std::fprintf(stderr,
               "usage: dqlite_bench free-ports N\n"
               "       dqlite_bench node ID ADDRESS DIR\n"
               "       dqlite_bench form ADDRESS1 ADDRESS2 ...\n"
               "       dqlite_bench members ADDRESS\n"
               "       dqlite_bench write (dqlite ADDRESS | local DIR) [--connections C] [--databases D]\n"
               "                    [--seconds S] [--name PREFIX] [--no-gate]\n");
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  try {
    if (args.size() == 2 && args[0] == "free-ports") return freePorts(std::stoi(args[1]));
    if (args.size() == 4 && args[0] == "node") return runNode(std::stoull(args[1]), args[2], args[3]);
    if (args.size() >= 2 && args[0] == "form") return form({args.begin() + 1, args.end()});
    if (args.size() == 2 && args[0] == "members") return members(args[1]);
    if (args.size() >= 3 && args[0] == "write" && (args[1] == "dqlite" || args[1] == "local")) {
      Target t{args[1] == "dqlite", args[2]};
      WriteOptions o;
      for (std::size_t i = 3; i < args.size(); i += 2) {
        if (args[i] == "--no-gate") {
          o.gate = false;
          --i;
          continue;
        }
        if (i + 1 >= args.size()) return usage();
        const auto& k = args[i];
        const auto& v = args[i + 1];
        if (k == "--connections") {
          o.connections = std::stoi(v);
        } else if (k == "--databases") {
          o.databases = std::stoi(v);
        } else if (k == "--seconds") {
          o.seconds = std::stod(v);
        } else if (k == "--name") {
          o.name = v;
        } else {
          return usage();
        }
      }
      if (o.connections < 1 || o.databases < 1 || o.databases > o.connections) return usage();
      return write(t, o);
    }
  } catch (const std::exception& e) {
    std::fprintf(stderr, "dqlite_bench: %s\n", e.what());
    return 1;
  }
  return usage();
}
