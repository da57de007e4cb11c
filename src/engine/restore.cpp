#include "engine/restore.h"

#include <algorithm>
#include <array>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "engine/connection.h"
#include "engine/database_file.h"
#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/instance.h"
#include "framework/log.h"

namespace engine {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kCopyChunk = 4 * 1024 * 1024;

// The copy in the destination folder, removed unless it was put in place.
class StagedFile {
 public:
  StagedFile(sys::Env& env, fs::path file) : env_(env), file_(std::move(file)) {}
  ~StagedFile() {
    if (file_.empty()) return;
    for (const auto& f : {file_, walFile(file_), shmFile(file_), journalFile(file_)}) {
      try {
        env_.remove(f);
      } catch (const std::system_error&) {
        // The restore's own failure is the one reported.
      }
    }
  }
  StagedFile(const StagedFile&) = delete;
  StagedFile& operator=(const StagedFile&) = delete;
  const fs::path& path() const { return file_; }
  void placed() { file_.clear(); }

 private:
  sys::Env& env_;
  fs::path file_;
};

// The destination's write-ahead log and index, set aside while the restored
// file takes the database file's place and brought back if that fails: a
// log may hold committed transactions that no checkpoint has moved into
// the file yet. Once the new file is in place they are stale (replayed
// onto the restored file they would corrupt it) and are removed.
class SetAside {
 public:
  SetAside(sys::Env& env, const fs::path& target) : env_(env) {
    try {
      for (const auto& f : {walFile(target), shmFile(target), journalFile(target)}) {
        if (env_.stat(f).type == sys::FileType::Missing) continue;
        fs::path aside = f;
        aside += ".replaced";
        env_.rename(f, aside);
        moved_.emplace_back(f, aside);
      }
    } catch (...) {
      bringBack();
      throw;
    }
  }
  ~SetAside() {
    if (placed_) {
      removeAside();
    } else {
      bringBack();
    }
  }
  SetAside(const SetAside&) = delete;
  SetAside& operator=(const SetAside&) = delete;
  void placed() { placed_ = true; }

 private:
  void bringBack() noexcept { settle(false); }
  void removeAside() noexcept { settle(true); }
  void settle(bool remove) noexcept {
    for (const auto& [original, aside] : moved_) {
      try {
        if (remove) {
          env_.remove(aside);
        } else {
          env_.rename(aside, original);
        }
      } catch (const std::system_error& e) {
        Log::Lock(Log::Error).logStreamLine() << "Engine: restore could not " << (remove ? "remove" : "bring back")
                                              << " \"" << aside.string() << "\": " << e.what();
      }
    }
    moved_.clear();
  }

  sys::Env& env_;
  std::vector<std::pair<fs::path, fs::path>> moved_;
  bool placed_ = false;
};

[[noreturn]] void refuse(const fs::path& backupFolder, const std::string& reason, const std::source_location& where) {
  Log::Lock(Log::Warning).logStreamLine()
      << "Engine: restore from \"" << backupFolder.string() << "\" refused: " << reason;
  DB::throwEngineError(DB::err::kBadBackupFormat, where);
}

bool isOurs(const FileHeader& header) { return header.applicationId == kApplicationId; }

// The database file of the backup: the one under the configured name, or
// else the only file that carries our identity (a backup taken while the
// server used another file name). Only a regular file is taken: a link
// could lead anywhere on the machine, and a link or folder under the
// configured name is refused rather than passed over for another file.
fs::path findDatabase(sys::Env& env, const fs::path& folder, const std::string& fileName,
                      const std::source_location& where) {
  const auto named = onFiles(where, [&] { return env.stat(folder / fileName).type; });
  if (named == sys::FileType::Regular) return folder / fileName;
  if (named != sys::FileType::Missing) refuse(folder, "\"" + fileName + "\" is not a regular file", where);
  const auto entries = onFiles(where, [&] { return env.list(folder); });
  std::optional<fs::path> found;
  for (const auto& entry : entries) {
    if (entry.type != sys::FileType::Regular) continue;
    const auto header = readHeader(env, folder / entry.name);
    if (!header || !isOurs(*header)) continue;
    if (found) refuse(folder, "two files of this server in it and none named \"" + fileName + "\"", where);
    found = folder / entry.name;
  }
  if (!found) refuse(folder, "no database file \"" + fileName + "\" of this server in it", where);
  return *found;
}

// The header's facts that the copy relies on: a SQLite page size (a power
// of two from 512 to 65,536; another value would divide by zero or
// misplace every page) and, when the header records one, a page count the
// file's size can hold.
FileHeader checkHeader(sys::Env& env, const fs::path& backupFolder, const fs::path& file,
                       const std::source_location& where) {
  const std::string name = "\"" + file.filename().string() + "\"";
  const auto header = readHeader(env, file);
  if (!header) refuse(backupFolder, name + " is not a database of this engine", where);
  if (!isOurs(*header) || header->userVersion < 1)
    refuse(backupFolder, name + " is not a database of this server", where);
  if (header->userVersion > kFormatVersion) {
    refuse(backupFolder,
           name + " has format version " + std::to_string(header->userVersion) + ", newer than this server's " +
               std::to_string(kFormatVersion),
           where);
  }
  const std::uint32_t page = header->pageSize;
  if (page < 512 || page > 65536 || (page & (page - 1)) != 0) {
    refuse(backupFolder, name + " has an invalid page size (" + std::to_string(page) + ")", where);
  }
  const auto size = onFiles(where, [&] { return env.stat(file, true).size; });
  if (header->pageCount && size < std::uint64_t{*header->pageCount} * page) {
    refuse(backupFolder,
           name + " is truncated (" + std::to_string(size) + " bytes of " +
               std::to_string(std::uint64_t{*header->pageCount} * page) + ")",
           where);
  }
  return *header;
}

// Copies each file's bytes into a new file (created or truncated), synced,
// and reports the progress over all of them in pages.
void copyFiles(sys::Env& env, const std::vector<std::pair<fs::path, fs::path>>& files, std::uint32_t pageSize,
               const StatusCallback& status, const std::source_location& where) {
  onFiles(where, [&] {
    std::vector<std::unique_ptr<sys::File>> inputs;
    std::uint64_t bytes = 0;
    for (const auto& [from, to] : files) {
      inputs.push_back(env.open(from, sys::OpenMode::Read));
      bytes += inputs.back()->size();
    }
    const auto pages = [pageSize](std::uint64_t n) {
      return static_cast<std::uint32_t>((n + pageSize - 1) / pageSize);
    };
    const auto total = pages(bytes);
    std::vector<char> buffer(kCopyChunk);
    std::uint64_t copied = 0;
    std::uint64_t lastPercent = 0;
    for (std::size_t i = 0; i < files.size(); ++i) {
      const auto out = env.open(files[i].second, sys::OpenMode::CreateOrTruncate);
      for (std::size_t n; (n = inputs[i]->read(buffer.data(), buffer.size())) > 0;) {
        out->write(buffer.data(), n);
        copied += n;
        const auto done = pages(copied);
        const std::uint64_t percent = total == 0 ? 100 : std::uint64_t{done} * 100 / total;
        if (status && percent > lastPercent) {
          status({SnapshotOperation::Restore, StatusKind::Progress, done, total});
          lastPercent = percent;
        }
      }
      out->sync();
      out->close();
    }
  });
}

// The write-ahead log of a database copied while it was open holds
// transactions that no checkpoint has moved into the file yet. Its layout:
// a 32-byte header (magic, version, page size, checkpoint sequence, two
// salts, a checksum of the 24 bytes before it), then frames of a 24-byte
// header (page number, the database's size in pages after a commit or 0,
// the salts, a running checksum) and one page each. SQLite's recovery takes
// the frames that carry the header's salts and whose checksums hold, up to
// the last commit among them, and ends the log at the first frame that
// fails.
constexpr std::uint32_t kLogMagic = 0x377f0682;  // the low bit: checksums of big-endian words
constexpr std::uint32_t kLogVersion = 3007000;
constexpr std::size_t kLogHeader = 32;
constexpr std::size_t kFrameHeader = 24;

std::uint32_t bigEndian32(const unsigned char* p) {
  return (std::uint32_t{p[0]} << 24) | (std::uint32_t{p[1]} << 16) | (std::uint32_t{p[2]} << 8) | p[3];
}

// The log's running checksum over n bytes (a multiple of 8) of 32-bit
// words, read in the byte order the log's magic names.
void logChecksum(bool bigEndian, const unsigned char* p, std::size_t n, std::array<std::uint32_t, 2>& sum) {
  const auto word = [bigEndian](const unsigned char* w) {
    return bigEndian ? bigEndian32(w)
                     : (std::uint32_t{w[3]} << 24) | (std::uint32_t{w[2]} << 16) | (std::uint32_t{w[1]} << 8) | w[0];
  };
  for (std::size_t i = 0; i + 8 <= n; i += 8) {
    sum[0] += word(p + i) + sum[1];
    sum[1] += word(p + i + 4) + sum[0];
  }
}

bool readWhole(sys::File& file, std::uint64_t offset, unsigned char* data, std::size_t size) {
  while (size > 0) {
    const std::size_t n = file.readAt(offset, data, size);
    if (n == 0) return false;
    offset += n;
    data += n;
    size -= n;
  }
  return true;
}

// The number of frames of the staged log that hold committed transactions,
// as SQLite's recovery will count them; shownName is the log's name in the
// backup, for the refusals. Refused: a log whose header is
// damaged or is not for the file's page size (SQLite would pass over the
// whole log in silence), and one whose frames fail their checksum before a
// later commit (SQLite would end the log there and drop that commit in
// silence). Frames after the last commit are a transaction that was still
// being written when the folder was copied, possibly cut short; frames with
// other salts are left from an earlier round of the log, already in the
// file. Both are left out, as SQLite leaves them out.
std::uint64_t committedFrames(sys::Env& env, const fs::path& backupFolder, const fs::path& log,
                              const std::string& shownName, std::uint32_t pageSize, const std::source_location& where) {
  const std::string name = "\"" + shownName + "\"";
  const auto in = onFiles(where, [&] { return env.open(log, sys::OpenMode::Read); });
  const auto size = onFiles(where, [&] { return in->size(); });
  if (size == 0) return 0;  // what a checkpoint that truncated the log leaves
  std::vector<unsigned char> header(kLogHeader);
  if (size < kLogHeader || !onFiles(where, [&] { return readWhole(*in, 0, header.data(), header.size()); })) {
    refuse(backupFolder, "the write-ahead log " + name + " is cut inside its header", where);
  }
  const std::uint32_t magic = bigEndian32(&header[0]);
  if ((magic & ~1U) != kLogMagic || bigEndian32(&header[4]) != kLogVersion) {
    refuse(backupFolder, name + " is not a write-ahead log of this engine", where);
  }
  const bool bigEndian = (magic & 1U) != 0;
  std::array<std::uint32_t, 2> sum{0, 0};
  logChecksum(bigEndian, header.data(), 24, sum);
  if (sum[0] != bigEndian32(&header[24]) || sum[1] != bigEndian32(&header[28])) {
    refuse(backupFolder, "the write-ahead log " + name + " has a damaged header", where);
  }
  if (bigEndian32(&header[8]) != pageSize) {
    refuse(backupFolder,
           "the write-ahead log " + name + " has page size " + std::to_string(bigEndian32(&header[8])) +
               ", the database " + std::to_string(pageSize),
           where);
  }

  std::vector<unsigned char> frame(kFrameHeader + pageSize);
  std::uint64_t committed = 0;
  std::uint64_t broken = 0;  // the first frame that fails, 0 while none has
  std::uint64_t n = 1;
  for (std::uint64_t at = kLogHeader; at + frame.size() <= size; at += frame.size(), ++n) {
    if (!onFiles(where, [&] { return readWhole(*in, at, frame.data(), frame.size()); })) break;
    if (!std::equal(&frame[8], &frame[16], &header[16])) break;  // an earlier round of the log
    const bool commit = bigEndian32(&frame[4]) != 0;
    if (broken == 0) {
      logChecksum(bigEndian, frame.data(), 8, sum);
      logChecksum(bigEndian, &frame[kFrameHeader], pageSize, sum);
      if (bigEndian32(&frame[0]) != 0 && sum[0] == bigEndian32(&frame[16]) && sum[1] == bigEndian32(&frame[20])) {
        if (commit) committed = n;
        continue;
      }
      broken = n;
    } else if (commit) {
      refuse(backupFolder,
             "frame " + std::to_string(broken) + " of the write-ahead log " + name +
                 " is damaged, and a transaction committed after it would be lost",
             where);
    }
  }
  return committed;
}

bool unreadable(std::int32_t code) {
  return code == DB::err::kInvalidDatabase || code == DB::err::kInvalidDatabaseVersion ||
         code == DB::err::kDatabaseCorrupted;
}

// Opens the staged copy, so that SQLite replays the log beside it, moves
// every frame of the log into the file and cuts the log to nothing; closing
// the connection then removes it. Refused when SQLite takes another number
// of frames than the log's walk counted, or cannot move them all.
void applyLog(sys::Env& env, const fs::path& backupFolder, const fs::path& staged, std::uint64_t frames,
              const Instance& instance, const std::source_location& where) {
  try {
    auto db = openConnection(env, staged, OpenMode::Existing, instance.settings().busyTimeout, where);
    int logged = -1;
    int moved = -1;
    int rc = sqlite3_wal_checkpoint_v2(db.get(), nullptr, SQLITE_CHECKPOINT_FULL, &logged, &moved);
    if (rc == SQLITE_OK && (logged < 0 || static_cast<std::uint64_t>(logged) != frames || moved != logged)) {
      refuse(backupFolder,
             "SQLite took " + std::to_string(logged) + " frames of the write-ahead log and moved " +
                 std::to_string(moved) + ", of " + std::to_string(frames) + " committed",
             where);
    }
    if (rc == SQLITE_OK) {
      rc = sqlite3_wal_checkpoint_v2(db.get(), nullptr, SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
    }
    if (rc != SQLITE_OK) {
      refuse(backupFolder, "the write-ahead log cannot be applied (" + std::string(sqlite3_errstr(rc)) + ")", where);
    }
  } catch (const DB::DBExc& e) {
    if (!unreadable(e.code())) throw;
    refuse(backupFolder, "the database with its write-ahead log cannot be read (" + std::string(e.what()) + ")", where);
  }
}

// SQLite's quick check on the staged copy (never on the backup itself,
// which stays as it was unpacked), then the caller's schema check.
void checkContent(sys::Env& env, const fs::path& backupFolder, const fs::path& staged, const Instance& instance,
                  const SchemaCheck& schemaCheck, const std::source_location& where) {
  try {
    auto db = openConnection(env, staged, OpenMode::Existing, instance.settings().busyTimeout, where);
    sqlite3_stmt* raw = nullptr;
    int rc = sqlite3_prepare_v2(db.get(), "PRAGMA quick_check", -1, &raw, nullptr);
    std::string verdict;
    if (rc == SQLITE_OK) {
      rc = sqlite3_step(raw);
      if (rc == SQLITE_ROW) {
        const auto* text = sqlite3_column_text(raw, 0);
        verdict = text != nullptr ? reinterpret_cast<const char*>(text) : "";
      }
    }
    sqlite3_finalize(raw);
    if (verdict != "ok") {
      refuse(backupFolder,
             "the database fails the integrity check (" +
                 (verdict.empty() ? std::string(sqlite3_errstr(rc)) : verdict) + ")",
             where);
    }
    if (schemaCheck) {
      const std::string missing = schemaCheck(db.get());
      if (!missing.empty()) refuse(backupFolder, "the database lacks what the server uses: " + missing, where);
    }
  } catch (const DB::DBExc& e) {
    if (!unreadable(e.code())) throw;
    refuse(backupFolder, "the database cannot be read (" + std::string(e.what()) + ")", where);
  }
  removeCompanions(env, staged, where);
}

}  // namespace

void restoreInstance(Instance& instance, const fs::path& backupFolder, const fs::path& destinationFolder,
                     const StatusCallback& status, const SchemaCheck& schemaCheck, const std::source_location& where) {
  if (instance.state() != Instance::State::Created) DB::throwEngineError(DB::err::kAfterInitialization, where);
  sys::Env& env = *instance.settings().env;
  const auto& fileName = instance.settings().databaseFileName;
  const fs::path source = findDatabase(env, backupFolder, fileName, where);
  const FileHeader header = checkHeader(env, backupFolder, source, where);
  const fs::path log = walFile(source);
  const auto logType = onFiles(where, [&] { return env.stat(log).type; });
  if (logType != sys::FileType::Missing && logType != sys::FileType::Regular) {
    refuse(backupFolder, "the write-ahead log \"" + log.filename().string() + "\" is not a regular file", where);
  }

  onFiles(where, [&] { env.createFolders(destinationFolder); });
  const fs::path target = destinationFolder / fileName;
  fs::path stagedName = target;
  stagedName += ".restoring";
  StagedFile staged(env, stagedName);

  // A log left beside the staged name by a restore that did not finish
  // would be replayed onto this copy.
  removeCompanions(env, staged.path(), where);

  if (status) status({SnapshotOperation::Restore, StatusKind::Begin, std::nullopt, std::nullopt});
  std::vector<std::pair<fs::path, fs::path>> files{{source, staged.path()}};
  if (logType == sys::FileType::Regular) files.emplace_back(log, walFile(staged.path()));
  copyFiles(env, files, header.pageSize, status, where);
  if (files.size() > 1) {
    const auto frames =
        committedFrames(env, backupFolder, walFile(staged.path()), log.filename().string(), header.pageSize, where);
    applyLog(env, backupFolder, staged.path(), frames, instance, where);
  }
  checkContent(env, backupFolder, staged.path(), instance, schemaCheck, where);

  // Nobody has the destination open (the instance is not initialised).
  onFiles(where, [&] {
    SetAside companions(env, target);
    env.rename(staged.path(), target);
    staged.placed();
    companions.placed();
  });
  syncFolder(env, destinationFolder, where);
  if (status) status({SnapshotOperation::Restore, StatusKind::Complete, std::nullopt, std::nullopt});
}

}  // namespace engine
