#include "platform/RunLoop.h"

#include <fmt/format.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <optional>
#include <thread>
#include <utility>

#include "base/Mutex.h"
#include "queues/BlockingScope.h"
#include "queues/Thread.h"

namespace quarvel {
namespace {

using Clock = std::chrono::steady_clock;

class LinuxTimer;
class LinuxRunLoop;

/// By fire date; those due at one time in the order in which they got it.
using Timers = std::multimap<Clock::time_point, std::shared_ptr<LinuxTimer>>;

// One lock for all timers and run loops: a timer and its loop change together, and what is done
// under it is short. The last one taken: it may be wanted under any other.
Mutex timersMutex;

class LinuxTimer final : public RunLoopTimer {
 public:
  LinuxTimer(Clock::time_point fireDate, Block block)
      : block_(std::move(block)), fireDate_(fireDate) {}

  void fireAfter(std::chrono::microseconds delay) override QUARVEL_EXCLUDES(timersMutex);
  void invalidate() override QUARVEL_EXCLUDES(timersMutex);

 private:
  friend class LinuxRunLoop;

  /// None: not valid any more.
  std::optional<Block> block_ QUARVEL_GUARDED_BY(timersMutex);
  Clock::time_point fireDate_ QUARVEL_GUARDED_BY(timersMutex);
  LinuxRunLoop* loop_ QUARVEL_GUARDED_BY(timersMutex) = nullptr;
  /// Where the timer stands in its loop, when it is on one.
  Timers::iterator place_ QUARVEL_GUARDED_BY(timersMutex);
};

class LinuxRunLoop final : public RunLoop {
 public:
  LinuxRunLoop() = default;
  LinuxRunLoop(const LinuxRunLoop&) = delete;
  LinuxRunLoop& operator=(const LinuxRunLoop&) = delete;

  ~LinuxRunLoop() QUARVEL_EXCLUDES(timersMutex) {
    Timers left;  // destroyed after the lock: a timer's block is foreign
    const MutexLock lock(timersMutex);
    for (const auto& [date, timer] : timers_) timer->loop_ = nullptr;
    left.swap(timers_);
  }

  void addTimer(const std::shared_ptr<RunLoopTimer>& timer) override QUARVEL_EXCLUDES(timersMutex) {
    const auto added = std::static_pointer_cast<LinuxTimer>(timer);
    const MutexLock lock(timersMutex);
    if (!added->block_ || added->loop_ != nullptr) return;
    added->loop_ = this;
    added->place_ = timers_.emplace(added->fireDate_, added);
  }

  void run() override QUARVEL_EXCLUDES(timersMutex) {
    while (std::optional<Block> due = awaitDue()) (*due)();
  }

  /// Puts a timer where its new fire date belongs.
  void move(LinuxTimer& timer) QUARVEL_REQUIRES(timersMutex) {
    auto node = timers_.extract(timer.place_);
    node.key() = timer.fireDate_;
    timer.place_ = timers_.insert(std::move(node));
    if (timer.place_ == timers_.begin()) changed_.notifyOne();
  }

  /// Lets go of a timer.
  [[nodiscard]] std::shared_ptr<LinuxTimer> remove(LinuxTimer& timer)
      QUARVEL_REQUIRES(timersMutex) {
    std::shared_ptr<LinuxTimer> removed = std::move(timer.place_->second);
    timers_.erase(timer.place_);
    timer.loop_ = nullptr;
    if (timers_.empty()) changed_.notifyOne();
    return removed;
  }

 private:
  /// The block of the next timer, once that is due; none when no timer is left. Woken only when the
  /// first date comes nearer or the last timer goes: a date that moves away is noticed when the
  /// old one comes.
  std::optional<Block> awaitDue() QUARVEL_EXCLUDES(timersMutex) {
    std::shared_ptr<LinuxTimer> fired;
    const MutexLock lock(timersMutex);
    while (!timers_.empty()) {
      const auto date = timers_.begin()->first;
      if (date <= Clock::now()) {
        fired = remove(*timers_.begin()->second);
        return std::exchange(fired->block_, std::nullopt);
      }
      changed_.waitUntil(timersMutex, date);
    }
    return std::nullopt;
  }

  Timers timers_ QUARVEL_GUARDED_BY(timersMutex);
  ConditionVariable changed_;
};

void LinuxTimer::fireAfter(std::chrono::microseconds delay) {
  const auto date = Clock::now() + delay;
  const MutexLock lock(timersMutex);
  fireDate_ = date;
  if (loop_ != nullptr) loop_->move(*this);
}

void LinuxTimer::invalidate() {
  // Both destroyed after the lock: the block is foreign, and the loop may hold the timer alone.
  std::shared_ptr<LinuxTimer> removed;
  std::optional<Block> block;
  const MutexLock lock(timersMutex);
  block.swap(block_);
  if (loop_ != nullptr) removed = loop_->remove(*this);
}

class LinuxWorkerThread final : public WorkerThread {
 public:
  LinuxWorkerThread(std::string_view label, Block body) : label_(label), body_(std::move(body)) {}

  void start() override {
    constexpr int kStartersNice = 0;
    const int failure = StartThread(label_, kStartersNice, std::move(body_));
    if (failure == 0) return;
    fmt::print(stderr, "quarvel: no thread for {}: {}\n", label_, std::strerror(failure));
    std::abort();
  }

 private:
  const std::string_view label_;
  Block body_;  // the starter's
};

}  // namespace

RunLoop& RunLoop::current() {
  static thread_local LinuxRunLoop loop;
  return loop;
}

std::shared_ptr<RunLoopTimer> CreateRunLoopTimer(std::chrono::microseconds interval, Block block) {
  return std::make_shared<LinuxTimer>(Clock::now() + interval, std::move(block));
}

std::unique_ptr<WorkerThread> CreateWorkerThread(std::string_view label, Block body) {
  return std::make_unique<LinuxWorkerThread>(label, std::move(body));
}

void SleepThread(std::chrono::microseconds duration) {
  const BlockingScope blocking;
  std::this_thread::sleep_for(duration);
}

}  // namespace quarvel
