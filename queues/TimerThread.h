#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "queues/QueueState.h"

namespace quarvel {

class Pool;

/// The one thread that looks after all queues: it hands delayed blocks to their queues when they
/// are due, and starts the pools' threads, so that nobody who queues a block pays for one and none
/// inherits the nice value of a pool below its own. Sleeps until the earliest block is due, without
/// bound when there is none. Lives as long as the process, from first use on.
class TimerThread {
 public:
  [[nodiscard]] static TimerThread& instance();

  /// Has `pool.startThread()` called.
  void startThread(Pool& pool) QUARVEL_EXCLUDES(mutex_);

  /// Adds `block` to `queue`, `delay` from now by the monotonic clock, under the tracker that is
  /// current on the calling thread. The tracker may complete while the block waits, as long as the
  /// trackers of such blocks come to `kUnheldBytes` at most; those beyond are held.
  void after(std::chrono::milliseconds delay, std::shared_ptr<QueueState> queue, Block block)
      QUARVEL_EXCLUDES(mutex_);

  /// From now on nothing is delayed: what waits goes to its queue at once, in the order in which it
  /// was due.
  void endDelays() QUARVEL_EXCLUDES(mutex_);

  static constexpr std::size_t kUnheldBytes = 16 * 1024 * 1024;

 private:
  using Clock = std::chrono::steady_clock;

  struct Delayed {
    std::shared_ptr<QueueState> queue;
    Block block;
    std::shared_ptr<CallTracker> tracker;
    CallRef held;                 // empty while the tracker may complete
    std::size_t unheldBytes = 0;  // what `unheldBytes_` counts for it
  };

  TimerThread();
  void run();
  static void deliver(Delayed delayed);

  Mutex mutex_;
  ConditionVariable changed_;
  std::vector<Pool*> starts_ QUARVEL_GUARDED_BY(mutex_);
  // By due time; those due at one time in the order in which they came.
  std::map<std::pair<Clock::time_point, std::uint64_t>, Delayed> delayed_
      QUARVEL_GUARDED_BY(mutex_);
  std::uint64_t delays_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t unheldBytes_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool delaysEnded_ QUARVEL_GUARDED_BY(mutex_) = false;
};

}  // namespace quarvel
