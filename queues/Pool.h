#pragma once

#include <cstddef>
#include <deque>
#include <memory>
#include <span>
#include <string_view>

#include "base/Mutex.h"
#include "platform/WorkQueue.h"
#include "queues/QueueState.h"

namespace quarvel {

/// The threads of one quality-of-service class and the line of queues that are ready for them.
///
/// As long as a queue is ready, as many threads as the pool's width run blocks; a thread whose
/// block is in a `BlockingScope` does not count. So the pool starts another thread for every one
/// that is held back while there is work, and threads above the width leave when their turn is
/// over. Threads that have nothing to do wait without waking up. Lives as long as the process.
class Pool {
 public:
  [[nodiscard]] static Pool& of(QualityOfService qualityOfService);

  /// `width`: how many threads run blocks at once. `mostHeldBack`: how many blocks that are held
  /// back get another thread lent for theirs; beyond, work waits for one of them.
  Pool(std::string_view name, int nice, std::size_t width, std::size_t mostHeldBack);
  Pool(const Pool&) = delete;
  Pool& operator=(const Pool&) = delete;

  /// Puts a queue in the line for one turn, and for another as long as it wants one. From any
  /// thread.
  void submit(std::shared_ptr<QueueState> queue) QUARVEL_EXCLUDES(mutex_);
  /// The same when the block that the calling thread is running has ended or is held back, or a
  /// thousand queues have come together: so one that brings work to many queues takes the lock and
  /// wakes threads once. At once on a thread of no pool.
  void submitSoon(std::shared_ptr<QueueState> queue) QUARVEL_EXCLUDES(mutex_);
  /// On a pool's thread, after each block.
  static void submitGathered();

  /// Starts a thread that has been counted already. On the keeper's thread, whose nice value no
  /// pool undercuts.
  void startThread() QUARVEL_EXCLUDES(mutex_);

  /// Gives the queue its turn on the calling thread, which belongs to no pool. Returns whether the
  /// queue wants another turn.
  [[nodiscard]] static bool takeTurnHere(QueueState& queue, InlineRunner& help);

  /// The queue whose block the calling thread is running; null when none.
  [[nodiscard]] static const QueueState* currentQueue();

  // What `BlockingScope` does, for the pool of the calling thread.
  static void beginBlocking();
  static void endBlocking();

 private:
  enum class Help { none, wakeThread, startThread };

  void work();
  [[nodiscard]] std::shared_ptr<QueueState> nextQueue(std::shared_ptr<QueueState> unfinished)
      QUARVEL_EXCLUDES(mutex_);
  void submit(std::span<std::shared_ptr<QueueState>> queues) QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] Help helpNeeded() QUARVEL_REQUIRES(mutex_);
  void call(Help help) QUARVEL_EXCLUDES(mutex_);

  const std::string_view name_;
  const int nice_;
  const std::size_t width_;
  const std::size_t mostHeldBack_;

  Mutex mutex_;
  ConditionVariable wake_;
  std::deque<std::shared_ptr<QueueState>> ready_ QUARVEL_GUARDED_BY(mutex_);
  // Every thread is counted in one of these. One that is being started or woken counts as active
  // from the moment it is called, so nobody calls a second one for the same work.
  std::size_t active_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t blocked_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t idle_ QUARVEL_GUARDED_BY(mutex_) = 0;
  std::size_t called_ QUARVEL_GUARDED_BY(mutex_) = 0;  // of the active ones: not awake yet
};

}  // namespace quarvel
