#include "queues/ThreadRunLoop.h"

#include <map>
#include <optional>
#include <utility>

#include "base/Mutex.h"

namespace quarvel {

namespace {

using Clock = std::chrono::steady_clock;

}  // namespace

/// The timers of one run loop, by fire date; equal dates in the order in which they were set.
/// Any thread. Its lock is taken after a timer's own, and after any other.
class ThreadRunLoop::Timers {
 public:
  void add(const std::shared_ptr<Timer>& timer, Clock::time_point date) QUARVEL_EXCLUDES(mutex_);
  void move(Timer& timer, Clock::time_point date) QUARVEL_EXCLUDES(mutex_);
  /// Returns the loop's own reference to the timer, which the caller drops without a lock.
  [[nodiscard]] std::shared_ptr<Timer> remove(Timer& timer) QUARVEL_EXCLUDES(mutex_);
  void removeAll() QUARVEL_EXCLUDES(mutex_);
  /// Waits until a timer is due and removes it; null when no timer is left. Woken only when the
  /// first date comes nearer or the last timer goes: a date that moves away is noticed when the old
  /// date comes.
  [[nodiscard]] std::shared_ptr<Timer> takeDue() QUARVEL_EXCLUDES(mutex_);

  using ByDate = std::multimap<Clock::time_point, std::shared_ptr<Timer>>;

 private:
  Mutex mutex_;
  ConditionVariable changed_;
  ByDate timers_ QUARVEL_GUARDED_BY(mutex_);
};

class ThreadRunLoop::Timer final : public RunLoopTimer {
 public:
  Timer(Clock::time_point fireDate, Block block) : block_(std::move(block)), fireDate_(fireDate) {}

  void fireAfter(std::chrono::microseconds delay) override QUARVEL_EXCLUDES(mutex_) {
    const auto date = Clock::now() + delay;
    const MutexLock lock(mutex_);
    fireDate_ = date;
    if (loop_ != nullptr) loop_->move(*this, date);
  }

  void invalidate() override QUARVEL_EXCLUDES(mutex_) {
    // Both destroyed after the lock: the block is foreign, and the loop may hold the last
    // reference.
    std::shared_ptr<Timer> removed;
    std::optional<Block> block;
    const MutexLock lock(mutex_);
    block.swap(block_);
    if (const auto loop = std::exchange(loop_, nullptr)) removed = loop->remove(*this);
  }

  static void addTo(const std::shared_ptr<Timers>& loop, const std::shared_ptr<Timer>& timer) {
    const MutexLock lock(timer->mutex_);
    if (!timer->block_ || timer->loop_ != nullptr) return;
    timer->loop_ = loop;
    loop->add(timer, timer->fireDate_);
  }

  /// The block, for the loop that has removed the timer; none when the timer was invalidated since.
  [[nodiscard]] std::optional<Block> takeBlock() QUARVEL_EXCLUDES(mutex_) {
    const MutexLock lock(mutex_);
    loop_ = nullptr;
    return std::exchange(block_, std::nullopt);
  }

 private:
  friend class Timers;

  Mutex mutex_;
  std::optional<Block> block_ QUARVEL_GUARDED_BY(mutex_);  // none: not valid any more
  Clock::time_point fireDate_ QUARVEL_GUARDED_BY(mutex_);
  std::shared_ptr<Timers> loop_ QUARVEL_GUARDED_BY(mutex_);

  // The lock of `loop_` guards these.
  std::optional<Timers::ByDate::iterator> place_;  // none: not on a loop
};

void ThreadRunLoop::Timers::add(const std::shared_ptr<Timer>& timer, Clock::time_point date) {
  const MutexLock lock(mutex_);
  timer->place_ = timers_.emplace(date, timer);
}

void ThreadRunLoop::Timers::move(Timer& timer, Clock::time_point date) {
  const MutexLock lock(mutex_);
  if (!timer.place_) return;
  auto node = timers_.extract(*timer.place_);
  node.key() = date;
  timer.place_ = timers_.insert(std::move(node));
  if (*timer.place_ == timers_.begin()) changed_.notifyOne();
}

std::shared_ptr<ThreadRunLoop::Timer> ThreadRunLoop::Timers::remove(Timer& timer) {
  const MutexLock lock(mutex_);
  if (!timer.place_) return nullptr;
  std::shared_ptr<Timer> removed = std::move((*timer.place_)->second);
  timers_.erase(*std::exchange(timer.place_, std::nullopt));
  if (timers_.empty()) changed_.notifyOne();
  return removed;
}

void ThreadRunLoop::Timers::removeAll() {
  ByDate removed;  // destroyed after the lock: a timer's block is foreign
  const MutexLock lock(mutex_);
  for (const auto& [date, timer] : timers_) timer->place_.reset();
  removed.swap(timers_);
}

std::shared_ptr<ThreadRunLoop::Timer> ThreadRunLoop::Timers::takeDue() {
  const MutexLock lock(mutex_);
  while (!timers_.empty()) {
    const auto first = timers_.begin();
    if (first->first <= Clock::now()) {
      std::shared_ptr<Timer> due = std::move(first->second);
      due->place_.reset();
      timers_.erase(first);
      return due;
    }
    const auto date = first->first;
    changed_.waitUntil(mutex_, date);
  }
  return nullptr;
}

ThreadRunLoop::ThreadRunLoop() : timers_(std::make_shared<Timers>()) {}

ThreadRunLoop::~ThreadRunLoop() {
  timers_->removeAll();
}

void ThreadRunLoop::addTimer(const std::shared_ptr<RunLoopTimer>& timer) {
  Timer::addTo(timers_, std::static_pointer_cast<Timer>(timer));
}

void ThreadRunLoop::run() {
  while (const std::shared_ptr<Timer> timer = timers_->takeDue()) {
    if (std::optional<Block> block = timer->takeBlock()) (*block)();
  }
}

std::shared_ptr<RunLoopTimer> ThreadRunLoop::createTimer(std::chrono::microseconds interval,
                                                         Block block) {
  return std::make_shared<Timer>(Clock::now() + interval, std::move(block));
}

}  // namespace quarvel
