#include "client/Poller.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <span>
#include <utility>

namespace quarvel {
namespace {

using std::chrono::nanoseconds;

enum Source : std::uint32_t { kSocket, kWake, kTimer };

int Control(int epoll, int operation, int descriptor, Source source, std::uint32_t events) {
  epoll_event event{};
  event.events = events;
  event.data.u32 = source;
  return ::epoll_ctl(epoll, operation, descriptor, &event) == 0 ? 0 : errno;
}

timespec AsTimespec(nanoseconds duration) {
  constexpr nanoseconds kSecond = std::chrono::seconds(1);
  return {static_cast<time_t>(duration / kSecond), static_cast<long>((duration % kSecond).count())};
}

// The wait in milliseconds, rounded up: a wait of 0 would spin until the deadline.
int Milliseconds(std::optional<Poller::Time> deadline) {
  if (!deadline) return -1;
  const auto left =
      std::chrono::ceil<std::chrono::milliseconds>(*deadline - std::chrono::steady_clock::now());
  if (left.count() <= 0) return 0;
  constexpr std::chrono::milliseconds kLongest = std::chrono::hours(1);
  return static_cast<int>(std::min(left, kLongest).count());
}

void Drain(int descriptor) {
  std::uint64_t count = 0;
  [[maybe_unused]] const ssize_t read = ::read(descriptor, &count, sizeof count);
}

}  // namespace

Poller::Poller()
    : epoll_(::epoll_create1(EPOLL_CLOEXEC)),
      wake_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
      timer_(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK)) {
  if (epoll_ < 0 || wake_ < 0 || timer_ < 0) {
    error_ = errno;
    return;
  }
  error_ = Control(epoll_, EPOLL_CTL_ADD, wake_, kWake, EPOLLIN);
  if (error_ == 0) error_ = Control(epoll_, EPOLL_CTL_ADD, timer_, kTimer, EPOLLIN);
}

Poller::~Poller() {
  abandon();
}

void Poller::abandon() {
  for (int* descriptor : {&epoll_, &wake_, &timer_}) {
    if (*descriptor >= 0) ::close(std::exchange(*descriptor, -1));
  }
}

int Poller::watch(int socket) const {
  return Control(epoll_, EPOLL_CTL_ADD, socket, kSocket, EPOLLIN);
}

void Poller::unwatch(int socket) const {
  Control(epoll_, EPOLL_CTL_DEL, socket, kSocket, 0);
}

void Poller::watchOutput(int socket, bool wanted) const {
  Control(epoll_, EPOLL_CTL_MOD, socket, kSocket, wanted ? EPOLLIN | EPOLLOUT : EPOLLIN);
}

void Poller::wake() const {
  const std::uint64_t one = 1;
  [[maybe_unused]] const ssize_t count = ::write(wake_, &one, sizeof one);
}

void Poller::arm(std::optional<Time> time) {
  if (time == armed_) return;
  armed_ = time;
  itimerspec when{};
  if (time) when.it_value = AsTimespec(time->time_since_epoch());
  ::timerfd_settime(timer_, TFD_TIMER_ABSTIME, &when, nullptr);
}

Poller::Events Poller::wait(std::optional<Time> deadline) {
  epoll_event due[3];
  const int count = ::epoll_wait(epoll_, due, 3, Milliseconds(deadline));
  Events events;
  for (const epoll_event& event : std::span(due, static_cast<std::size_t>(std::max(count, 0)))) {
    switch (event.data.u32) {
      case kSocket:
        events.input = (event.events & ~std::uint32_t{EPOLLOUT}) != 0;
        break;
      case kWake:
        Drain(wake_);
        break;
      case kTimer:
        Drain(timer_);
        armed_.reset();
        events.timer = true;
        break;
    }
  }
  return events;
}

}  // namespace quarvel
