#include "tests/store/FileCalls.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstring>
#include <numeric>
#include <utility>

namespace quarvel::testing {

namespace {

constexpr std::size_t kFrameHeadBytes = 24;

std::atomic<bool> watching{false};

bool IsLog(std::string_view path) {
  return path.ends_with("-wal");
}

/// The head of a frame holds, for the last of a transaction, the size of the database after it.
bool IsCommit(std::string_view bytes) {
  return bytes.size() == kFrameHeadBytes && std::memcmp(bytes.data() + 4, "\0\0\0\0", 4) != 0;
}

}  // namespace

FileCalls& FileCalls::instance() {
  static FileCalls& calls = *new FileCalls;
  return calls;
}

FileCalls& FileCalls::watch(const std::filesystem::path& directory) {
  instance().reset(directory);
  watching = !directory.empty();
  return instance();
}

void FileCalls::reset(const std::filesystem::path& directory) {
  MutexLock lock(mutex_);
  directory_ = directory.string();
  open_.clear();
  counts_ = {};
  letGo();
  recording_ = false;
  fault_.reset();
  calls_ = {};
  failedCalls_ = 0;
  record_.clear();
}

FileCalls::Counts FileCalls::counts() {
  MutexLock lock(mutex_);
  return counts_;
}

void FileCalls::hold(Purpose purpose) {
  MutexLock lock(mutex_);
  hold_ = purpose;
}

void FileCalls::release() {
  MutexLock lock(mutex_);
  letGo();
}

void FileCalls::letGo() {
  hold_.reset();
  held_ = 0;
  ++releases_;
  released_.notifyAll();
}

bool FileCalls::holdsOne() {
  MutexLock lock(mutex_);
  return held_ > 0;
}

void FileCalls::inject(const Fault& fault) {
  MutexLock lock(mutex_);
  fault_ = fault;
}

void FileCalls::lift() {
  MutexLock lock(mutex_);
  fault_.reset();
}

std::size_t FileCalls::failedCalls() {
  MutexLock lock(mutex_);
  return failedCalls_;
}

void FileCalls::record() {
  MutexLock lock(mutex_);
  recording_ = true;
}

void FileCalls::mark(off_t promise) {
  changed({.kind = Change::Kind::mark, .path = {}, .offset = promise});
}

std::vector<FileCalls::Change> FileCalls::takeRecord() {
  MutexLock lock(mutex_);
  recording_ = false;
  return std::exchange(record_, {});
}

std::optional<std::string> FileCalls::pathOf(int descriptor) {
  if (!watching) return std::nullopt;
  MutexLock lock(mutex_);
  const auto found = open_.find(descriptor);
  return found == open_.end() ? std::nullopt : std::optional(found->second);
}

bool FileCalls::watches(const char* path) {
  if (!watching || path == nullptr) return false;
  MutexLock lock(mutex_);
  return std::string_view(path).starts_with(directory_);
}

int FileCalls::admitLocked(Purpose purpose) {
  const auto purposeIndex = static_cast<std::size_t>(purpose);
  const std::size_t call = fault_ && fault_->only
                               ? calls_[purposeIndex]
                               : std::accumulate(calls_.begin(), calls_.end(), std::size_t{0});
  ++calls_[purposeIndex];
  const bool struck = fault_ && call >= fault_->at && (!fault_->only || fault_->only == purpose) &&
                      (fault_->error != 0 || purpose == Purpose::write);
  if (!struck) return 0;
  const int error = fault_->error == 0 ? -1 : fault_->error;
  if (!fault_->forever) fault_.reset();
  ++failedCalls_;
  return error;
}

void FileCalls::passHold(Purpose purpose) {
  if (hold_ != purpose) return;
  ++held_;
  const std::size_t before = releases_;
  while (releases_ == before) released_.wait(mutex_);
}

int FileCalls::admit(Purpose purpose) {
  MutexLock lock(mutex_);
  return admitLocked(purpose);
}

int FileCalls::admitWrite(std::string_view path) {
  MutexLock lock(mutex_);
  if (IsLog(path)) passHold(Purpose::write);
  return admitLocked(Purpose::write);
}

void FileCalls::opened(int descriptor, const char* path, bool created) {
  {
    MutexLock lock(mutex_);
    open_[descriptor] = path;
  }
  if (created) changed({.kind = Change::Kind::create, .path = path});
}

void FileCalls::closed(int descriptor) {
  if (!watching) return;
  MutexLock lock(mutex_);
  open_.erase(descriptor);
}

void FileCalls::changed(Change change) {
  MutexLock lock(mutex_);
  if (change.kind == Change::Kind::write && IsLog(change.path)) {
    if (std::exchange(commits_, IsCommit(change.text))) {
      ++counts_.commits;
      ++counts_.unsynced;
    }
  }
  if (recording_) record_.push_back(std::move(change));
}

FileCalls::Sync FileCalls::syncBegins() {
  MutexLock lock(mutex_);
  const Sync begun{record_.size(), counts_.commits};
  passHold(Purpose::sync);
  return begun;
}

void FileCalls::synced(const std::string& path, const Sync& begun, bool failed) {
  {
    MutexLock lock(mutex_);
    if (!failed && IsLog(path)) {
      ++counts_.logSyncs;
      counts_.unsynced = counts_.commits - begun.commits;
    }
  }
  changed({.kind = Change::Kind::sync, .path = path, .failed = failed, .begun = begun.changes});
}

namespace {

using Kind = FileCalls::Change::Kind;
using Purpose = FileCalls::Purpose;

FileCalls& Calls() {
  return FileCalls::instance();
}

template <class Function>
Function* Next(const char* name) {
  return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, name));
}

int Fail(int error) {
  errno = error;
  return -1;
}

int Open(int (*real)(const char*, int, ...), const char* path, int flags, mode_t mode) {
  if (!Calls().watches(path)) return real(path, flags, mode);
  if (const int error = Calls().admit(Purpose::open)) return Fail(error);
  struct stat status {};
  const bool isNew = (flags & O_CREAT) != 0 && ::lstat(path, &status) != 0;
  const int descriptor = real(path, flags, mode);
  if (descriptor >= 0) Calls().opened(descriptor, path, isNew);
  return descriptor;
}

int Sync(int (*real)(int), int descriptor) {
  const auto path = Calls().pathOf(descriptor);
  if (!path) return real(descriptor);
  const int error = Calls().admit(Purpose::sync);
  const FileCalls::Sync begun = Calls().syncBegins();
  const int result = error == 0 ? real(descriptor) : Fail(error);
  Calls().synced(*path, begun, result != 0);
  return result;
}

/// For what only may fail.
template <class Call>
auto Admitted(bool isWatched, Purpose purpose, Call call) -> decltype(call()) {
  if (isWatched) {
    // What is not a transfer cannot be half done.
    if (const int error = Calls().admit(purpose)) return Fail(error < 0 ? EIO : error);
  }
  return call();
}

}  // namespace

}  // namespace quarvel::testing

// The C library's functions, as this program and the libraries that it loads find them.

using quarvel::testing::Admitted;
using quarvel::testing::Calls;
using quarvel::testing::Fail;
using quarvel::testing::Kind;
using quarvel::testing::Next;
using quarvel::testing::Purpose;

extern "C" {

// Libraries call the one or the other.
#define QUARVEL_OPEN(name)                                                      \
  int name(const char* path, int flags, ...) {                                  \
    static auto* const real = Next<int(const char*, int, ...)>(#name);          \
    va_list arguments;                                                          \
    va_start(arguments, flags);                                                 \
    const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0; \
    va_end(arguments);                                                          \
    return quarvel::testing::Open(real, path, flags, mode);                     \
  }
QUARVEL_OPEN(open)
QUARVEL_OPEN(open64)

int close(int descriptor) {
  static auto* const real = Next<int(int)>("close");
  Calls().closed(descriptor);
  return real(descriptor);
}

ssize_t pwrite64(int descriptor, const void* bytes, size_t count, off64_t offset) {
  static auto* const real = Next<ssize_t(int, const void*, size_t, off64_t)>("pwrite64");
  const auto path = Calls().pathOf(descriptor);
  if (!path) return real(descriptor, bytes, count, offset);
  const std::string_view whole(static_cast<const char*>(bytes), count);
  const int error = Calls().admitWrite(*path);
  if (error > 0) return Fail(error);
  const ssize_t written = real(descriptor, bytes, error < 0 ? (count + 1) / 2 : count, offset);
  if (written > 0) {
    Calls().changed({.kind = Kind::write,
                     .path = *path,
                     .text = std::string(whole.substr(0, static_cast<std::size_t>(written))),
                     .offset = offset});
  }
  return written;
}

ssize_t pread64(int descriptor, void* bytes, size_t count, off64_t offset) {
  static auto* const real = Next<ssize_t(int, void*, size_t, off64_t)>("pread64");
  return Admitted(Calls().pathOf(descriptor).has_value(), Purpose::other,
                  [&] { return real(descriptor, bytes, count, offset); });
}

int ftruncate64(int descriptor, off64_t size) {
  static auto* const real = Next<int(int, off64_t)>("ftruncate64");
  const auto path = Calls().pathOf(descriptor);
  const int result =
      Admitted(path.has_value(), Purpose::write, [&] { return real(descriptor, size); });
  if (path && result == 0) {
    Calls().changed({.kind = Kind::truncate, .path = *path, .offset = size});
  }
  return result;
}

int fsync(int descriptor) {
  static auto* const real = Next<int(int)>("fsync");
  return quarvel::testing::Sync(real, descriptor);
}

int fdatasync(int descriptor) {
  static auto* const real = Next<int(int)>("fdatasync");
  return quarvel::testing::Sync(real, descriptor);
}

int unlink(const char* path) {
  static auto* const real = Next<int(const char*)>("unlink");
  const bool isWatched = Calls().watches(path);
  const int result = Admitted(isWatched, Purpose::write, [&] { return real(path); });
  if (isWatched && result == 0) Calls().changed({.kind = Kind::remove, .path = path});
  return result;
}

int rename(const char* from, const char* to) {
  static auto* const real = Next<int(const char*, const char*)>("rename");
  const bool isWatched = Calls().watches(from);
  const int result = Admitted(isWatched, Purpose::write, [&] { return real(from, to); });
  if (isWatched && result == 0) {
    Calls().changed({.kind = Kind::rename, .path = from, .text = to});
  }
  return result;
}

void* mmap64(void* address, size_t length, int protection, int flags, int descriptor,
             off64_t offset) {
  static auto* const real = Next<void*(void*, size_t, int, int, int, off64_t)>("mmap64");
  if (descriptor >= 0 && Calls().pathOf(descriptor)) {
    if (const int error = Calls().admit(Purpose::other)) {
      errno = error;
      return MAP_FAILED;
    }
  }
  return real(address, length, protection, flags, descriptor, offset);
}

int fstat64(int descriptor, struct stat64* status) {
  static auto* const real = Next<int(int, struct stat64*)>("fstat64");
  return Admitted(Calls().pathOf(descriptor).has_value(), Purpose::other,
                  [&] { return real(descriptor, status); });
}

int stat64(const char* path, struct stat64* status) {
  static auto* const real = Next<int(const char*, struct stat64*)>("stat64");
  return Admitted(Calls().watches(path), Purpose::other, [&] { return real(path, status); });
}

int fchmod(int descriptor, mode_t mode) {
  static auto* const real = Next<int(int, mode_t)>("fchmod");
  return Admitted(Calls().pathOf(descriptor).has_value(), Purpose::other,
                  [&] { return real(descriptor, mode); });
}
}
