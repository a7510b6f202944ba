#include "tests/transport/SocketCalls.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <utility>

namespace quarvel::testing {

namespace {
thread_local bool watched = false;
}

SocketCalls& SocketCalls::instance() {
  static SocketCalls& calls = *new SocketCalls;
  return calls;
}

SocketCalls::Watched::Watched() {
  watched = true;
}

SocketCalls::Watched::~Watched() {
  watched = false;
}

void SocketCalls::begin(std::optional<Fault> fault) {
  const MutexLock lock(mutex_);
  fault_ = std::move(fault);
  counts_.clear();
  failed_ = 0;
}

void SocketCalls::lift() {
  const MutexLock lock(mutex_);
  fault_.reset();
}

std::map<std::string, std::size_t> SocketCalls::counts() {
  const MutexLock lock(mutex_);
  return counts_;
}

std::size_t SocketCalls::failed() {
  const MutexLock lock(mutex_);
  return failed_;
}

std::optional<int> SocketCalls::admit(const char* function) {
  if (!watched) return std::nullopt;
  const MutexLock lock(mutex_);
  const std::size_t number = counts_[function]++;
  if (!fault_ || fault_->function != function || number < fault_->at ||
      (number > fault_->at && !fault_->forever)) {
    return std::nullopt;
  }
  ++failed_;
  return fault_->error;
}

}  // namespace quarvel::testing

// The C library's functions, as this program finds them.

#define QUARVEL_CALL(type, name, parameters, arguments, throws)                              \
  type name parameters throws {                                                              \
    static const auto real = reinterpret_cast<decltype(&(name))>(::dlsym(RTLD_NEXT, #name)); \
    if (const auto error = quarvel::testing::SocketCalls::instance().admit(#name)) {         \
      errno = *error == 0 ? EIO : *error;                                                    \
      return -1;                                                                             \
    }                                                                                        \
    return real arguments;                                                                   \
  }

extern "C" {

QUARVEL_CALL(int, socket, (int domain, int type, int protocol), (domain, type, protocol), noexcept)
QUARVEL_CALL(int, bind, (int descriptor, const sockaddr* address, socklen_t length),
             (descriptor, address, length), noexcept)
QUARVEL_CALL(int, listen, (int descriptor, int backlog), (descriptor, backlog), noexcept)
QUARVEL_CALL(int, accept4, (int descriptor, sockaddr* address, socklen_t* length, int flags),
             (descriptor, address, length, flags), noexcept(false))
QUARVEL_CALL(int, connect, (int descriptor, const sockaddr* address, socklen_t length),
             (descriptor, address, length), noexcept(false))
QUARVEL_CALL(ssize_t, recv, (int descriptor, void* bytes, size_t count, int flags),
             (descriptor, bytes, count, flags), noexcept(false))
QUARVEL_CALL(int, shutdown, (int descriptor, int how), (descriptor, how), noexcept)
QUARVEL_CALL(int, getsockopt, (int descriptor, int level, int name, void* value, socklen_t* length),
             (descriptor, level, name, value, length), noexcept)
QUARVEL_CALL(int, epoll_create1, (int flags), (flags), noexcept)
QUARVEL_CALL(int, epoll_ctl, (int events, int operation, int descriptor, epoll_event* event),
             (events, operation, descriptor, event), noexcept)
QUARVEL_CALL(int, epoll_wait, (int events, epoll_event* ready, int most, int timeout),
             (events, ready, most, timeout), noexcept(false))
QUARVEL_CALL(int, eventfd, (unsigned value, int flags), (value, flags), noexcept)
QUARVEL_CALL(int, timerfd_create, (int clock, int flags), (clock, flags), noexcept)
QUARVEL_CALL(int, timerfd_settime,
             (int timer, int flags, const itimerspec* time, itimerspec* before),
             (timer, flags, time, before), noexcept)
QUARVEL_CALL(ssize_t, read, (int descriptor, void* bytes, size_t count), (descriptor, bytes, count),
             noexcept(false))
QUARVEL_CALL(ssize_t, write, (int descriptor, const void* bytes, size_t count),
             (descriptor, bytes, count), noexcept(false))
QUARVEL_CALL(int, mkdir, (const char* path, mode_t mode), (path, mode), noexcept)
QUARVEL_CALL(int, flock, (int descriptor, int operation), (descriptor, operation), noexcept)
QUARVEL_CALL(int, fchmod, (int descriptor, mode_t mode), (descriptor, mode), noexcept)
QUARVEL_CALL(int, chmod, (const char* path, mode_t mode), (path, mode), noexcept)
QUARVEL_CALL(int, lstat, (const char* path, struct stat* status), (path, status), noexcept)
QUARVEL_CALL(int, unlink, (const char* path), (path), noexcept)

ssize_t send(int descriptor, const void* bytes, size_t count, int flags) {
  static const auto real = reinterpret_cast<decltype(&send)>(::dlsym(RTLD_NEXT, "send"));
  const auto error = quarvel::testing::SocketCalls::instance().admit("send");
  if (!error) return real(descriptor, bytes, count, flags);
  if (*error == 0) return real(descriptor, bytes, (count + 1) / 2, flags);
  errno = *error;
  return -1;
}

int open(const char* path, int flags, ...) {
  static const auto real = reinterpret_cast<decltype(&open)>(::dlsym(RTLD_NEXT, "open"));
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0;
  va_end(arguments);
  if (const auto error = quarvel::testing::SocketCalls::instance().admit("open")) {
    errno = *error;
    return -1;
  }
  return real(path, flags, mode);
}

}  // extern "C"
