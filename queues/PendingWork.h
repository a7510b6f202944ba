#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>

#include "base/Mutex.h"

namespace quarvel {

/// Counts the pending work of all queues of a `WorkQueues`, its owner: one for each queue that has
/// blocks to run and one for each delayed block. Queued blocks alone add to the count while it is
/// above zero, so that a count of zero stays until a thread outside the queues adds work.
/// Any thread.
class PendingWork {
 public:
  PendingWork() = default;
  PendingWork(const PendingWork&) = delete;
  PendingWork& operator=(const PendingWork&) = delete;

  void add() { count_.fetch_add(1); }
  void remove() QUARVEL_EXCLUDES(mutex_);

  /// Blocks until the count is zero. Returns false when it was not by `deadline`.
  [[nodiscard]] bool waitUntilIdle(std::chrono::steady_clock::time_point deadline)
      QUARVEL_EXCLUDES(mutex_);

 private:
  std::atomic<std::int64_t> count_{0};
  std::atomic<int> waiters_{0};
  Mutex mutex_;
  ConditionVariable idle_;
};

}  // namespace quarvel
