#include "queues/TimerThread.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "queues/Pool.h"

namespace quarvel {
namespace {

// Far enough to be never, near enough that no clock arithmetic overflows.
constexpr std::chrono::milliseconds kLongestDelay = std::chrono::hours(24 * 365 * 10);

}  // namespace

TimerThread::TimerThread(PendingWork& pendingWork) : pendingWork_(pendingWork) {
  const int failure = thread_.start("work.keeper", 0, [this] { run(); });
  if (failure == 0) return;
  fmt::print(stderr, "quarvel: no thread for work: {}\n", std::strerror(failure));
  std::abort();
}

TimerThread::~TimerThread() {
  {
    const MutexLock lock(mutex_);
    ending_ = true;
  }
  changed_.notifyOne();
  thread_.join();
}

void TimerThread::startThread(Pool& pool) {
  {
    const MutexLock lock(mutex_);
    starts_.push_back(&pool);
  }
  changed_.notifyOne();
}

void TimerThread::after(std::chrono::milliseconds delay, std::shared_ptr<QueueState> queue,
                        Block block) {
  Delayed delayed{std::move(queue), std::move(block), nullptr, CallRef::current(), 0};
  delayed.tracker = delayed.held.tracker();
  bool first = false;
  CallRef released;  // after the lock: completing a tracker runs foreign code
  {
    const MutexLock lock(mutex_);
    if (delay > std::chrono::milliseconds::zero() && !delaysEnded_) {
      if (delayed.held && unheldBytes_ <= kUnheldBytes) {
        delayed.unheldBytes = delayed.tracker->bytes();
        unheldBytes_ += delayed.unheldBytes;
        released = std::move(delayed.held);
      }
      const auto due = Clock::now() + std::min(delay, kLongestDelay);
      const auto place = delayed_.emplace(std::pair(due, delays_++), std::move(delayed)).first;
      first = place == delayed_.begin();
      pendingWork_.add();
      delayed.queue = nullptr;  // NOLINT(bugprone-use-after-move): a new value
    }
  }
  if (first) changed_.notifyOne();
  if (delayed.queue != nullptr) deliver(std::move(delayed));
}

void TimerThread::endDelays() {
  {
    const MutexLock lock(mutex_);
    delaysEnded_ = true;
  }
  changed_.notifyOne();
}

void TimerThread::run() {
  mutex_.lock();
  while (!ending_) {
    if (!starts_.empty()) {
      Pool& pool = *starts_.back();
      starts_.pop_back();
      mutex_.unlock();
      pool.startThread();
      mutex_.lock();
    } else if (delayed_.empty()) {
      changed_.wait(mutex_);
    } else if (const auto due = delayed_.begin()->first.first;
               !delaysEnded_ && due > Clock::now()) {
      changed_.waitUntil(mutex_, due);
    } else {
      Delayed delayed = std::move(delayed_.begin()->second);
      delayed_.erase(delayed_.begin());
      unheldBytes_ -= delayed.unheldBytes;
      mutex_.unlock();
      deliver(std::move(delayed));
      pendingWork_.remove();
      mutex_.lock();
    }
  }
  mutex_.unlock();
}

void TimerThread::deliver(Delayed delayed) {
  if (!delayed.held) delayed.held = CallRef::indirect(std::move(delayed.tracker));
  delayed.queue->add({std::move(delayed.held), std::move(delayed.block)});
}

}  // namespace quarvel
