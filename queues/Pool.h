#pragma once

#include <cstddef>
#include <deque>
#include <memory>
#include <span>
#include <string_view>

#include "base/Mutex.h"
#include "queues/QueueState.h"

namespace quarvel {

class PendingWork;
class TimerThread;

/// The threads of one quality-of-service class and the queues that are ready for them.
///
/// While queues are ready, `width` threads run blocks. A thread whose block is in a `BlockingScope`
/// does not count: the pool starts another thread for it while there is work, and threads above the
/// width leave when their turn is over. Idle threads wait without waking up.
///
/// Owned by `WorkQueues`. Any thread.
class Pool {
 public:
  struct Options {
    std::string_view name;
    int nice;
    /// How many threads run blocks at once.
    std::size_t width;
    /// Up to this many blocked threads are replaced by others; beyond it, work waits for one of
    /// them.
    std::size_t maximumBlocked;
  };
  /// `timers` starts the pool's threads. Both must outlive the pool's last block.
  Pool(const Options& options, TimerThread& timers, PendingWork& pendingWork);
  Pool(const Pool&) = delete;
  Pool& operator=(const Pool&) = delete;
  /// Waits until every thread has left. No queue is ready or running any more.
  ~Pool();

  /// Lines a queue up for one turn, and for another as long as it wants one.
  void submit(std::shared_ptr<QueueState> queue) QUARVEL_EXCLUDES(mutex_);
  /// As `submit`, once the block that the calling thread runs has ended or blocks, or 1,024 queues
  /// have been deferred: a block that adds work to many queues takes the lock and wakes threads
  /// once. At once on a thread of no pool.
  void submitDeferred(std::shared_ptr<QueueState> queue) QUARVEL_EXCLUDES(mutex_);
  /// Submits the deferred queues of the calling thread. After each block of a pool's thread.
  static void flushDeferred();

  /// Starts a thread that is counted already. On the timer thread, whose nice value is not above
  /// any pool's.
  void startThread() QUARVEL_EXCLUDES(mutex_);

  /// Gives the queue its turn on the calling thread, which belongs to no pool. Returns whether the
  /// queue wants another turn.
  [[nodiscard]] static bool takeInlineTurn(QueueState& queue, InlineRunner& runner);

  /// The queue whose block the calling thread is running; null when none.
  [[nodiscard]] static const QueueState* currentQueue();

  [[nodiscard]] TimerThread& timers() { return timers_; }
  [[nodiscard]] PendingWork& pendingWork() { return pendingWork_; }

  // For `BlockingScope`, on the calling thread's pool.
  static void beginBlocking();
  static void endBlocking();

 private:
  /// The thread that ready work needs: an idle one to be woken, or a new one.
  enum class ThreadNeed { none, idleThread, newThread };

  void work() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] std::shared_ptr<QueueState> nextQueue(std::shared_ptr<QueueState> unfinished)
      QUARVEL_EXCLUDES(mutex_);
  void submit(std::span<std::shared_ptr<QueueState>> queues) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] ThreadNeed countNeededThread() QUARVEL_REQUIRES(mutex_);
  void provide(ThreadNeed need) QUARVEL_EXCLUDES(mutex_);

  const Options options_;
  TimerThread& timers_;
  PendingWork& pendingWork_;

  Mutex mutex_;
  ConditionVariable wake_;
  ConditionVariable threadLeft_;
  std::deque<std::shared_ptr<QueueState>> ready_ QUARVEL_GUARDED_BY(mutex_);
  // Every thread is counted in one of these. A thread that is being started or woken counts as
  // active at once, so that no second one is requested for the same work.
  std::size_t active_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t blocked_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t idle_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t waking_ QUARVEL_GUARDED_BY(mutex_) = 0;   // active ones that are not awake yet
  std::size_t running_ QUARVEL_GUARDED_BY(mutex_) = 0;  // threads that exist, for the destructor
  bool ending_ QUARVEL_GUARDED_BY(mutex_) = false;
};

}  // namespace quarvel
