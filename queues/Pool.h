#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <span>
#include <string_view>

#include "base/Mutex.h"
#include "queues/QueueState.h"

namespace quarvel {

class TimerThread;

/// Counts the pending work of all queues of a `WorkQueues`, its owner: one for each queue that has
/// blocks to run and one for each delayed block. Queued blocks alone add to the count while it is
/// above zero, so that a count of zero stays until a thread outside the queues adds work.
/// Any thread.
class PendingWork {
 public:
  PendingWork() = default;
  PendingWork(const PendingWork&) = delete;
  PendingWork& operator=(const PendingWork&) = delete;

  /// One more queue has blocks to run, or one more block is delayed.
  void add() { count_.fetch_add(1); }
  /// Takes one `add` back; wakes the waiters at zero.
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
    std::string_view name;  // a literal; its threads bear it until they run a block
    int nice;               // of its threads; 0 to 19, as a thread cannot go below its starter
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

  /// The thread that delays blocks for the queues of this pool. Any thread.
  [[nodiscard]] TimerThread& timers() { return timers_; }
  /// The count that the queues of this pool keep. Any thread.
  [[nodiscard]] PendingWork& pendingWork() { return pendingWork_; }

  // For `BlockingScope`, on the calling thread's pool; without effect on a thread of no pool.

  /// The calling thread no longer counts against the width: submits its deferred queues and
  /// provides another thread while queues are ready.
  static void beginBlocking();
  /// The calling thread counts again. Does not wait, so the width may be exceeded until turns end.
  static void endBlocking();

 private:
  /// The thread that ready work needs: an idle one to be woken, or a new one.
  enum class ThreadNeed { none, idleThread, newThread };

  /// The body of each thread: gives ready queues their turns, until it leaves.
  void work() QUARVEL_EXCLUDES(mutex_);
  /// Lines `unfinished` up again, if any, and waits for the next ready queue. Null: the thread
  /// leaves.
  [[nodiscard]] std::shared_ptr<QueueState> nextQueue(std::shared_ptr<QueueState> unfinished)
      QUARVEL_EXCLUDES(mutex_);
  void submit(std::span<std::shared_ptr<QueueState>> queues) QUARVEL_EXCLUDES(mutex_);
  /// Decides which thread one ready queue needs, and counts it as active.
  [[nodiscard]] ThreadNeed countNeededThread() QUARVEL_REQUIRES(mutex_);
  /// Wakes or requests the thread that was counted. Without the lock.
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
