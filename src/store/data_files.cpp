// Data files: plain files below the database folder's "d/", one folder per
// data id, read and written whole.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

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
#include "framework/unique_fd.h"
#include "service/names.h"
#include "store/db_local.h"
#include "store/file_ops.h"

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

[[noreturn]] void failWith(int error, const std::string& what) {
  throw std::system_error(error, std::generic_category(), what);
}

void syncFolder(const std::string& folder) {
  UniqueFd dir(::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dir.valid() || FileOps::current().fsync(dir.get()) != 0) failWith(errno, "flush folder \"" + folder + '"');
}

// Creates folder (ending with "/") with its missing parents. Each level
// made here is flushed into its parent, so that a file later renamed into
// it does not vanish with its folder in a crash. Failures are not reported
// here: the file that is then created in the folder fails instead.
void makeFolders(const std::string& folder) {
  std::vector<fs::path> made;
  std::error_code ec;
  for (fs::path level = fs::path(folder).parent_path(); !level.empty() && !fs::exists(level, ec);
       level = level.parent_path()) {
    made.push_back(level);
    if (level == level.root_path()) break;
  }
  if (made.empty()) return;
  fs::create_directories(made.front(), ec);
  if (ec) return;
  for (auto it = made.rbegin(); it != made.rend(); ++it) {
    try {
      syncFolder(it->parent_path().string());
    } catch (const std::system_error&) {
      return;  // the write that follows flushes the folder it needs and reports the failure
    }
  }
}

// A file written whole: the bytes go to a new file with a reserved name in
// the target's folder, reach the disk, and the file is then renamed over
// the target, which readers therefore see either as it was or complete.
// Without commit() the new file is removed again and the target is as it
// was. Failures throw std::system_error naming the step.
class DurableWrite {
 public:
  explicit DurableWrite(std::string folder)
      : folder_(std::move(folder)),
        temp_(folder_ + std::string(DBLocal::kTempPrefix) + "XXXXXX"),
        file_(::mkostemp(temp_.data(), O_CLOEXEC)) {
    if (!file_.valid()) failWith(errno, "create a file in \"" + folder_ + '"');
    // mkostemp makes the file private to the owner; data files are
    // ordinary files of the server.
    ::fchmod(file_.get(), 0644);
  }
  ~DurableWrite() {
    if (!renamed_) ::unlink(temp_.c_str());
  }
  DurableWrite(const DurableWrite&) = delete;
  DurableWrite& operator=(const DurableWrite&) = delete;

  void append(const void* data, std::uint64_t size) {
    auto& ops = FileOps::current();
    const char* next = static_cast<const char*>(data);
    while (size > 0) {
      const auto chunk = static_cast<std::size_t>(std::min<std::uint64_t>(size, kMaxWriteBytes));
      const ssize_t n = ops.write(file_.get(), next, chunk);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) failWith(n < 0 ? errno : EIO, "write \"" + temp_ + '"');
      next += n;
      size -= static_cast<std::uint64_t>(n);
    }
  }

  void commit(const std::string& target) {
    auto& ops = FileOps::current();
    if (ops.fsync(file_.get()) != 0) failWith(errno, "flush \"" + temp_ + '"');
    if (file_.close() != 0) failWith(errno, "close \"" + temp_ + '"');
    if (ops.rename(temp_.c_str(), target.c_str()) != 0) failWith(errno, "rename \"" + temp_ + "\" to \"" + target + '"');
    renamed_ = true;
    syncFolder(folder_);
  }

 private:
  std::string folder_;
  std::string temp_;
  UniqueFd file_;
  bool renamed_ = false;
};

void copyFile(const fs::path& from, const std::string& toFolder, const std::string& name) {
  UniqueFd in(::open(from.c_str(), O_RDONLY | O_CLOEXEC));
  if (!in.valid()) failWith(errno, "open \"" + from.string() + '"');
  DurableWrite out(toFolder);
  const auto buffer = std::make_unique<char[]>(kCopyChunkBytes);
  while (true) {
    const ssize_t n = ::read(in.get(), buffer.get(), kCopyChunkBytes);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) failWith(errno, "read \"" + from.string() + '"');
    if (n == 0) break;
    out.append(buffer.get(), static_cast<std::uint64_t>(n));
  }
  out.commit(toFolder + name);
}

// Copies the folders and regular files below from into toFolder (ending
// with "/"), merging into what is there. Links and other special files are
// not followed or copied, and neither are files still being written.
void copyTree(const fs::path& from, const std::string& toFolder) {
  makeFolders(toFolder);
  for (const fs::directory_entry& entry : fs::directory_iterator(from)) {
    const std::string name = entry.path().filename().string();
    const auto status = entry.symlink_status();
    if (fs::is_directory(status)) {
      copyTree(entry.path(), toFolder + name + '/');
    } else if (fs::is_regular_file(status) && !name.starts_with(DBLocal::kTempPrefix)) {
      copyFile(entry.path(), toFolder, name);
    }
  }
}

}  // namespace

std::string DBLocal::dataDir(const std::string& id) const { return folder_ + kDataSubfolder + id + '/'; }

MemBuffer DBLocal::loadDataBlob(const std::string& id, const std::string& file) {
  checkComponent("Data id", id);
  checkFileName(file);
  const std::string path = dataDir(id) + file;
  UniqueFd in(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  struct stat info {};
  if (!in.valid() || ::fstat(in.get(), &info) != 0 || !S_ISREG(info.st_mode)) {
    if (g_LogVerbose) {
      Log::Lock(Log::Debug).logStreamLine() << "DB:loadDataBlob S:" << sessionId() << " Can not find file \"" << id
                                            << '/' << file << '"';
    }
    return {};
  }
  MemBuffer content(static_cast<std::uint64_t>(info.st_size));
  std::uint64_t done = 0;
  while (done < content.size()) {
    const ssize_t n = ::read(in.get(), content.data() + done,
                             static_cast<std::size_t>(std::min<std::uint64_t>(content.size() - done, kMaxWriteBytes)));
    if (n < 0 && errno == EINTR) continue;
    // Writes replace files by renaming, so a file never shrinks under a
    // reader; a short read is a failure of the disk or of somebody else.
    if (n <= 0) throw DBExc("Error reading database file: \"" + path + '"');
    done += static_cast<std::uint64_t>(n);
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
  makeFolders(folder);
  try {
    DurableWrite write(folder);
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
  try {
    std::error_code ec;
    if (!fs::is_directory(from, ec)) failWith(ec ? ec.value() : ENOENT, "find \"" + from + '"');
    if (source == target) return;  // copying a folder onto itself changes nothing
    copyTree(from, dataDir(target));
  } catch (const std::system_error& e) {
    // What used to be the shell's error code is the failing step and the
    // system's text here.
    Log::Lock(Log::Error).logStreamLine() << "Failed to rename (copy) data folder for " << source << " to " << target
                                          << ". Failed to " << e.what();
    throw DBExc("Error renaming data folder " + source + " to " + target);
  }
}

}  // namespace DB
