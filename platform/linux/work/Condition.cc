#include "platform/Condition.h"

#include <algorithm>
#include <atomic>
#include <list>
#include <vector>

#include "base/Mutex.h"
#include "platform/linux/work/BlockingScope.h"
#include "platform/linux/work/Waits.h"

namespace quarvel {
namespace {

class LinuxCondition;

/// Who is waiting, so that the end of the service can wake them. Lock order: a condition's own
/// lock, then this one.
struct Waits {
  Mutex mutex;
  std::list<std::shared_ptr<LinuxCondition>> waiting QUARVEL_GUARDED_BY(mutex);
  std::atomic<bool> ended{false};  // written under the mutex
};

// Never destroyed: waiting threads outlive the end of main.
Waits& waits() {
  static Waits& instance = *new Waits;
  return instance;
}

// Beyond these the wait, which counts in nanoseconds, would overflow.
constexpr Date kEarliestDeadline{};
constexpr Date kLatestDeadline{std::chrono::sys_days{std::chrono::year{2200} / 1 / 1}};

class LinuxCondition final : public Condition, public std::enable_shared_from_this<LinuxCondition> {
 public:
  // The capability is this condition, which the analysis cannot tell from the mutex within.
  void lock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS { mutex_.lock(); }
  void unlock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS { mutex_.unlock(); }

  void signal() override { changed_.notifyOne(); }

  bool waitUntil(Date deadline) override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    std::list<std::shared_ptr<LinuxCondition>> place{shared_from_this()};
    const auto self = place.begin();
    {
      const MutexLock lock(waits().mutex);
      if (waits().ended) return false;
      waits().waiting.splice(waits().waiting.end(), place);
    }
    bool woken = false;
    {
      const BlockingScope blocking;
      woken = changed_.waitUntil(mutex_, std::clamp(deadline, kEarliestDeadline, kLatestDeadline));
    }
    const MutexLock lock(waits().mutex);
    place.splice(place.end(), waits().waiting, self);
    return woken && !waits().ended;
  }

  /// Wakes whoever waits. Taking the lock means: not between a waiter's last look and its wait.
  void wakeAll() {
    const MutexLock lock(mutex_);
    changed_.notifyAll();
  }

 private:
  Mutex mutex_;
  ConditionVariable changed_;
};

}  // namespace

std::shared_ptr<Condition> CreateCondition() {
  return std::make_shared<LinuxCondition>();
}

void EndWaits() {
  std::vector<std::shared_ptr<LinuxCondition>> waiting;
  {
    const MutexLock lock(waits().mutex);
    waits().ended = true;
    waiting.assign(waits().waiting.begin(), waits().waiting.end());
  }
  for (const auto& condition : waiting) condition->wakeAll();
}

}  // namespace quarvel
