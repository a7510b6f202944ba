#include "tests/Interposer.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstring>
#include <utility>

namespace quarvel::testing {

namespace {

constexpr std::size_t kFrameHeadBytes = 24;

std::atomic<bool> watchingFiles{false};
thread_local bool watchingThread = false;

bool IsLog(std::string_view path) {
  return path.ends_with("-wal");
}

/// The head of a transaction's last frame holds the size of the database after it, all others 0.
bool IsCommit(std::string_view bytes) {
  return bytes.size() == kFrameHeadBytes && std::memcmp(bytes.data() + 4, "\0\0\0\0", 4) != 0;
}

}  // namespace

Interposer& Interposer::instance() {
  static Interposer& interposer = *new Interposer;
  return interposer;
}

Interposer& Interposer::watch(const std::filesystem::path& directory) {
  instance().reset(directory);
  watchingFiles = !directory.empty();
  return instance();
}

Interposer::WatchedThread::WatchedThread() {
  watchingThread = true;
}

Interposer::WatchedThread::~WatchedThread() {
  watchingThread = false;
}

bool Interposer::watchesThread() {
  return watchingThread;
}

void Interposer::reset(const std::filesystem::path& directory) {
  MutexLock lock(mutex_);
  directory_ = directory.string();
  open_.clear();
  counts_ = {};
  releaseHeld();
  recording_ = false;
  fault_.reset();
  calls_.clear();
  callsFor_ = {};
  allCalls_ = failedCalls_ = 0;
  record_.clear();
}

Interposer::Counts Interposer::counts() {
  MutexLock lock(mutex_);
  return counts_;
}

std::map<std::string, std::size_t> Interposer::calls() {
  MutexLock lock(mutex_);
  return calls_;
}

void Interposer::hold(Purpose purpose) {
  MutexLock lock(mutex_);
  hold_ = purpose;
}

void Interposer::release() {
  MutexLock lock(mutex_);
  releaseHeld();
}

void Interposer::releaseHeld() {
  hold_.reset();
  held_ = 0;
  ++releases_;
  released_.notifyAll();
}

bool Interposer::holdsOne() {
  MutexLock lock(mutex_);
  return held_ > 0;
}

void Interposer::inject(const Fault& fault) {
  MutexLock lock(mutex_);
  fault_ = fault;
}

void Interposer::lift() {
  MutexLock lock(mutex_);
  fault_.reset();
}

std::size_t Interposer::failedCalls() {
  MutexLock lock(mutex_);
  return failedCalls_;
}

void Interposer::record() {
  MutexLock lock(mutex_);
  recording_ = true;
}

void Interposer::mark(off_t promise) {
  changed({.kind = Change::Kind::mark, .path = {}, .offset = promise});
}

std::vector<Interposer::Change> Interposer::takeRecord() {
  MutexLock lock(mutex_);
  recording_ = false;
  return std::exchange(record_, {});
}

std::optional<std::string> Interposer::pathOf(int descriptor) {
  if (!watchingFiles) return std::nullopt;
  MutexLock lock(mutex_);
  const auto found = open_.find(descriptor);
  return found == open_.end() ? std::nullopt : std::optional(found->second);
}

bool Interposer::watches(const char* path) {
  if (!watchingFiles || path == nullptr) return false;
  MutexLock lock(mutex_);
  return std::string_view(path).starts_with(directory_);
}

int Interposer::admit(const char* function, Purpose purpose) {
  MutexLock lock(mutex_);
  std::size_t& callsFor = callsFor_[static_cast<std::size_t>(purpose)];
  std::size_t& calls = calls_[function];
  const std::size_t all = allCalls_++;
  const std::size_t nthFor = callsFor++;
  const std::size_t nth = calls++;
  if (!fault_) return 0;
  if (fault_->only && fault_->only != purpose) return 0;
  if (!fault_->function.empty() && fault_->function != function) return 0;
  const std::size_t number = !fault_->function.empty() ? nth : fault_->only ? nthFor : all;
  // Among calls for files, only a write can be half done.
  const bool isShort = fault_->error == 0;
  if (number < fault_->at) return 0;
  if (isShort && fault_->function.empty() && purpose != Purpose::write) return 0;
  const int error = isShort ? -1 : fault_->error;
  if (!fault_->forever) fault_.reset();
  ++failedCalls_;
  return error;
}

void Interposer::passHold(Purpose purpose) {
  if (hold_ != purpose) return;
  ++held_;
  const std::size_t before = releases_;
  while (releases_ == before) released_.wait(mutex_);
}

void Interposer::passWrite(std::string_view path) {
  MutexLock lock(mutex_);
  if (IsLog(path)) passHold(Purpose::write);
}

void Interposer::opened(int descriptor, const char* path, bool created) {
  {
    MutexLock lock(mutex_);
    open_[descriptor] = path;
  }
  if (created) changed({.kind = Change::Kind::create, .path = path});
}

void Interposer::closed(int descriptor) {
  if (!watchingFiles) return;
  MutexLock lock(mutex_);
  open_.erase(descriptor);
}

void Interposer::changed(Change change) {
  MutexLock lock(mutex_);
  if (change.kind == Change::Kind::write && IsLog(change.path)) {
    if (std::exchange(commitIsNext_, IsCommit(change.text))) {
      ++counts_.commits;
      ++counts_.unsynced;
    }
  }
  if (recording_) record_.push_back(std::move(change));
}

Interposer::Sync Interposer::syncBegins() {
  MutexLock lock(mutex_);
  const Sync begun{record_.size(), counts_.commits};
  passHold(Purpose::sync);
  return begun;
}

void Interposer::synced(const std::string& path, const Sync& begun, bool failed) {
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

using Kind = Interposer::Change::Kind;
using Purpose = Interposer::Purpose;

Interposer& Calls() {
  return Interposer::instance();
}

bool OnThread() {
  return Interposer::watchesThread();
}

bool IsFile(int descriptor) {
  return Calls().pathOf(descriptor).has_value();
}

bool IsPath(const char* path) {
  return Calls().watches(path);
}

template <class Function>
Function* Next(const char* name) {
  return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, name));
}

/// Makes a call, unless it is watched and has to fail.
template <class Call>
auto Admitted(bool isWatched, const char* function, Purpose purpose, Call call)
    -> decltype(call()) {
  const int error = isWatched ? Calls().admit(function, purpose) : 0;
  if (error == 0) return call();
  errno = error < 0 ? EIO : error;
  if constexpr (std::is_pointer_v<decltype(call())>) {
    return MAP_FAILED;
  } else {
    return -1;
  }
}

int Open(int (*real)(const char*, int, ...), const char* function, const char* path, int flags,
         mode_t mode) {
  const bool isPath = IsPath(path);
  return Admitted(isPath || OnThread(), function, Purpose::open, [&] {
    struct stat status {};
    const bool isNew = isPath && (flags & O_CREAT) != 0 && ::lstat(path, &status) != 0;
    const int descriptor = real(path, flags, mode);
    if (isPath && descriptor >= 0) Calls().opened(descriptor, path, isNew);
    return descriptor;
  });
}

/// `real(bytes)` transfers so many bytes.
template <class Real>
ssize_t Write(const char* function, int descriptor, const void* bytes, std::size_t count,
              off_t offset, Real real) {
  const auto path = Calls().pathOf(descriptor);
  if (!path && !OnThread()) return real(count);
  if (path) Calls().passWrite(*path);
  const int error = Calls().admit(function, Purpose::write);
  if (error > 0) {
    errno = error;
    return -1;
  }
  const ssize_t written = real(error < 0 ? (count + 1) / 2 : count);
  if (path && written > 0) {
    const std::string_view whole(static_cast<const char*>(bytes), count);
    Calls().changed({.kind = Kind::write,
                     .path = *path,
                     .text = std::string(whole.substr(0, static_cast<std::size_t>(written))),
                     .offset = offset});
  }
  return written;
}

int Sync(int (*real)(int), const char* function, int descriptor) {
  const auto path = Calls().pathOf(descriptor);
  if (!path) return real(descriptor);
  const int error = Calls().admit(function, Purpose::sync);
  const Interposer::Sync begun = Calls().syncBegins();
  const int result = error == 0 ? real(descriptor) : -1;
  if (error != 0) errno = error;
  Calls().synced(*path, begun, result != 0);
  return result;
}

int Changed(bool isWatched, int result, Interposer::Change change) {
  if (isWatched && result == 0) Calls().changed(std::move(change));
  return result;
}

}  // namespace

}  // namespace quarvel::testing

// The C library's functions, as this program and the libraries that it loads find them.

using namespace quarvel::testing;

#define QUARVEL_CALL(type, name, parameters, arguments, watched, purpose)              \
  type name parameters {                                                               \
    static auto* const real = Next<type parameters>(#name);                            \
    return Admitted(watched, #name, Purpose::purpose, [&] { return real arguments; }); \
  }
#define QUARVEL_OPEN(name)                                                      \
  int name(const char* path, int flags, ...) {                                  \
    static auto* const real = Next<int(const char*, int, ...)>(#name);          \
    va_list arguments;                                                          \
    va_start(arguments, flags);                                                 \
    const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0; \
    va_end(arguments);                                                          \
    return Open(real, #name, path, flags, mode);                                \
  }
#define QUARVEL_SYNC(name)                           \
  int name(int descriptor) {                         \
    static auto* const real = Next<int(int)>(#name); \
    return Sync(real, #name, descriptor);            \
  }

extern "C" {

// Sockets and events, of watched threads.
QUARVEL_CALL(int, socket, (int domain, int type, int protocol), (domain, type, protocol),
             OnThread(), other)
QUARVEL_CALL(int, bind, (int descriptor, const sockaddr* address, socklen_t length),
             (descriptor, address, length), OnThread(), other)
QUARVEL_CALL(int, listen, (int descriptor, int backlog), (descriptor, backlog), OnThread(), other)
QUARVEL_CALL(int, accept4, (int descriptor, sockaddr* address, socklen_t* length, int flags),
             (descriptor, address, length, flags), OnThread(), other)
QUARVEL_CALL(int, connect, (int descriptor, const sockaddr* address, socklen_t length),
             (descriptor, address, length), OnThread(), other)
QUARVEL_CALL(ssize_t, recv, (int descriptor, void* bytes, size_t count, int flags),
             (descriptor, bytes, count, flags), OnThread(), other)
QUARVEL_CALL(int, shutdown, (int descriptor, int how), (descriptor, how), OnThread(), other)
QUARVEL_CALL(int, getsockopt, (int descriptor, int level, int name, void* value, socklen_t* length),
             (descriptor, level, name, value, length), OnThread(), other)
QUARVEL_CALL(int, epoll_create1, (int flags), (flags), OnThread(), other)
QUARVEL_CALL(int, epoll_ctl, (int events, int operation, int descriptor, epoll_event* event),
             (events, operation, descriptor, event), OnThread(), other)
QUARVEL_CALL(int, epoll_wait, (int events, epoll_event* ready, int most, int timeout),
             (events, ready, most, timeout), OnThread(), other)
QUARVEL_CALL(int, eventfd, (unsigned value, int flags), (value, flags), OnThread(), other)
QUARVEL_CALL(int, timerfd_create, (int clock, int flags), (clock, flags), OnThread(), other)
QUARVEL_CALL(int, timerfd_settime,
             (int timer, int flags, const itimerspec* time, itimerspec* before),
             (timer, flags, time, before), OnThread(), other)
QUARVEL_CALL(ssize_t, read, (int descriptor, void* bytes, size_t count), (descriptor, bytes, count),
             OnThread(), other)
QUARVEL_CALL(int, mkdir, (const char* path, mode_t mode), (path, mode), OnThread(), other)
QUARVEL_CALL(int, flock, (int descriptor, int operation), (descriptor, operation), OnThread(),
             other)
QUARVEL_CALL(int, chmod, (const char* path, mode_t mode), (path, mode), OnThread(), other)
QUARVEL_CALL(int, lstat, (const char* path, struct stat* status), (path, status), OnThread(), other)

ssize_t send(int descriptor, const void* bytes, size_t count, int flags) {
  static auto* const real = Next<ssize_t(int, const void*, size_t, int)>("send");
  return Write("send", descriptor, bytes, count, 0,
               [&](size_t part) { return real(descriptor, bytes, part, flags); });
}

// Files. Libraries call a function under the one name or the other.
QUARVEL_CALL(ssize_t, pread64, (int descriptor, void* bytes, size_t count, off64_t offset),
             (descriptor, bytes, count, offset), IsFile(descriptor), other)
QUARVEL_CALL(void*, mmap64,
             (void* address, size_t length, int protection, int flags, int descriptor,
              off64_t offset),
             (address, length, protection, flags, descriptor, offset),
             descriptor >= 0 && IsFile(descriptor), other)
QUARVEL_CALL(int, fstat64, (int descriptor, struct stat64* status), (descriptor, status),
             IsFile(descriptor), other)
QUARVEL_CALL(int, stat64, (const char* path, struct stat64* status), (path, status), IsPath(path),
             other)
QUARVEL_CALL(int, fchmod, (int descriptor, mode_t mode), (descriptor, mode),
             OnThread() || IsFile(descriptor), other)
QUARVEL_OPEN(open)
QUARVEL_OPEN(open64)
QUARVEL_SYNC(fsync)
QUARVEL_SYNC(fdatasync)

int close(int descriptor) {
  static auto* const real = Next<int(int)>("close");
  Calls().closed(descriptor);
  return real(descriptor);
}

ssize_t write(int descriptor, const void* bytes, size_t count) {
  static auto* const real = Next<ssize_t(int, const void*, size_t)>("write");
  const off_t offset = IsFile(descriptor) ? ::lseek(descriptor, 0, SEEK_CUR) : 0;
  return Write("write", descriptor, bytes, count, offset,
               [&](size_t part) { return real(descriptor, bytes, part); });
}

ssize_t pwrite64(int descriptor, const void* bytes, size_t count, off64_t offset) {
  static auto* const real = Next<ssize_t(int, const void*, size_t, off64_t)>("pwrite64");
  if (!IsFile(descriptor)) return real(descriptor, bytes, count, offset);
  return Write("pwrite64", descriptor, bytes, count, offset,
               [&](size_t part) { return real(descriptor, bytes, part, offset); });
}

int ftruncate64(int descriptor, off64_t size) {
  static auto* const real = Next<int(int, off64_t)>("ftruncate64");
  const auto path = Calls().pathOf(descriptor);
  const int result = Admitted(path.has_value(), "ftruncate64", Purpose::write,
                              [&] { return real(descriptor, size); });
  return Changed(path.has_value(), result,
                 {.kind = Kind::truncate, .path = path.value_or(""), .offset = size});
}

int unlink(const char* path) {
  static auto* const real = Next<int(const char*)>("unlink");
  const bool isPath = IsPath(path);
  const int result =
      Admitted(isPath || OnThread(), "unlink", Purpose::write, [&] { return real(path); });
  return Changed(isPath, result, {.kind = Kind::remove, .path = path});
}

int rename(const char* from, const char* to) {
  static auto* const real = Next<int(const char*, const char*)>("rename");
  const bool isPath = IsPath(from);
  const int result = Admitted(isPath, "rename", Purpose::write, [&] { return real(from, to); });
  return Changed(isPath, result, {.kind = Kind::rename, .path = from, .text = to});
}

}  // extern "C"
