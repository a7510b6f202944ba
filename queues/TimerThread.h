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
#include "queues/Thread.h"

namespace quarvel {

class PendingWork;
class Pool;

/// The timer thread of a `WorkQueues`, its owner. It adds delayed blocks to their queues when they
/// are due. It also starts the pools' threads: no caller pays for a new thread, and none inherits
/// the nice value of a pool below its own. Sleeps until the earliest block is due, without bound
/// when there is none. Any thread.
class TimerThread {
 public:
  /// Starts the thread; ends the process when the system has none to give.
  explicit TimerThread(PendingWork& pendingWork);
  TimerThread(const TimerThread&) = delete;
  TimerThread& operator=(const TimerThread&) = delete;
  /// Ends and joins the thread. Blocks that are still delayed never run.
  ~TimerThread();

  /// Has `pool.startThread()` called.
  void startThread(Pool& pool) QUARVEL_EXCLUDES(mutex_);

  /// Adds `block` to `queue`, `delay` from now by the monotonic clock, under the tracker that is
  /// current on the calling thread. The tracker may complete while the block waits, as long as the
  /// trackers of such blocks come to `kUnheldBytes` at most; trackers beyond that are held.
  void after(std::chrono::milliseconds delay, std::shared_ptr<QueueState> queue, Block block)
      QUARVEL_EXCLUDES(mutex_);

  /// Ends all delays, of now and from now on: delayed blocks go to their queues at once, in the
  /// order in which they were due.
  void endDelays() QUARVEL_EXCLUDES(mutex_);

  /// 16 MiB: bounds the memory of calls that have completed though a block of theirs is delayed.
  static constexpr std::size_t kUnheldBytes = 16 * 1024 * 1024;

 private:
  using Clock = std::chrono::steady_clock;

  struct Delayed {
    std::shared_ptr<QueueState> queue;
    Block block;
    std::shared_ptr<CallTracker> tracker;  // null for work that no call caused
    CallRef held;                          // empty while the tracker may complete
    std::size_t unheldBytes = 0;           // the delayed block's share of `unheldBytes_`
  };

  /// The thread's body, until the destructor.
  void run() QUARVEL_EXCLUDES(mutex_);
  /// Adds the block to its queue, under its tracker. Without the lock.
  static void deliver(Delayed delayed);

  PendingWork& pendingWork_;
  Mutex mutex_;
  ConditionVariable changed_;
  std::vector<Pool*> starts_ QUARVEL_GUARDED_BY(mutex_);  // one entry for each thread to start
  // By due time; blocks due at one time in the order in which they came.
  std::map<std::pair<Clock::time_point, std::uint64_t>, Delayed> delayed_
      QUARVEL_GUARDED_BY(mutex_);
  std::uint64_t delays_ QUARVEL_GUARDED_BY(mutex_) = 0;  // so far, to order equal due times
  std::size_t unheldBytes_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool delaysEnded_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool ending_ QUARVEL_GUARDED_BY(mutex_) = false;
  JoinedThread thread_;  // last: it uses all of the above
};

}  // namespace quarvel
