#include "protocol/pack_info.h"

#include <jansson.h>

#include <cstring>
#include <initializer_list>

namespace Ipc {
namespace {

constexpr const char* kEntriesKey = "entries";
constexpr const char* kName = "name";
constexpr const char* kOwner = "owner";
constexpr const char* kCreated = "created";
constexpr const char* kModified = "modified";
constexpr const char* kDocCount = "docCount";

// Stored values of the wrong type read as absent: a record written by
// another version or edited by hand must still be listable.
std::string storedString(const json::Object& o, const char* key) {
  const json::Value v = o.get(key);
  if (!v.isString()) return PackInfoPartial::STR_INVALID;
  return v.asString();
}

std::int64_t storedTime(const json::Object& o, const char* key) {
  const json::Value v = o.get(key);
  if (!v.isInteger()) return PackInfoPartial::TIME_INVALID;
  return v.asInteger();
}

std::int32_t storedLong(const json::Object& o, const char* key) {
  const json::Value v = o.get(key);
  if (!v.isInteger()) return PackInfoPartial::LONG_INVALID;
  const std::int64_t n = v.asInteger();
  if (n <= std::numeric_limits<std::int32_t>::min() || n > std::numeric_limits<std::int32_t>::max()) {
    return PackInfoPartial::LONG_INVALID;
  }
  return static_cast<std::int32_t>(n);
}

// One stored use entry, or false when it is not well-formed.
bool readEntry(json_t* e, UseInfo& out) {
  if (!json_is_object(e)) return false;
  const json::Object o(json::Value::borrow(e));
  const json::Value state = o.get("state");
  const json::Value host = o.get("host");
  const json::Value user = o.get("user");
  const json::Value process = o.get("process");
  const json::Value time = o.get("time");
  if (!state.isInteger() || !host.isString() || !time.isInteger()) return false;
  const std::int64_t s = state.asInteger();
  if (s < std::numeric_limits<std::int32_t>::min() || s > std::numeric_limits<std::int32_t>::max()) return false;
  std::int64_t p = 0;
  if (process.isInteger()) {
    p = process.asInteger();
    if (p < 0 || p > std::numeric_limits<std::uint32_t>::max()) return false;
  }
  out.state = static_cast<UseInfo::State>(s);
  out.host = host.asString();
  out.user = user.isString() ? user.asString() : std::string();
  out.process = static_cast<std::uint32_t>(p);
  out.time = time.asInteger();
  return true;
}

json::Value entryToJson(const UseInfo& u) {
  json::Object o;
  o.set("state", json::Value::integer(u.state));
  o.set("host", json::Value::string(u.host));
  o.set("user", json::Value::string(u.user));
  o.set("process", json::Value::integer(u.process));
  o.set("time", json::Value::integer(u.time));
  return o;
}

}  // namespace

std::int64_t oldestUseKept(std::uint64_t limit, std::int64_t now) noexcept {
  if (limit == 0 || limit > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
    return std::numeric_limits<std::int64_t>::min();
  }
  // Saturates: a clock set far into the past must not overflow.
  const auto span = static_cast<std::int64_t>(limit);
  return now < std::numeric_limits<std::int64_t>::min() + span ? std::numeric_limits<std::int64_t>::min() : now - span;
}

UseInfos::UseInfos(const json::Value& stored, std::uint64_t limit, std::int64_t now) {
  if (!stored.isObject()) return;
  json_t* list = json_object_get(stored.get(), kEntriesKey);
  if (!json_is_array(list)) return;
  storedList_ = stored;
  const std::int64_t oldest = oldestUseKept(limit, now);
  const std::size_t n = json_array_size(list);
  entries_.reserve(n);
  for (std::size_t i = 0; i < n; ++i) {
    UseInfo u;
    json_t* entry = json_array_get(list, i);
    if (!readEntry(entry, u)) continue;
    if (u.time < oldest) continue;
    entries_.push_back(std::move(u));
    stored_.push_back(json::Value::borrow(entry));
  }
}

bool UseInfos::hasOtherKeys() const noexcept {
  if (!storedList_.isObject()) return false;
  const std::size_t n = json_object_size(storedList_.get());
  return n > (json_object_get(storedList_.get(), kEntriesKey) != nullptr ? 1u : 0u);
}

void UseInfos::dropOlderThan(std::int64_t oldest) {
  std::size_t kept = 0;
  for (std::size_t i = 0; i < entries_.size(); ++i) {
    if (entries_[i].time < oldest) continue;
    if (kept != i) {
      entries_[kept] = std::move(entries_[i]);
      stored_[kept] = std::move(stored_[i]);
    }
    ++kept;
  }
  entries_.resize(kept);
  stored_.resize(kept);
}

const UseInfo* UseInfos::find(const std::string& host, std::uint32_t process, UseInfo::State state) const {
  for (const UseInfo& u : entries_) {
    if (u.state == state && u.process == process && u.host == host) return &u;
  }
  return nullptr;
}

const UseInfo* UseInfos::findUploadInf() const {
  for (const UseInfo& u : entries_) {
    if (u.state == UseInfo::LockForUpload) return &u;
  }
  return nullptr;
}

bool UseInfos::remove(const UseInfo* e) {
  for (std::size_t i = 0; i < entries_.size(); ++i) {
    if (&entries_[i] == e) {
      entries_.erase(entries_.begin() + static_cast<std::ptrdiff_t>(i));
      if (i < stored_.size()) stored_.erase(stored_.begin() + static_cast<std::ptrdiff_t>(i));
      return true;
    }
  }
  return false;
}

// Copies the members of from that this version does not set into to.
static void keepOtherKeys(json_t* from, json_t* to, std::initializer_list<const char*> known) {
  const char* key = nullptr;
  json_t* value = nullptr;
  json_object_foreach(from, key, value) {
    bool isKnown = false;
    for (const char* k : known) isKnown = isKnown || std::strcmp(k, key) == 0;
    if (isKnown) continue;
    json_t* copy = json_deep_copy(value);
    if (copy == nullptr || json_object_set_new(to, key, copy) != 0) throw std::bad_alloc();
  }
}

void UseInfos::serialize(json::Object& out) const {
  if (storedList_.isObject())
    keepOtherKeys(storedList_.get(), static_cast<const json::Value&>(out).get(), {kEntriesKey});
  if (entries_.empty()) return;
  json::Value list = json::Value::steal(json_array());
  if (list.empty()) throw std::bad_alloc();
  for (std::size_t i = 0; i < entries_.size(); ++i) {
    const json::Value e = entryToJson(entries_[i]);
    if (i < stored_.size() && stored_[i].isObject()) {
      keepOtherKeys(stored_[i].get(), e.get(), {"state", "host", "user", "process", "time"});
    }
    if (json_array_append(list.get(), e.get()) != 0) throw std::bad_alloc();
  }
  out.set(kEntriesKey, list);
}

PackInfoPartial::PackInfoPartial(const json::Object& stored, std::uint64_t useLimit, std::int64_t now)
    : PackInfoPartial(stored, UseInfos(stored.get(USE_FIELD_NAME), useLimit, now)) {}

PackInfoPartial::PackInfoPartial(const json::Object& stored, UseInfos useList)
    : name(storedString(stored, kName)),
      owner(storedString(stored, kOwner)),
      created(storedTime(stored, kCreated)),
      modified(storedTime(stored, kModified)),
      docCount(storedLong(stored, kDocCount)),
      uses(std::move(useList)) {}

bool PackInfoPartial::allValid() const noexcept {
  return name != STR_INVALID && owner != STR_INVALID && created != TIME_INVALID && modified != TIME_INVALID &&
         docCount != LONG_INVALID;
}

void PackInfoPartial::serializeDBUpdate(json::Object& obj) const {
  if (name != STR_INVALID) obj.set(kName, json::Value::string(name));
  if (owner != STR_INVALID) obj.set(kOwner, json::Value::string(owner));
  if (created != TIME_INVALID) obj.set(kCreated, json::Value::integer(created));
  if (modified != TIME_INVALID) obj.set(kModified, json::Value::integer(modified));
  if (docCount != LONG_INVALID) obj.set(kDocCount, json::Value::integer(docCount));
}

bool PackInfo::allValid() const noexcept { return folderValid() && statusValid() && PackInfoPartial::allValid(); }

}  // namespace Ipc
