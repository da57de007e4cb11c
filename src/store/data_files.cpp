// Data files: plain files below the database folder's "d/", one folder per
// data id, read and written whole.

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "engine/db_exc.h"
#include "framework/log.h"
#include "settings/names.h"
#include "store/db_local.h"
#include "store/stale_files.h"

#include <shared_mutex>

#include "engine/db_instances.h"

namespace DB {
namespace {

namespace fs = std::filesystem;

// Longest single write() call; Linux moves at most about 2 GiB per call.
constexpr std::size_t kMaxWriteBytes = std::size_t{1} << 30;
// Buffer of a file copy.
constexpr std::size_t kCopyChunkBytes = std::size_t{1} << 20;

// Client text inside our own messages: control bytes shown as \xNN.
std::string printable(std::string_view text) {
  std::string out;
  for (const char c : text) {
    const auto b = static_cast<unsigned char>(c);
    if (b < 0x20 || b == 0x7F) {
      char hex[5];
      std::snprintf(hex, sizeof hex, "\\x%02X", b);
      out += hex;
    } else {
      out += c;
    }
  }
  return out;
}

// Ids and file names come from clients and become path components; one
// that is not exactly one component could reach any file of the server.
void checkComponent(const char* what, const std::string& value) {
  const char* problem = nullptr;
  if (value.empty()) {
    problem = "it is empty";
  } else if (value == "." || value == "..") {
    problem = "it names a folder";
  } else if (value.find_first_of(std::string_view("/\\\0", 3)) != std::string::npos) {
    problem = "it holds \"/\", \"\\\" or a NUL byte";
  }
  if (problem != nullptr) {
    throw DBExc(std::string(what) + " \"" + printable(value) + "\" is not valid: " + problem +
                "; it must be one path component");
  }
}

void checkFileName(const std::string& file) {
  checkComponent("Data file name", file);
  if (file.starts_with(DBLocal::kTempPrefix)) {
    throw DBExc("Data file name \"" + printable(file) + "\" is not valid: names beginning with \"" +
                std::string(DBLocal::kTempPrefix) + "\" are reserved for files being written");
  }
}

// Creates folder (ending with "/") with its missing parents. Each level
// made here is flushed into its parent, so that a file later renamed into
// it does not vanish with its folder in a crash.
void makeFolders(sys::Env& env, const std::string& folder) {
  for (const auto& made : env.createFolders(folder)) env.syncFolder(made.parent_path());
}

// A file written whole: the bytes go to a new file with a reserved name in
// the target's folder, reach the disk, and the file is then renamed over
// the target, which readers therefore see either as it was or complete;
// the folder is flushed after the rename, so the new name survives a
// crash. Without commit() the new file is removed again and the target is
// as it was. Failures throw std::system_error naming the step.
class DurableWrite {
 public:
  DurableWrite(sys::Env& env, std::string folder)
      : env_(env), folder_(std::move(folder)), file_(env_.createTemp(folder_, processTempPrefix(), &temp_)) {}
  ~DurableWrite() {
    if (renamed_) return;
    try {
      file_.reset();
      env_.remove(temp_);
    } catch (const std::system_error&) {
      // Stale temporary files are recognised by their prefix and skipped.
    }
  }
  DurableWrite(const DurableWrite&) = delete;
  DurableWrite& operator=(const DurableWrite&) = delete;

  void append(const void* data, std::uint64_t size) {
    const char* next = static_cast<const char*>(data);
    while (size > 0) {
      const auto chunk = static_cast<std::size_t>(std::min<std::uint64_t>(size, kMaxWriteBytes));
      file_->write(next, chunk);
      next += chunk;
      size -= chunk;
    }
  }

  void commit(const std::string& target) {
    file_->sync();
    file_->close();
    env_.rename(temp_, target);
    renamed_ = true;
    env_.syncFolder(folder_);
  }

 private:
  sys::Env& env_;
  std::string folder_;
  sys::Path temp_;
  std::unique_ptr<sys::File> file_;
  bool renamed_ = false;
};

void copyFile(sys::Env& env, const sys::Path& from, const std::string& toFolder, const std::string& name) {
  const auto in = env.open(from, sys::OpenMode::Read);
  DurableWrite out(env, toFolder);
  const auto buffer = std::make_unique<char[]>(kCopyChunkBytes);
  for (std::size_t n; (n = in->read(buffer.get(), kCopyChunkBytes)) > 0;) out.append(buffer.get(), n);
  out.commit(toFolder + name);
}

// Copies the folders and regular files below from into toFolder (ending
// with "/"), merging into what is there. Links and other special files are
// not followed or copied, and neither are files still being written.
void copyTree(sys::Env& env, const sys::Path& from, const std::string& toFolder) {
  makeFolders(env, toFolder);
  for (const sys::DirEntry& entry : env.list(from)) {
    if (entry.type == sys::FileType::Folder) {
      copyTree(env, from / entry.name, toFolder + entry.name + '/');
    } else if (entry.type == sys::FileType::Regular && !entry.name.starts_with(DBLocal::kTempPrefix)) {
      copyFile(env, from / entry.name, toFolder, entry.name);
    }
  }
}

}  // namespace

std::string DBLocal::dataDir(const std::string& id) const { return folder_ + kDataSubfolder + id + '/'; }

MemBuffer DBLocal::loadDataBlob(const std::string& id, const std::string& file) {
  checkComponent("Data id", id);
  checkFileName(file);
  const std::string path = dataDir(id) + file;
  sys::Env& env = env_;
  std::unique_ptr<sys::File> in;
  try {
    if (env.stat(path, true).type == sys::FileType::Regular) in = env.open(path, sys::OpenMode::Read);
  } catch (const std::system_error&) {
    // Unreadable counts as missing, as before: the client gets no content.
  }
  if (!in) {
    if (g_LogVerbose) {
      Log::Lock(Log::Debug).logStreamLine()
          << "DB:loadDataBlob S:" << sessionId() << " Can not find file \"" << id << '/' << file << '"';
    }
    return {};
  }
  MemBuffer content;
  try {
    content = MemBuffer(in->size());
    std::uint64_t done = 0;
    while (done < content.size()) {
      const std::size_t n =
          in->read(content.data() + done,
                   static_cast<std::size_t>(std::min<std::uint64_t>(content.size() - done, kMaxWriteBytes)));
      // Writes replace files by renaming, so a file never shrinks under a
      // reader; a short read is a failure of the disk or of somebody else.
      if (n == 0) throw std::system_error(EIO, std::generic_category(), "short read");
      done += n;
    }
  } catch (const std::system_error&) {
    throw DBExc("Error reading database file: \"" + path + '"');
  }
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DB:loadDataBlob S:" << sessionId() << " Returning data file \"" << id
                                          << '/' << file << "\" size: " << content.size();
  }
  return content;
}

void DBLocal::saveDataBlob(const void* data, std::uint64_t length, const std::string& id, const std::string& file) {
  checkComponent("Data id", id);
  checkFileName(file);
  const std::string folder = dataDir(id);
  const std::string path = folder + file;
  sys::Env& env = env_;
  // A cleanup never removes the id while this write is under way.
  const auto idLock = pool_->dataLock(name_, id);
  const std::shared_lock writing(*idLock);
  try {
    makeFolders(env, folder);
    DurableWrite write(env, folder);
    write.append(data, length);
    write.commit(path);
  } catch (const std::system_error& e) {
    Log::Lock(Log::Warning).logStreamLine() << "DB:saveDataBlob S:" << sessionId() << " Failed to " << e.what();
    throw DBExc("Error writing to database file: \"" + path + '"');
  }
  if (g_LogVerbose) {
    Log::Lock(Log::Debug).logStreamLine() << "DB:saveDataBlob S:" << sessionId() << " Stored data in file \"" << id
                                          << '/' << file << "\" size: " << length;
  }
}

void DBLocal::copyDataFolder(const std::string& source, const std::string& target) {
  checkComponent("Data id", source);
  checkComponent("Data id", target);
  const std::string from = dataDir(source);
  sys::Env& env = env_;
  // Neither id is removed by a cleanup while the copy runs (one lock when
  // both ids share it: a shared lock is not taken twice).
  const auto sourceLock = pool_->dataLock(name_, source);
  const auto targetLock = pool_->dataLock(name_, target);
  const std::shared_lock readingSource(*sourceLock);
  std::shared_lock<std::shared_mutex> writingTarget;
  if (targetLock != sourceLock) writingTarget = std::shared_lock(*targetLock);
  try {
    if (env.stat(from).type != sys::FileType::Folder) {
      throw std::system_error(ENOENT, std::generic_category(), "find \"" + from + '"');
    }
    if (source == target) return;  // copying a folder onto itself changes nothing
    copyTree(env, from, dataDir(target));
  } catch (const std::system_error& e) {
    // What used to be the shell's error code is the failing step and the
    // system's text here.
    Log::Lock(Log::Error).logStreamLine()
        << "Failed to rename (copy) data folder for " << source << " to " << target << ". Failed to " << e.what();
    throw DBExc("Error renaming data folder " + source + " to " + target);
  }
}

}  // namespace DB
