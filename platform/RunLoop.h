#pragma once

#include <chrono>
#include <memory>
#include <string_view>

#include "base/Block.h"

namespace quarvel {

// Dedicated threads that work from timers. All times are monotonic: a step of the wall clock moves
// no timer. A span is at most ten years; one that is not positive is over at once.

/// Runs a block once, on the thread of the run loop to which it was added. Shared by its run loop
/// and its creator.
///
/// A timer is valid from its creation until it fires or is invalidated. Its fire date counts from
/// its creation, so a timer that is overdue when it is added to a run loop fires at once.
///
/// An implementation guarantees:
/// - Both operations may be called from any thread, from the timer's own block too, with locks
///   held. They neither wait for a running block nor run one. An operation that races with the
///   firing may have no effect, but the block never runs twice.
/// - The block is destroyed after it has run, or by `invalidate`, or with the timer.
class RunLoopTimer {
 public:
  virtual ~RunLoopTimer() = default;

  /// Moves the fire date to `delay` from now; its run loop notices at once. Does nothing to a timer
  /// that is not valid.
  virtual void fireAfter(std::chrono::microseconds delay) = 0;
  /// Removes the timer from its run loop, which releases it. The block does not run unless it is
  /// running already.
  virtual void invalidate() = 0;
};

/// A new timer that is on no run loop yet and will fire once, `interval` from now. `block` is not
/// empty.
[[nodiscard]] std::shared_ptr<RunLoopTimer> CreateRunLoopTimer(std::chrono::microseconds interval,
                                                               Block block);

/// The timers of one thread, in the one default mode. Owned by its thread, which alone uses it and
/// with which it ends: timers that are still on it then never fire.
class RunLoop {
 public:
  /// The run loop of the calling thread.
  [[nodiscard]] static RunLoop& current();

  /// Adds a timer, whose block will run in `run`, and shares it until it is no longer valid.
  /// Ignores a timer that is on a run loop already or not valid. May be called with locks held.
  virtual void addTimer(const std::shared_ptr<RunLoopTimer>& timer) = 0;

  /// Fires the timers in the order of their fire dates, later additions too, and returns when none
  /// is left. Blocks without waking up until the earliest fire date, or until another thread moves
  /// a timer ahead of it or invalidates the last one. No lock is held while a block runs.
  virtual void run() = 0;

 protected:
  ~RunLoop() = default;
};

/// Handle of a dedicated thread. Dropping it leaves the thread running.
class WorkerThread {
 public:
  virtual ~WorkerThread() = default;
  /// Starts the thread, which runs its body, destroys it and ends. Called once. The process ends
  /// when the system cannot create a thread.
  virtual void start() = 0;
};

/// A new thread that has not started. `label` is a string literal and names the thread in tools.
[[nodiscard]] std::unique_ptr<WorkerThread> CreateWorkerThread(std::string_view label, Block body);

/// Blocks the calling thread for `duration`. A work queue's block that sleeps delays its own serial
/// queue only.
void SleepThread(std::chrono::microseconds duration);

}  // namespace quarvel
