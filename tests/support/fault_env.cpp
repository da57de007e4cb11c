#include "support/fault_env.h"

#include <unistd.h>

#include <algorithm>
#include <system_error>

namespace testing_support {
namespace {

using sys::Path;

constexpr const char* kOpNames[] = {"open",
                                    "create a file in",
                                    "read",
                                    "write",
                                    "flush",
                                    "close",
                                    "flush folder",
                                    "rename",
                                    "link",
                                    "remove",
                                    "remove",
                                    "create folder",
                                    "list",
                                    "look at",
                                    "set the time of",
                                    "look at the file system of",
                                    "access",
                                    "any"};

Path normal(const Path& p) {
  Path n = p.lexically_normal();
  if (!n.has_filename() && n.has_parent_path()) n = n.parent_path();
  return n;
}

Path folderOf(const Path& p) { return normal(p).parent_path(); }

// A file of the base env whose calls pass the fault checks first.
class FaultFile final : public sys::File {
 public:
  FaultFile(FaultEnv& env, std::unique_ptr<sys::File> file, bool writable)
      : sys::File(file->path()), env_(env), file_(std::move(file)), writable_(writable) {}

  std::size_t read(void* data, std::size_t size) override {
    env_.check(FaultEnv::Op::Read, path());
    return file_->read(data, size);
  }
  std::size_t readAt(std::uint64_t offset, void* data, std::size_t size) override {
    env_.check(FaultEnv::Op::Read, path());
    return file_->readAt(offset, data, size);
  }
  void write(const void* data, std::size_t size) override {
    env_.check(FaultEnv::Op::Write, path());
    file_->write(data, size);
  }
  void writeAt(std::uint64_t offset, const void* data, std::size_t size) override {
    env_.check(FaultEnv::Op::Write, path());
    file_->writeAt(offset, data, size);
  }
  void seek(std::uint64_t position) override { file_->seek(position); }
  std::uint64_t position() const noexcept override { return file_->position(); }
  std::uint64_t size() override { return file_->size(); }
  void sync() override {
    env_.check(FaultEnv::Op::Sync, path());
    file_->sync();
    if (writable_) env_.synced(path(), file_->size());
  }
  void close() override {
    env_.check(FaultEnv::Op::Close, path());
    file_->close();
  }

 private:
  FaultEnv& env_;
  std::unique_ptr<sys::File> file_;
  const bool writable_;
};

}  // namespace

FaultEnv::FaultEnv(Path scratch, sys::Env& base) : base_(base), scratch_(std::move(scratch)) {}

FaultEnv::~FaultEnv() = default;

void FaultEnv::failNth(Op kind, std::uint64_t n, int error) {
  sys::MutexLock lock(mutex_);
  nth_.push_back({kind, counts_[static_cast<int>(kind)] + n, error});
}

void FaultEnv::failOnPath(Op kind, std::string fragment, int error) {
  sys::MutexLock lock(mutex_);
  onPath_.push_back({kind, std::move(fragment), error});
}

void FaultEnv::clearFailures() {
  sys::MutexLock lock(mutex_);
  nth_.clear();
  onPath_.clear();
}

std::uint64_t FaultEnv::count(Op kind) const {
  sys::MutexLock lock(mutex_);
  return counts_[static_cast<int>(kind)];
}

void FaultEnv::resetCounts() {
  sys::MutexLock lock(mutex_);
  std::fill(std::begin(counts_), std::end(counts_), 0);
  nth_.clear();
}

std::uint64_t FaultEnv::injected() const {
  sys::MutexLock lock(mutex_);
  return injected_;
}

void FaultEnv::setCallHook(std::function<void(Op, const Path&)> hook) {
  sys::MutexLock lock(mutex_);
  callHook_ = std::move(hook);
}

void FaultEnv::check(Op kind, const Path& path) {
  std::function<void(Op, const Path&)> hook;
  {
    sys::MutexLock lock(mutex_);
    hook = callHook_;
  }
  if (hook) hook(kind, path);
  sys::MutexLock lock(mutex_);
  const auto k = static_cast<int>(kind);
  const auto any = static_cast<int>(kAny);
  ++counts_[k];
  ++counts_[any];
  int error = 0;
  for (const Nth& n : nth_) {
    if ((n.kind == kind && counts_[k] == n.at) || (n.kind == kAny && counts_[any] == n.at)) error = n.error;
  }
  for (const OnPath& p : onPath_) {
    if ((p.kind == kind || p.kind == kAny) && path.string().find(p.fragment) != std::string::npos) error = p.error;
  }
  if (error == 0) return;
  ++injected_;
  throw std::system_error(error, std::generic_category(),
                          std::string("injected: ") + kOpNames[k] + " \"" + path.string() + '"');
}

void FaultEnv::synced(const Path& file, std::uint64_t size) {
  sys::MutexLock lock(mutex_);
  syncedSize_[normal(file)] = size;
}

void FaultEnv::pending(const Path& folder, Change change) {
  sys::MutexLock lock(mutex_);
  changes_.emplace_back(normal(folder), std::move(change));
}

std::unique_ptr<sys::File> FaultEnv::open(const Path& path, sys::OpenMode mode) {
  check(Op::Open, path);
  const bool creates = mode == sys::OpenMode::CreateNew || mode == sys::OpenMode::CreateOrTruncate;
  const bool existed = creates && base_.stat(path).type != sys::FileType::Missing;
  auto file = base_.open(path, mode);
  const bool writable = mode != sys::OpenMode::Read;
  if (writable) {
    sys::MutexLock lock(mutex_);
    syncedSize_.emplace(normal(path), creates ? 0 : file->size());
    if (mode == sys::OpenMode::CreateOrTruncate) syncedSize_[normal(path)] = 0;
  }
  if (creates && !existed) pending(folderOf(path), {Change::Created, path, {}, std::nullopt});
  return std::make_unique<FaultFile>(*this, std::move(file), writable);
}

std::unique_ptr<sys::File> FaultEnv::createTemp(const Path& folder, std::string_view prefix, Path* made) {
  check(Op::CreateTemp, folder);
  Path name;
  auto file = base_.createTemp(folder, prefix, &name);
  if (made != nullptr) *made = name;
  {
    sys::MutexLock lock(mutex_);
    syncedSize_[normal(name)] = 0;
  }
  pending(folder, {Change::Created, name, {}, std::nullopt});
  return std::make_unique<FaultFile>(*this, std::move(file), true);
}

void FaultEnv::syncFolder(const Path& folder) {
  check(Op::SyncFolder, folder);
  base_.syncFolder(folder);
  std::vector<Path> kept;
  {
    sys::MutexLock lock(mutex_);
    const Path f = normal(folder);
    const auto settled = std::remove_if(changes_.begin(), changes_.end(), [&](const auto& c) {
      if (c.first != f) return false;
      if (c.second.replaced) kept.push_back(*c.second.replaced);
      return true;
    });
    changes_.erase(settled, changes_.end());
  }
  for (const Path& k : kept) base_.remove(k);
}

void FaultEnv::rename(const Path& from, const Path& to) {
  check(Op::Rename, from);
  std::optional<Path> replaced;
  if (base_.stat(to).type == sys::FileType::Regular) {
    std::uint64_t n = 0;
    {
      sys::MutexLock lock(mutex_);
      n = ++keptFiles_;
    }
    replaced = scratch_ / ("replaced-" + std::to_string(n));
    base_.createFolders(scratch_);
    base_.link(to, *replaced);
  }
  try {
    base_.rename(from, to);
  } catch (...) {
    if (replaced) base_.remove(*replaced);
    throw;
  }
  {
    sys::MutexLock lock(mutex_);
    const auto found = syncedSize_.find(normal(from));
    if (found != syncedSize_.end()) {
      syncedSize_[normal(to)] = found->second;
      syncedSize_.erase(normal(from));
    }
  }
  pending(folderOf(to), {Change::Renamed, to, from, replaced});
}

void FaultEnv::link(const Path& from, const Path& to) {
  check(Op::Link, from);
  base_.link(from, to);
  pending(folderOf(to), {Change::Created, to, {}, std::nullopt});
}

bool FaultEnv::remove(const Path& path) {
  check(Op::Remove, path);
  return base_.remove(path);
}

std::uint64_t FaultEnv::removeAll(const Path& path) {
  check(Op::RemoveAll, path);
  return base_.removeAll(path);
}

std::vector<Path> FaultEnv::createFolders(const Path& folder) {
  check(Op::CreateFolders, folder);
  auto made = base_.createFolders(folder);
  for (const Path& level : made) pending(folderOf(level), {Change::Created, level, {}, std::nullopt});
  return made;
}

std::vector<sys::DirEntry> FaultEnv::list(const Path& folder) {
  check(Op::List, folder);
  return base_.list(folder);
}

// An injected "not there" is an outcome of these two, as it is of the real
// calls, not a failure.
bool missing(const std::system_error& e) { return e.code().value() == ENOENT || e.code().value() == ENOTDIR; }

sys::FileInfo FaultEnv::stat(const Path& path, bool follow) {
  try {
    check(Op::Stat, path);
  } catch (const std::system_error& e) {
    if (missing(e)) return {};
    throw;
  }
  return base_.stat(path, follow);
}

void FaultEnv::setModified(const Path& path, sys::WallClock::time_point when) {
  check(Op::SetModified, path);
  base_.setModified(path, when);
}

void FaultEnv::setFreeSpace(std::optional<std::uint64_t> bytes) {
  sys::MutexLock lock(mutex_);
  freeSpace_ = bytes;
}

std::uint64_t FaultEnv::freeSpace(const Path& path) {
  check(Op::FreeSpace, path);
  {
    sys::MutexLock lock(mutex_);
    if (freeSpace_) return *freeSpace_;
  }
  return base_.freeSpace(path);
}

bool FaultEnv::readWritable(const Path& path) {
  try {
    check(Op::Access, path);
  } catch (const std::system_error& e) {
    if (missing(e)) return false;
    throw;
  }
  return base_.readWritable(path);
}

void FaultEnv::dropUnsynced() {
  std::vector<std::pair<Path, Change>> changes;
  std::map<Path, std::uint64_t> sizes;
  {
    sys::MutexLock lock(mutex_);
    changes.swap(changes_);
    sizes.swap(syncedSize_);
  }
  // Newest first, so that a rename of a file created meanwhile is undone
  // before the file's creation is.
  for (auto it = changes.rbegin(); it != changes.rend(); ++it) {
    const Change& c = it->second;
    try {
      if (c.kind == Change::Created) {
        base_.removeAll(c.path);
      } else {
        if (base_.stat(c.path).type != sys::FileType::Missing) base_.rename(c.path, c.from);
        if (c.replaced) base_.rename(*c.replaced, c.path);
      }
    } catch (const std::system_error&) {
      // What cannot be undone stays as it is (its folder may be gone).
    }
  }
  for (const auto& [file, size] : sizes) {
    const auto info = base_.stat(file);
    if (info.type == sys::FileType::Regular && info.size > size) {
      if (::truncate(file.c_str(), static_cast<off_t>(size)) != 0) continue;
    }
  }
}

void FaultEnv::useManualClock(sys::WallClock::time_point start) {
  sys::MutexLock lock(mutex_);
  clock_ = start;
}

void FaultEnv::advance(std::chrono::milliseconds d) {
  sys::MutexLock lock(mutex_);
  if (clock_) *clock_ += d;
}

sys::WallClock::time_point FaultEnv::now() {
  {
    sys::MutexLock lock(mutex_);
    if (clock_) return *clock_;
  }
  return base_.now();
}

void FaultEnv::setSleepHook(std::function<void(std::chrono::milliseconds)> hook) {
  sys::MutexLock lock(mutex_);
  sleepHook_ = std::move(hook);
}

bool FaultEnv::sleepFor(std::chrono::milliseconds d, std::stop_token stop) {
  std::function<void(std::chrono::milliseconds)> hook;
  bool manual = false;
  {
    sys::MutexLock lock(mutex_);
    if (stop.stop_requested()) return false;
    hook = sleepHook_;
    if (clock_) {
      *clock_ += d;
      manual = true;
    }
  }
  if (hook) {
    hook(d);
    return !stop.stop_requested();
  }
  if (manual) return true;
  return base_.sleepFor(d, stop);
}

}  // namespace testing_support
