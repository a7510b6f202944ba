#pragma once

#include <chrono>
#include <memory>
#include <string_view>

#include "platform/Condition.h"
#include "platform/WorkQueue.h"
#include "queues/Conditions.h"
#include "queues/Pool.h"
#include "queues/TimerThread.h"

namespace quarvel {

/// The threads of all work queues, and the factory of queues and conditions. Owned by the service.
/// Any thread.
class WorkQueues {
 public:
  WorkQueues();
  WorkQueues(const WorkQueues&) = delete;
  WorkQueues& operator=(const WorkQueues&) = delete;
  /// Runs all work to its end (`drain` without a deadline), then ends the threads. No other thread
  /// adds blocks any more; queues that still exist may only be destroyed.
  ~WorkQueues();

  /// As `CreateSerialQueue`.
  [[nodiscard]] std::unique_ptr<WorkQueue> createSerialQueue(std::string_view label,
                                                             QualityOfService qualityOfService);
  /// As `BackgroundQueue`.
  [[nodiscard]] WorkQueue& background() { return *background_; }
  /// As `CreateCondition`.
  [[nodiscard]] std::shared_ptr<Condition> createCondition() { return conditions_.create(); }

  /// Brings all work to an end, for good: delayed blocks run at once, waits in a condition end
  /// within 2 s as if their deadline had passed, and the caller, no pool's thread, waits until
  /// every queue is idle. Returns false when that was not so at `deadline`.
  [[nodiscard]] bool drain(std::chrono::steady_clock::time_point deadline);

 private:
  /// The pool of the class. Blocks of one class never wait for threads of another.
  [[nodiscard]] Pool& poolOf(QualityOfService qualityOfService);

  PendingWork pendingWork_;                      // of every pool and of the timers
  Conditions conditions_;                        // has a lock of its own
  Pool userInteractivePool_;                     // one thread wide: the server queue's
  Pool utilityPool_;                             // the sessions' queues
  Pool backgroundPool_;                          // `background_`'s
  TimerThread timers_;                           // ends before the pools, whose threads it starts
  const std::unique_ptr<WorkQueue> background_;  // concurrent; constant after construction
};

}  // namespace quarvel
