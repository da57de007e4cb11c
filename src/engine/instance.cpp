#include "engine/instance.h"

#include <atomic>

#include "engine/database_file.h"
#include "engine/db_exc.h"
#include "engine/engine_errors.h"
#include "engine/session.h"

namespace engine {
namespace {

std::atomic<std::uint64_t> g_nextInstanceId{1};

}  // namespace

bool InstanceSlots::take() noexcept {
  auto live = live_.load();
  do {
    if (live >= limit_) return false;
  } while (!live_.compare_exchange_weak(live, live + 1));
  return true;
}

std::shared_ptr<Instance> Instance::create(InstanceSettings settings, const std::source_location& where) {
  const auto slots = settings.slots;
  if (slots && !slots->take()) DB::throwEngineError(DB::err::kTooManyInstances, where);
  try {
    return std::make_shared<Instance>(Token{}, std::move(settings));
  } catch (...) {
    if (slots) slots->give();
    throw;
  }
}

Instance::Instance(Token, InstanceSettings settings) : id_(g_nextInstanceId++), settings_(std::move(settings)) {}

Instance::~Instance() { term(); }

Instance::State Instance::state() const {
  sys::MutexLock lock(mutex_);
  return state_;
}

void Instance::init(const std::source_location& where) {
  sys::MutexLock lock(mutex_);
  if (state_ == State::Terminated) DB::throwEngineError(DB::err::kTermInProgress, where);
  if (state_ == State::Initialised) return;
  try {
    for (const auto& folder : {settings_.instanceFolder, settings_.logFolder}) {
      // A folder made here is synced into its parent, so that a database
      // file created in it later does not vanish with it in a crash.
      for (const auto& made : settings_.env->createFolders(folder)) settings_.env->syncFolder(made.parent_path());
    }
  } catch (const std::system_error& e) {
    DB::throwEngineError(engineCodeOfErrno(e.code().value()), where);
  }
  state_ = State::Initialised;
}

void Instance::term() noexcept {
  sys::MutexLock lock(mutex_);
  if (state_ == State::Terminated) return;
  state_ = State::Terminated;
  attached_.reset();
  if (settings_.slots) settings_.slots->give();
}

std::unique_ptr<Session> Instance::beginSession(const std::source_location& where) {
  auto self = shared_from_this();
  {
    sys::MutexLock lock(mutex_);
    if (state_ == State::Created) DB::throwEngineError(DB::err::kNotInitialized, where);
    if (state_ == State::Terminated) DB::throwEngineError(DB::err::kTermInProgress, where);
    if (sessions_ >= settings_.maxSessions) DB::throwEngineError(DB::err::kOutOfSessions, where);
    ++sessions_;
  }
  try {
    return std::make_unique<Session>(Session::Token{}, std::move(self));
  } catch (...) {
    sessionEnded();
    throw;
  }
}

std::uint64_t Instance::openSessions() const {
  sys::MutexLock lock(mutex_);
  return sessions_;
}

std::optional<std::filesystem::path> Instance::attachedDatabase() const {
  sys::MutexLock lock(mutex_);
  return attached_;
}

void Instance::sessionEnded() noexcept {
  sys::MutexLock lock(mutex_);
  if (sessions_ > 0) --sessions_;
}

std::int32_t Instance::attach(const std::filesystem::path& file, const std::source_location& where) {
  sys::MutexLock lock(mutex_);
  if (state_ == State::Created) DB::throwEngineError(DB::err::kNotInitialized, where);
  if (state_ == State::Terminated) DB::throwEngineError(DB::err::kTermInProgress, where);
  if (attached_) {
    if (*attached_ == file) return DB::err::kWrnDatabaseAttached;
    DB::throwEngineError(DB::err::kTooManyAttachedDatabases, where);
  }
  attached_ = file;
  return DB::err::kSuccess;
}

void Instance::detach() noexcept {
  sys::MutexLock lock(mutex_);
  attached_.reset();
}

}  // namespace engine
