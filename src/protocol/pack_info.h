#pragma once
// Pack records and their use lists, shared by the server's store and the
// clients.
//
// A pack record (PackInfo) is the pack's id, folder and status (columns of
// the store's "info" table) plus the fields of PackInfoPartial, which the
// store keeps in one JSON object per pack together with the use list.
// Every field but the id may be absent, so that one type serves complete
// records and partial updates: absent strings hold STR_INVALID, absent
// numbers LONG_INVALID, absent times TIME_INVALID.
//
// Stored JSON form (docs/protocol.md has the full description):
//   { "name": "...", "owner": "...", "created": <int>, "modified": <int>,
//     "docCount": <int>, "uses": { "entries": [ <use entry>, ... ] } }
// Keys this version does not know are left alone by every write.
//
// Reading a stored use list drops entries older than the given limit in
// seconds (the store passes kUseLimitSeconds, seven hours), so that a
// crashed client's editor entry or upload lock does not live forever.
//
// Thread safety: plain values; one writer at a time. Failures: reading a
// stored object never throws for odd content (fields of the wrong type read
// as absent, malformed use entries are dropped); serialize and
// serializeDBUpdate throw json::Exc or std::bad_alloc only.

#include <cstdint>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "framework/json.h"

namespace Ipc {

// The use-list limit every read of a stored list passes: seven hours.
inline constexpr std::uint64_t kUseLimitSeconds = 25200;

// The oldest time stamp that a read of a stored use list with this limit
// keeps at time now (seconds since 1970-01-01 UTC, the clock that stamps
// use entries); the smallest int64 when limit 0 keeps every entry.
std::int64_t oldestUseKept(std::uint64_t limit, std::int64_t now) noexcept;

// One user or lock of a pack.
class UseInfo {
 public:
  // What the entry is (in a stored list) or what a request asks. Requests
  // may carry other values, which change nothing.
  enum State : std::int32_t {
    OpenForEdit = 0,
    LockForUpload = 2,
    CloseEdit = 100,
    EndUpload = 101,
  };

  static constexpr std::int64_t TIME_INVALID = std::numeric_limits<std::int64_t>::min();

  UseInfo() = default;
  UseInfo(State s, std::string h, std::string u, std::uint32_t p, std::int64_t t = TIME_INVALID)
      : state(s), host(std::move(h)), user(std::move(u)), process(p), time(t) {}
  // A copy of other stamped with time t (how the store records a request).
  UseInfo(const UseInfo& other, std::int64_t t) : UseInfo(other) { time = t; }

  State state = OpenForEdit;
  std::string host;
  std::string user;                  // may be empty
  std::uint32_t process = 0;         // may be 0
  std::int64_t time = TIME_INVALID;  // seconds since the epoch

  bool operator==(const UseInfo&) const = default;
};

// The users and locks of one pack, in the order in which they were added.
class UseInfos {
 public:
  UseInfos() = default;
  // Reads a stored list (the value under PackInfoPartial::USE_FIELD_NAME;
  // an empty value reads as an empty list). Entries older than limit
  // seconds are dropped; limit 0 keeps every entry. Entries that are not
  // well-formed are dropped too. Keys this version does not know, of the
  // list's object and of each entry, are kept and written back by
  // serialize() (for the entries that are still in the list).
  UseInfos(const json::Value& stored, std::uint64_t limit, std::int64_t now);

  // The entry with this host, process and state, or null. The pointer is
  // valid until the list changes.
  const UseInfo* find(const std::string& host, std::uint32_t process, UseInfo::State state) const;
  // The upload lock: the first entry in state LockForUpload, or null.
  const UseInfo* findUploadInf() const;
  // Removes the entry that e points to (from find or findUploadInf);
  // returns false if e is not an entry of this list.
  bool remove(const UseInfo* e);
  // Drops the entries stamped before oldest: what a read of the stored
  // list with the limit that oldestUseKept turned into oldest drops.
  void dropOlderThan(std::int64_t oldest);
  void append(UseInfo entry) {
    entries_.push_back(std::move(entry));
    stored_.emplace_back();
  }

  bool empty() const noexcept { return entries_.empty(); }
  std::size_t size() const noexcept { return entries_.size(); }
  const UseInfo& front() const { return entries_.front(); }
  const UseInfo& operator[](std::size_t i) const { return entries_[i]; }
  std::vector<UseInfo>::const_iterator begin() const noexcept { return entries_.begin(); }
  std::vector<UseInfo>::const_iterator end() const noexcept { return entries_.end(); }

  // Writes the list into out (a fresh object, set afterwards under
  // USE_FIELD_NAME): the key "entries" with an array of entries (none when
  // the list is empty), and the other keys the stored list had.
  void serialize(json::Object& out) const;
  // Whether the stored list had keys beside "entries".
  bool hasOtherKeys() const noexcept;

  // The entries; what else the stored list held does not count.
  bool operator==(const UseInfos& other) const { return entries_ == other.entries_; }

 private:
  std::vector<UseInfo> entries_;
  std::vector<json::Value> stored_;  // each entry as stored (empty for new ones)
  json::Value storedList_;           // the stored list's object, for its other keys
};

// The fields of a pack record that the store keeps in its JSON object.
class PackInfoPartial {
 public:
  static inline const std::string STR_INVALID{"\x7f<absent>\x7f"};
  static constexpr std::int32_t LONG_INVALID = std::numeric_limits<std::int32_t>::min();
  static constexpr std::int64_t TIME_INVALID = UseInfo::TIME_INVALID;
  // Key of the use list in the stored object.
  static inline const std::string USE_FIELD_NAME{"uses"};

  PackInfoPartial() = default;
  // The fields and the use list of a stored object; the use list passes the
  // limit (see UseInfos).
  PackInfoPartial(const json::Object& stored, std::uint64_t useLimit, std::int64_t now);
  // The fields of a stored object with a use list of the caller's.
  PackInfoPartial(const json::Object& stored, UseInfos useList);

  std::string name = STR_INVALID;        // display name
  std::string owner = STR_INVALID;       // who created the pack
  std::int64_t created = TIME_INVALID;   // seconds since the epoch
  std::int64_t modified = TIME_INVALID;  // seconds since the epoch
  std::int32_t docCount = LONG_INVALID;  // number of documents
  UseInfos uses;

  // Every field of this part is present (the use list always is).
  bool allValid() const noexcept;
  // Writes the present fields into obj; absent fields, the use list and
  // keys this version does not know are left as they are.
  void serializeDBUpdate(json::Object& obj) const;

  bool operator==(const PackInfoPartial&) const = default;
};

// A pack record: id, folder, status and the partial fields.
class PackInfo : public PackInfoPartial {
 public:
  PackInfo() = default;
  // Only the id: every other field absent, no uses.
  explicit PackInfo(std::string id) : id_(std::move(id)) {}
  PackInfo(std::string id, std::string folder, std::int32_t status, PackInfoPartial partial)
      : PackInfoPartial(std::move(partial)), id_(std::move(id)), folder_(std::move(folder)), status_(status) {}

  const std::string& id() const noexcept { return id_; }
  const std::string& folder() const noexcept { return folder_; }
  std::int32_t status() const noexcept { return status_; }
  void setId(std::string id) { id_ = std::move(id); }
  void setFolder(std::string folder) { folder_ = std::move(folder); }
  void setStatus(std::int32_t status) noexcept { status_ = status; }

  bool folderValid() const noexcept { return folder_ != STR_INVALID; }
  bool statusValid() const noexcept { return status_ != LONG_INVALID; }
  // A complete record: folder, status and every partial field present.
  bool allValid() const noexcept;

  bool operator==(const PackInfo&) const = default;

 private:
  std::string id_;
  std::string folder_ = STR_INVALID;
  std::int32_t status_ = LONG_INVALID;
};

using PackInfoPtr = std::shared_ptr<PackInfo>;
using PackInfos = std::vector<PackInfo>;
using PackInfosPtr = std::shared_ptr<PackInfos>;

}  // namespace Ipc
