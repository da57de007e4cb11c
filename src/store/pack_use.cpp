// The use list of a pack: its editors and the holder of its upload lock.
//
// A client changes the list by sending one use entry with a pack request;
// the change runs inside that request's write transaction, so the list is
// read and written back by one writer at a time, and a refusal rolls the
// whole request back.

#include <string>
#include <string_view>

#include "engine/db_exc.h"
#include "framework/log.h"
#include "store/db_local.h"

namespace DB {

void DBLocal::logUseChange(const std::string& id, std::string_view transition, const Ipc::UseInfo& entry) const {
  Log::Lock log(Log::Debug);
  auto& line = log.logStreamLine();
  line << "DB:updateUseInfo S:" << sessionId() << " Pack " << id << ' ' << transition << " host \"" << entry.host
       << '"';
  // Entries without user and process come from the server's own tools.
  if (entry.user.empty() && entry.process == 0) {
    line << " CVSvc";
  } else {
    line << " user \"" << entry.user << "\" process " << entry.process;
  }
}

std::optional<Ipc::UseInfos> DBLocal::updateUseInfo(json::Object& stored, const Ipc::PackInfo& request,
                                                    bool useUpdate) {
  using Ipc::UseInfo;
  const std::string& id = request.id();
  const auto note = [&](std::string_view transition, const UseInfo& entry) {
    if (g_LogVerbose) logUseChange(id, transition, entry);
  };

  // Entries older than the limit are dropped here, and so vanish from the
  // stored list with this write.
  const std::int64_t now = env_.nowSeconds();
  Ipc::UseInfos uses(stored.get(Ipc::PackInfoPartial::USE_FIELD_NAME), Ipc::kUseLimitSeconds, now);
  bool handBack = useUpdate;
  if (!request.uses.empty()) {
    const UseInfo& u = request.uses.front();
    switch (u.state) {
      case UseInfo::OpenForEdit:
        // Not merged: a process that opens twice is listed twice and
        // closes twice.
        uses.append(UseInfo(u, now));
        note("opened for edit", u);
        handBack = true;
        break;
      case UseInfo::LockForUpload:
        handBack = true;
        if (const UseInfo* held = uses.findUploadInf()) {
          // The lock is per host: another process of the same host takes
          // it over, another host is refused.
          if (held->host != u.host) {
            note("upload request denied - already uploading", u);
            throw DBExc("Attept to lock for upload a pack which is already locked from another host.");
          }
          note("updating old upload lock by", *held);
          uses.remove(held);
        }
        uses.append(UseInfo(u, now));
        note("sheduled for upload by", u);
        break;
      case UseInfo::CloseEdit:
        if (const UseInfo* editor = uses.find(u.host, u.process, UseInfo::OpenForEdit)) {
          uses.remove(editor);
          note("closed", u);
        } else {
          note("close requested but lock not found", u);
        }
        break;
      case UseInfo::EndUpload:
        if (const UseInfo* held = uses.findUploadInf(); held && held->host == u.host) {
          uses.remove(held);
          note("ended upload", u);
        } else {
          note("failed to end upload", u);
          throw DBExc("Failed unlock for upload");
        }
        break;
      default:
        break;  // carried, changes nothing
    }
  }

  if (uses.empty()) {
    stored.erase(Ipc::PackInfoPartial::USE_FIELD_NAME);
  } else {
    json::Object list;
    uses.serialize(list);
    stored.set(Ipc::PackInfoPartial::USE_FIELD_NAME, list);
  }
  if (handBack) return uses;
  return std::nullopt;
}

}  // namespace DB
