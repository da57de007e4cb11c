// Pack records in table "info" and pack contents in table "meta".

#include <memory>
#include <string>
#include <string_view>

#include "engine/db_exc.h"
#include "engine/db_instances.h"
#include "framework/log.h"
#include "store/cached_reads.h"
#include "store/db_local.h"
#include "store/pack_sql.h"
#include "store/stored_record_reader.h"

namespace DB {
namespace {

// About what a record's row takes, for the commit queue's group bound.
constexpr std::uint64_t kRecordBytes = 1024;

void logInfoFor(std::uint64_t session, const std::string& id, const Ipc::PackInfoPtr& info) {
  Log::Lock entry(Log::Debug);
  auto& line = entry.logStreamLine();
  line << "DB:infoFor S:" << session;
  if (info) {
    line << " Returning " << (info->allValid() ? "full info for " : "info for ") << id;
  } else {
    line << " Can not find info for " << id;
  }
}

// The record as the cache keeps it: the use entries alone, without the
// stored JSON of each (which only a write needs), so that copies made by
// concurrent readers share nothing but immutable bytes.
Ipc::PackInfo keptRecord(Ipc::PackInfo record) {
  Ipc::UseInfos uses;
  for (const Ipc::UseInfo& u : record.uses) uses.append(u);
  record.uses = std::move(uses);
  return record;
}

bool isCloseEdit(const Ipc::PackInfo& request) {
  return !request.uses.empty() && request.uses.front().state == Ipc::UseInfo::CloseEdit;
}

}  // namespace

std::uint64_t cachedBytes(const std::optional<Ipc::PackInfo>& record) noexcept {
  if (!record) return 0;
  std::uint64_t bytes = sizeof(Ipc::PackInfo) + record->id().size() + record->folder().size() + record->name.size() +
                        record->owner.size();
  for (const Ipc::UseInfo& u : record->uses) bytes += sizeof(Ipc::UseInfo) + u.host.size() + u.user.size();
  return bytes;
}

Ipc::PackInfo DBLocal::readInfo(const engine::Statement& row, std::uint64_t useLimit) const {
  Ipc::PackInfo info(std::string(row.columnBytes(0)));
  info.setFolder(std::string(row.columnBytes(1)));
  info.setStatus(static_cast<std::int32_t>(row.columnInt64(2)));
  const std::string_view blob = row.columnBytes(3);
  // Every writer stores an object with the row; an empty value (a row
  // written by hand) reads as a record without further fields. The text is
  // streamed into the record's fields, with no JSON tree in between.
  if (!blob.empty()) Ipc::readStoredPackInfo(blob, useLimit, useLimit == 0 ? 0 : env_.nowSeconds(), info);
  return info;
}

Ipc::PackInfosPtr DBLocal::infos(const std::string& folder) {
  auto& s = session();
  auto list = std::make_shared<Ipc::PackInfos>();
  auto rows = s.prepare(folder.empty() ? pack_sql::kAllInfos : pack_sql::kInfosOfFolder);
  if (!folder.empty()) rows.bindBlob(1, folder);
  // One statement: the whole listing comes from one snapshot.
  while (rows.step()) list->push_back(readInfo(rows));
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << "DB:infos S:" << s.id() << " Returning " << list->size() << " item(s) for folder \"" << folder << '"';
  }
  return list;
}

Ipc::PackInfoPtr DBLocal::infoFor(const std::string& id) {
  session();  // a closed store refuses, hit or not
  ReadCache& cache = pool_->readCache();
  ReadCache::Ticket ticket;
  auto stored = cache.find(kCachedPackRecords, name_, id, ticket);
  if (!stored) {
    std::optional<Ipc::PackInfo> record;
    {
      auto row = session().prepare(pack_sql::kSelectInfo);
      row.bindBlob(1, id);
      // The whole use list: the time limit applies below, on every read.
      if (row.step()) record = keptRecord(readInfo(row, 0));
    }
    const std::uint64_t bytes = cachedBytes(record);
    stored = std::make_shared<const std::optional<Ipc::PackInfo>>(std::move(record));
    cache.insert(kCachedPackRecords, ticket, name_, id, stored, bytes);
  }
  Ipc::PackInfoPtr info;
  if (*stored) {
    info = std::make_shared<Ipc::PackInfo>(**stored);
    info->uses.dropOlderThan(Ipc::oldestUseKept(Ipc::kUseLimitSeconds, env_.nowSeconds()));
  }
  if (g_LogVerbose) logInfoFor(sessionId(), id, info);
  return info;
}

Ipc::PackInfoPtr DBLocal::upsertInfo(const Ipc::PackInfo& request, bool useUpdate) {
  auto& s = session();
  const std::string& id = request.id();

  // The stored state, read inside the caller's write transaction: no other
  // writer can change it before this one commits.
  bool exists = false;
  std::string storedFolder;
  std::int32_t storedStatus = Ipc::PackInfoPartial::LONG_INVALID;
  json::Object stored;
  {
    auto row = s.prepare(pack_sql::kSelectInfo);
    row.bindBlob(1, id);
    exists = row.step();
    if (exists) {
      storedFolder.assign(row.columnBytes(1));
      storedStatus = static_cast<std::int32_t>(row.columnInt64(2));
      const std::string_view blob = row.columnBytes(3);
      if (!blob.empty()) stored = json::strToObject(blob);
    }
  }
  if (!exists && !request.allValid()) {
    // Closing a pack that is gone is what a client does when it cleans up;
    // there is nothing to close.
    if (isCloseEdit(request)) return nullptr;
    throw DBExc("Pack information update attempted for missing record. Id:" + id);
  }

  // Only the fields the request carries are written; everything else in
  // the object (the use list, keys of other versions) stays.
  request.serializeDBUpdate(stored);
  std::optional<Ipc::UseInfos> newUses;
  if (useUpdate || !request.uses.empty()) newUses = updateUseInfo(stored, request, useUpdate);

  const std::string& folder = request.folderValid() ? request.folder() : storedFolder;
  const std::int32_t status = request.statusValid() ? request.status() : storedStatus;
  const std::string text = stored.dump();
  {
    auto write = s.prepare(exists ? pack_sql::kUpdateInfo : pack_sql::kInsertInfo);
    write.bindBlob(1, id).bindBlob(2, folder).bindInt64(3, status).bindBlob(4, text);
    write.run();
  }
  if (s.changes() != 1) throw DBExc("Failed to find previously updated/inserted record. Id:" + id);

  if (useUpdate) {
    return std::make_shared<Ipc::PackInfo>(id, folder, status, Ipc::PackInfoPartial(stored, std::move(*newUses)));
  }
  auto result = std::make_shared<Ipc::PackInfo>(id);
  result->setStatus(status);
  if (newUses) result->uses = std::move(*newUses);
  return result;
}

Ipc::PackInfoPtr DBLocal::updateInfo(const Ipc::PackInfo& request) {
  const InvalidateOnExit written(pool_->readCache(), name_, request.id());
  Ipc::PackInfoPtr result = write(kRecordBytes, [&] { return upsertInfo(request, false); });
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DB:updateInfo S:" << sessionId() << " Info for " << request.id()
                                          << (request.allValid() ? " fully updated" : " updated");
  }
  return result;
}

void DBLocal::savePackMeta(const Ipc::PackInfo& request, const void* content, std::uint64_t length) {
  const InvalidateOnExit written(pool_->readCache(), name_, request.id());
  const bool stored = write(kRecordBytes + length, [&] {
    // No record means a CloseEdit for a missing pack: a content without a
    // record could be neither fetched nor erased.
    if (!upsertInfo(request, false)) return false;
    putMeta(request.id(), content, length);
    return true;
  });
  if (stored && g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << "DB:savePackMeta S:" << sessionId() << " Stored pack metadata for " << request.id();
  }
}

DBLocal::PackMeta DBLocal::packMetadata(const Ipc::PackInfo& request) {
  const std::string& id = request.id();
  if (request.uses.empty()) {
    PackMeta found;
    auto row = session().prepare(pack_sql::kSelectInfo);
    row.bindBlob(1, id);
    if (row.step()) {
      found.info = std::make_shared<Ipc::PackInfo>(readInfo(row));
      // The record's statement still stands on its row, so the read
      // snapshot it opened is still the connection's: the content comes
      // from the same state as the record, never from a save that
      // committed in between.
      found.content = readMeta(id);
    }
    if (g_LogVerbose) {
      logInfoFor(sessionId(), id, found.info);
      Log::Lock(Log::Debug).logStreamLine()
          << "DB:packMetadata S:" << sessionId() << " Returning pack metadata for " << id;
    }
    return found;
  }

  const InvalidateOnExit written(pool_->readCache(), name_, id);
  PackMeta changed = write(kRecordBytes, [&] {
    PackMeta m;
    m.info = upsertInfo(request, true);
    // A pack without record has no content to hand out.
    if (m.info) m.content = readMeta(id);
    return m;
  });
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine()
        << "DB:packMetadata S:" << sessionId() << " Returning pack metadata for " << id << ". Pack use updated";
  }
  return changed;
}

void DBLocal::removePack(const std::string& id) {
  const InvalidateOnExit written(pool_->readCache(), name_, id);
  const bool removed = write(kRecordBytes, [&] {
    auto& s = session();
    {
      auto del = s.prepare(pack_sql::kDeleteInfo);
      del.bindBlob(1, id);
      del.run();
    }
    // Without a record the key may well be a configuration part's: the
    // content row goes only with its record.
    if (s.changes() == 0) return false;
    deleteMeta(id);
    return true;
  });
  if (removed && g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DB:removePack S:" << sessionId() << " Deleted pack metadata for " << id;
  }
}

}  // namespace DB
