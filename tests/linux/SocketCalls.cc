#include "tests/linux/SocketCalls.h"

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

#define QUARVEL_ADMIT(name, ...)                                                           \
  static const auto real = reinterpret_cast<decltype(&(name))>(::dlsym(RTLD_NEXT, #name)); \
  if (const auto error = quarvel::testing::SocketCalls::instance().admit(#name)) {         \
    errno = *error == 0 ? EIO : *error;                                                    \
    return -1;                                                                             \
  }                                                                                        \
  return real(__VA_ARGS__)

extern "C" {

int socket(int domain, int type, int protocol) noexcept {
  QUARVEL_ADMIT(socket, domain, type, protocol);
}

int bind(int descriptor, const sockaddr* address, socklen_t length) noexcept {
  QUARVEL_ADMIT(bind, descriptor, address, length);
}

int listen(int descriptor, int backlog) noexcept {
  QUARVEL_ADMIT(listen, descriptor, backlog);
}

int accept4(int descriptor, sockaddr* address, socklen_t* length, int flags) {
  QUARVEL_ADMIT(accept4, descriptor, address, length, flags);
}

int connect(int descriptor, const sockaddr* address, socklen_t length) {
  QUARVEL_ADMIT(connect, descriptor, address, length);
}

ssize_t recv(int descriptor, void* bytes, size_t count, int flags) {
  QUARVEL_ADMIT(recv, descriptor, bytes, count, flags);
}

int shutdown(int descriptor, int how) noexcept {
  QUARVEL_ADMIT(shutdown, descriptor, how);
}

int getsockopt(int descriptor, int level, int name, void* value, socklen_t* length) noexcept {
  QUARVEL_ADMIT(getsockopt, descriptor, level, name, value, length);
}

int epoll_create1(int flags) noexcept {
  QUARVEL_ADMIT(epoll_create1, flags);
}

int epoll_ctl(int events, int operation, int descriptor, epoll_event* event) noexcept {
  QUARVEL_ADMIT(epoll_ctl, events, operation, descriptor, event);
}

int epoll_wait(int events, epoll_event* ready, int most, int timeout) {
  QUARVEL_ADMIT(epoll_wait, events, ready, most, timeout);
}

int eventfd(unsigned value, int flags) noexcept {
  QUARVEL_ADMIT(eventfd, value, flags);
}

int timerfd_create(int clock, int flags) noexcept {
  QUARVEL_ADMIT(timerfd_create, clock, flags);
}

int timerfd_settime(int timer, int flags, const itimerspec* time, itimerspec* before) noexcept {
  QUARVEL_ADMIT(timerfd_settime, timer, flags, time, before);
}

ssize_t read(int descriptor, void* bytes, size_t count) {
  QUARVEL_ADMIT(read, descriptor, bytes, count);
}

ssize_t write(int descriptor, const void* bytes, size_t count) {
  QUARVEL_ADMIT(write, descriptor, bytes, count);
}

int mkdir(const char* path, mode_t mode) noexcept {
  QUARVEL_ADMIT(mkdir, path, mode);
}

int flock(int descriptor, int operation) noexcept {
  QUARVEL_ADMIT(flock, descriptor, operation);
}

int fchmod(int descriptor, mode_t mode) noexcept {
  QUARVEL_ADMIT(fchmod, descriptor, mode);
}

int chmod(const char* path, mode_t mode) noexcept {
  QUARVEL_ADMIT(chmod, path, mode);
}

int lstat(const char* path, struct stat* status) noexcept {
  QUARVEL_ADMIT(lstat, path, status);
}

int unlink(const char* path) noexcept {
  QUARVEL_ADMIT(unlink, path);
}

ssize_t send(int descriptor, const void* bytes, size_t count, int flags) {
  static const auto real = reinterpret_cast<decltype(&send)>(::dlsym(RTLD_NEXT, "send"));
  const auto error = quarvel::testing::SocketCalls::instance().admit("send");
  if (!error) return real(descriptor, bytes, count, flags);
  if (*error == 0) return real(descriptor, bytes, (count + 1) / 2, flags);
  errno = *error;
  return -1;
}

int open(const char* path, int flags, ...) {
  va_list arguments;
  va_start(arguments, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(arguments, mode_t) : 0;
  va_end(arguments);
  QUARVEL_ADMIT(open, path, flags, mode);
}

}  // extern "C"
