#include "queues/Conditions.h"

#include <algorithm>
#include <vector>

#include "queues/BlockingScope.h"

namespace quarvel {

class Conditions::PooledCondition final : public Condition,
                                          public std::enable_shared_from_this<PooledCondition> {
 public:
  explicit PooledCondition(Conditions& owner) : owner_(owner) {}

  // The capability is this condition, which the analysis cannot tell from the mutex within.
  void lock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS { mutex_.lock(); }
  void unlock() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS { mutex_.unlock(); }

  void signal() override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    if (signals_ < waiters_) ++signals_;
    changed_.notifyOne();
  }

  bool waitUntil(Date deadline) override QUARVEL_NO_THREAD_SAFETY_ANALYSIS {
    std::list<std::shared_ptr<PooledCondition>> place{shared_from_this()};
    const auto self = place.begin();
    {
      const MutexLock lock(owner_.mutex_);
      owner_.waiting_.splice(owner_.waiting_.end(), place);
    }
    const bool signalled = awaitSignal(deadline);
    const MutexLock lock(owner_.mutex_);
    place.splice(place.end(), owner_.waiting_, self);
    return signalled;
  }

  /// Has every waiter check its deadline again. The lock keeps this from coming between a waiter's
  /// last check and its wait.
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

  [[nodiscard]] Date endOf(Date deadline) const {
    return std::clamp(std::min(deadline, owner_.latest_.load()), kEarliestDeadline,
                      kLatestDeadline);
  }

  Conditions& owner_;
  Mutex mutex_;
  ConditionVariable changed_;
  std::size_t waiters_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t signals_ QUARVEL_GUARDED_BY(mutex_) = 0;  // given and not yet taken by a waiter
};

std::shared_ptr<Condition> Conditions::create() {
  return std::make_shared<PooledCondition>(*this);
}

void Conditions::endWaits(Date latest) {
  std::vector<std::shared_ptr<PooledCondition>> waiting;
  {
    const MutexLock lock(mutex_);
    latest_ = latest;
    waiting.assign(waiting_.begin(), waiting_.end());
  }
  for (const auto& condition : waiting) condition->wakeAll();
}

}  // namespace quarvel
