#include "platform/Condition.h"

#include <algorithm>
#include <atomic>
#include <list>
#include <vector>

#include "base/Mutex.h"
#include "queues/BlockingScope.h"
#include "queues/Waits.h"

namespace quarvel {
namespace {

class LinuxCondition;

// Beyond these the wait, which counts in nanoseconds, would overflow.
constexpr Date kEarliestDeadline{};
constexpr Date kLatestDeadline{std::chrono::sys_days{std::chrono::year{2200} / 1 / 1}};

/// Who is waiting, so that the end of the service can wake them. Lock order: a condition's own
/// lock, then this one.
struct Waits {
  Mutex mutex;
  std::list<std::shared_ptr<LinuxCondition>> waiting QUARVEL_GUARDED_BY(mutex);
  std::atomic<Date> latest{kLatestDeadline};  // no wait goes on for longer
};

// Never destroyed: waiting threads outlive the end of main.
Waits& waits() {
  static Waits& instance = *new Waits;
  return instance;
}

class LinuxCondition final : public Condition, public std::enable_shared_from_this<LinuxCondition> {
 public:
  // The capability is this condition, which the analysis cannot tell from the mutex within.
  void lock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS { mutex_.lock(); }
  void unlock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS { mutex_.unlock(); }

  void signal() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    if (signals_ < waiters_) ++signals_;
    changed_.notifyOne();
  }

  bool waitUntil(Date deadline) override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    std::list<std::shared_ptr<LinuxCondition>> place{shared_from_this()};
    const auto self = place.begin();
    {
      const MutexLock lock(waits().mutex);
      waits().waiting.splice(waits().waiting.end(), place);
    }
    const bool signalled = awaitSignal(deadline);
    const MutexLock lock(waits().mutex);
    place.splice(place.end(), waits().waiting, self);
    return signalled;
  }

  /// Has whoever waits look at its deadline again. Taking the lock means: not between a waiter's
  /// last look and its wait.
  void wakeAll() {
    const MutexLock lock(mutex_);
    changed_.notifyAll();
  }

 private:
  bool awaitSignal(Date deadline) QUARVEL_REQUIRES(mutex_) {
    const BlockingScope blocking;
    ++waiters_;
    bool inTime = true;
    while (signals_ == 0 && inTime) {
      changed_.waitUntil(mutex_, endOf(deadline));
      inTime = std::chrono::system_clock::now() < endOf(deadline);
    }
    --waiters_;
    if (signals_ == 0) return false;
    --signals_;
    return true;
  }

  static Date endOf(Date deadline) {
    return std::clamp(std::min(deadline, waits().latest.load()), kEarliestDeadline,
                      kLatestDeadline);
  }

  Mutex mutex_;
  ConditionVariable changed_;
  std::size_t waiters_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t signals_ QUARVEL_GUARDED_BY(mutex_) = 0;  // given and not yet taken by a waiter
};

}  // namespace

std::shared_ptr<Condition> CreateCondition() {
  return std::make_shared<LinuxCondition>();
}

void EndWaits(Date latest) {
  std::vector<std::shared_ptr<LinuxCondition>> waiting;
  {
    const MutexLock lock(waits().mutex);
    waits().latest = latest;
    waiting.assign(waits().waiting.begin(), waits().waiting.end());
  }
  for (const auto& condition : waiting) condition->wakeAll();
}

}  // namespace quarvel
