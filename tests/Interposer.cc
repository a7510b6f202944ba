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
#include <cstdarg>
#include <cstring>
#include <string_view>

namespace quarvel::testing {

namespace {

constexpr std::size_t kFrameHeadBytes = 24;

std::atomic<bool> watchingFiles{false};

bool IsLog(std::string_view path) {
  return path.ends_with("-wal");
}

/// The head of a transaction's last frame holds the size of the database after it, all others 0.
bool IsCommit(std::string_view bytes) {
  return bytes.size() == kFrameHeadBytes && std::memcmp(bytes.data() + 4, "\0\0\0\0", 4) != 0;
}

}  // namespace

Interposer& Interposer::watch(const std::filesystem::path& directory) {
  Interposer& all = instance();
  const MutexLock lock(all.mutex_);
  all.data_ = {.directory = directory.string(), .releases = all.data_.releases + 1};
  all.released_.notifyAll();
  watchingFiles = !directory.empty();
  return all;
}

void Interposer::release() {
  const MutexLock lock(mutex_);
  data_.hold.reset();
  data_.held = 0;
  ++data_.releases;
  released_.notifyAll();
}

void Interposer::passHold(Purpose purpose) {
  if (data_.hold != purpose) return;
  ++data_.held;
  const std::size_t before = data_.releases;
  while (data_.releases == before) released_.wait(mutex_);
}

void Interposer::changed(Change change) {
  const MutexLock lock(mutex_);
  changedLocked(std::move(change));
}

void Interposer::changedLocked(Change change) {
  if (change.kind == Change::Kind::write && IsLog(change.path) &&
      std::exchange(data_.commitIsNext, IsCommit(change.text))) {
    ++data_.counts.commits;
    ++data_.counts.unsynced;
  }
  if (data_.recording) data_.record.push_back(std::move(change));
}

/// The work of the functions below that stand in for the C library's.
struct StandIns {
  using Kind = Interposer::Change::Kind;
  using Purpose = Interposer::Purpose;

  static Interposer& all() { return Interposer::instance(); }

  /// The path of a descriptor of a watched file.
  static std::optional<std::string> pathOf(int descriptor) {
    if (!watchingFiles) return std::nullopt;
    const MutexLock lock(all().mutex_);
    const auto found = all().data_.open.find(descriptor);
    return found == all().data_.open.end() ? std::nullopt : std::optional(found->second);
  }
  static bool isFile(int descriptor) { return pathOf(descriptor).has_value(); }
  static bool isPath(const char* path) {
    return watchingFiles && path != nullptr &&
           std::string_view(path).starts_with(all().get(&Interposer::Data::directory));
  }

  /// Counts a call. Returns the error number with which it has to fail, -1 for half a transfer, or
  /// 0.
  static int admit(const char* function, Purpose purpose) {
    const MutexLock lock(all().mutex_);
    Interposer::Data& data = all().data_;
    const std::size_t all = data.allCalls++;
    const std::size_t nthFor = data.callsFor[static_cast<std::size_t>(purpose)]++;
    const std::size_t nth = data.calls[function]++;
    if (!data.fault) return 0;
    const Interposer::Fault& fault = *data.fault;
    const bool isNamed = !fault.function.empty();
    if (fault.only && fault.only != purpose) return 0;
    if (isNamed && fault.function != function) return 0;
    if ((isNamed ? nth : fault.only ? nthFor : all) < fault.at) return 0;
    // Among calls for files, only a write can be half done.
    if (fault.error == 0 && !isNamed && purpose != Purpose::write) return 0;
    const int error = fault.error == 0 ? -1 : fault.error;
    if (!fault.forever) data.fault.reset();
    ++data.failedCalls;
    return error;
  }
  /// Makes a call, unless it is watched and has to fail.
  template <class Call>
  static auto admitted(bool isWatched, const char* function, Purpose purpose, Call call)
      -> decltype(call()) {
    const int error = isWatched ? admit(function, purpose) : 0;
    if (error == 0) return call();
    errno = error < 0 ? EIO : error;
    if constexpr (std::is_pointer_v<decltype(call())>) {
      return MAP_FAILED;
    } else {
      return -1;
    }
  }
  static int changed(bool isWatched, int result, Interposer::Change change) {
    if (isWatched && result == 0) all().changed(std::move(change));
    return result;
  }

  static int open(int (*real)(const char*, int, ...), const char* function, const char* path,
                  int flags, mode_t mode) {
    const bool isWatched = isPath(path);
    return admitted(isWatched || onThread, function, Purpose::open, [&] {
      struct stat status {};
      const bool isNew = isWatched && (flags & O_CREAT) != 0 && ::lstat(path, &status) != 0;
      const int descriptor = real(path, flags, mode);
      if (!isWatched || descriptor < 0) return descriptor;
      const MutexLock lock(all().mutex_);
      all().data_.open[descriptor] = path;
      if (isNew) all().changedLocked({.kind = Kind::create, .path = path});
      return descriptor;
    });
  }
  static void close(int descriptor) {
    if (!watchingFiles) return;
    const MutexLock lock(all().mutex_);
    all().data_.open.erase(descriptor);
  }

  /// `real(bytes)` transfers so many bytes.
  template <class Real>
  static ssize_t write(const char* function, int descriptor, const void* bytes, std::size_t count,
                       off_t offset, Real real) {
    const auto path = pathOf(descriptor);
    if (!path && !onThread) return real(count);
    if (path && IsLog(*path)) {
      const MutexLock lock(all().mutex_);
      all().passHold(Purpose::write);
    }
    const int error = admit(function, Purpose::write);
    if (error > 0) {
      errno = error;
      return -1;
    }
    const ssize_t written = real(error < 0 ? (count + 1) / 2 : count);
    if (path && written > 0) {
      std::string text(static_cast<const char*>(bytes), static_cast<std::size_t>(written));
      all().changed(
          {.kind = Kind::write, .path = *path, .text = std::move(text), .offset = offset});
    }
    return written;
  }

  /// A sync covers the changes and commits from before its beginning.
  static int sync(int (*real)(int), const char* function, int descriptor) {
    const auto path = pathOf(descriptor);
    if (!path) return real(descriptor);
    const int error = admit(function, Purpose::sync);
    Interposer::Data& data = all().data_;
    std::size_t changes = 0;
    int commits = 0;
    {
      const MutexLock lock(all().mutex_);
      changes = data.record.size();
      commits = data.counts.commits;
      all().passHold(Purpose::sync);
    }
    const int result = error == 0 ? real(descriptor) : -1;
    if (error != 0) errno = error;
    const MutexLock lock(all().mutex_);
    if (result == 0 && IsLog(*path)) {
      ++data.counts.logSyncs;
      data.counts.unsynced = data.counts.commits - commits;
    }
    all().changedLocked(
        {.kind = Kind::sync, .path = *path, .failed = result != 0, .begun = changes});
    return result;
  }

  template <class Function>
  static Function* next(const char* name) {
    return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, name));
  }
};

}  // namespace quarvel::testing

// The C library's functions, as this program and the libraries that it loads find them.

using quarvel::testing::onThread;
using quarvel::testing::StandIns;
using Kind = StandIns::Kind;
using Purpose = StandIns::Purpose;

#define QUARVEL_REAL(name) static auto* const real = StandIns::next<decltype(::name)>(#name)
#define QUARVEL_CALL(type, name, watched, parameters, arguments)                               \
  type name parameters {                                                                       \
    QUARVEL_REAL(name);                                                                        \
    return StandIns::admitted(watched, #name, Purpose::other, [&] { return real arguments; }); \
  }
#define QUARVEL_CALL_1(type, name, watched, A) QUARVEL_CALL(type, name, watched, (A a), (a))
#define QUARVEL_CALL_2(type, name, watched, A, B) \
  QUARVEL_CALL(type, name, watched, (A a, B b), (a, b))
#define QUARVEL_CALL_3(type, name, watched, A, B, C) \
  QUARVEL_CALL(type, name, watched, (A a, B b, C c), (a, b, c))
#define QUARVEL_CALL_4(type, name, watched, A, B, C, D) \
  QUARVEL_CALL(type, name, watched, (A a, B b, C c, D d), (a, b, c, d))
#define QUARVEL_OPEN(name)                                                      \
  int name(const char* path, int flags, ...) {                                  \
    QUARVEL_REAL(name);                                                         \
    va_list arguments;                                                          \
    va_start(arguments, flags);                                                 \
    const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0; \
    va_end(arguments);                                                          \
    return StandIns::open(real, #name, path, flags, mode);                      \
  }
#define QUARVEL_SYNC(name)                          \
  int name(int descriptor) {                        \
    QUARVEL_REAL(name);                             \
    return StandIns::sync(real, #name, descriptor); \
  }

extern "C" {

// Sockets and events, of watched threads.
QUARVEL_CALL_3(int, socket, onThread, int, int, int)
QUARVEL_CALL_3(int, bind, onThread, int, const sockaddr*, socklen_t)
QUARVEL_CALL_2(int, listen, onThread, int, int)
QUARVEL_CALL_4(int, accept4, onThread, int, sockaddr*, socklen_t*, int)
QUARVEL_CALL_3(int, connect, onThread, int, const sockaddr*, socklen_t)
QUARVEL_CALL_4(ssize_t, recv, onThread, int, void*, size_t, int)
QUARVEL_CALL_2(int, shutdown, onThread, int, int)
QUARVEL_CALL(int, getsockopt, onThread, (int a, int b, int c, void* d, socklen_t* e),
             (a, b, c, d, e))
QUARVEL_CALL_1(int, epoll_create1, onThread, int)
QUARVEL_CALL_4(int, epoll_ctl, onThread, int, int, int, epoll_event*)
QUARVEL_CALL_4(int, epoll_wait, onThread, int, epoll_event*, int, int)
QUARVEL_CALL_2(int, eventfd, onThread, unsigned, int)
QUARVEL_CALL_2(int, timerfd_create, onThread, int, int)
QUARVEL_CALL_4(int, timerfd_settime, onThread, int, int, const itimerspec*, itimerspec*)
QUARVEL_CALL_3(ssize_t, read, onThread, int, void*, size_t)
QUARVEL_CALL_2(int, mkdir, onThread, const char*, mode_t)
QUARVEL_CALL_2(int, flock, onThread, int, int)
QUARVEL_CALL_2(int, chmod, onThread, const char*, mode_t)
QUARVEL_CALL_2(int, lstat, onThread, const char*, struct stat*)

ssize_t send(int descriptor, const void* bytes, size_t count, int flags) {
  QUARVEL_REAL(send);
  return StandIns::write("send", descriptor, bytes, count, 0,
                         [&](size_t part) { return real(descriptor, bytes, part, flags); });
}

// Files. Libraries call a function under the one name or the other.
QUARVEL_CALL_4(ssize_t, pread64, StandIns::isFile(a), int, void*, size_t, off64_t)
QUARVEL_CALL(void*, mmap64, e >= 0 && StandIns::isFile(e),
             (void* a, size_t b, int c, int d, int e, off64_t f), (a, b, c, d, e, f))
QUARVEL_CALL_2(int, fstat64, StandIns::isFile(a), int, struct stat64*)
QUARVEL_CALL_2(int, stat64, StandIns::isPath(a), const char*, struct stat64*)
QUARVEL_CALL_2(int, fchmod, onThread || StandIns::isFile(a), int, mode_t)
QUARVEL_OPEN(open)
QUARVEL_OPEN(open64)
QUARVEL_SYNC(fsync)
QUARVEL_SYNC(fdatasync)

int close(int descriptor) {
  QUARVEL_REAL(close);
  StandIns::close(descriptor);
  return real(descriptor);
}

ssize_t write(int descriptor, const void* bytes, size_t count) {
  QUARVEL_REAL(write);
  const off_t offset = StandIns::isFile(descriptor) ? ::lseek(descriptor, 0, SEEK_CUR) : 0;
  return StandIns::write("write", descriptor, bytes, count, offset,
                         [&](size_t part) { return real(descriptor, bytes, part); });
}

ssize_t pwrite64(int descriptor, const void* bytes, size_t count, off64_t offset) {
  QUARVEL_REAL(pwrite64);
  if (!StandIns::isFile(descriptor)) return real(descriptor, bytes, count, offset);
  return StandIns::write("pwrite64", descriptor, bytes, count, offset,
                         [&](size_t part) { return real(descriptor, bytes, part, offset); });
}

int ftruncate64(int descriptor, off64_t size) {
  QUARVEL_REAL(ftruncate64);
  const auto path = StandIns::pathOf(descriptor);
  const int result = StandIns::admitted(path.has_value(), "ftruncate64", Purpose::write,
                                        [&] { return real(descriptor, size); });
  return StandIns::changed(path.has_value(), result,
                           {.kind = Kind::truncate, .path = path.value_or(""), .offset = size});
}

int unlink(const char* path) {
  QUARVEL_REAL(unlink);
  const bool isPath = StandIns::isPath(path);
  const int result =
      StandIns::admitted(isPath || onThread, "unlink", Purpose::write, [&] { return real(path); });
  return StandIns::changed(isPath, result, {.kind = Kind::remove, .path = path});
}

int rename(const char* from, const char* to) {
  QUARVEL_REAL(rename);
  const bool isPath = StandIns::isPath(from);
  const int result =
      StandIns::admitted(isPath, "rename", Purpose::write, [&] { return real(from, to); });
  return StandIns::changed(isPath, result, {.kind = Kind::rename, .path = from, .text = to});
}

}  // extern "C"
