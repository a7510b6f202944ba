#pragma once

#include <atomic>
#include <list>
#include <memory>

#include "base/Date.h"
#include "base/Mutex.h"
#include "platform/Condition.h"

namespace quarvel {

/// Makes the conditions of a `WorkQueues`, its owner, and ends their waits. Outlives every wait.
/// Any thread.
class Conditions {
 public:
  Conditions() = default;
  Conditions(const Conditions&) = delete;
  Conditions& operator=(const Conditions&) = delete;

  /// A wait in it marks its block as blocking (`BlockingScope`).
  [[nodiscard]] std::shared_ptr<Condition> create();

  /// Ends every wait, of now and from now on, at `latest` if not before, as if its deadline had
  /// passed.
  void endWaits(Date latest) QUARVEL_EXCLUDES(mutex_);

 private:
  /// A condition whose waits are listed in `waiting_`.
  class PooledCondition;

  // Beyond these a wait, which counts in nanoseconds, would overflow.
  static constexpr Date kEarliestDeadline{};
  static constexpr Date kLatestDeadline{std::chrono::sys_days{std::chrono::year{2200} / 1 / 1}};

  std::atomic<Date> latest_{kLatestDeadline};  // no wait goes on for longer
  Mutex mutex_;                                // taken after a condition's own
  std::list<std::shared_ptr<PooledCondition>> waiting_
      QUARVEL_GUARDED_BY(mutex_);  // one entry for each wait in progress
};

}  // namespace quarvel
