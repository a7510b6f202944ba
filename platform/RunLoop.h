#pragma once

#include <chrono>
#include <memory>
#include <string_view>

#include "base/Block.h"

namespace quarvel {

// Threads of one's own that do their work from timers. All times here are monotonic: a step of the
// wall clock moves no timer. A span is at most ten years; one that is not positive is over at once.

/// Runs a block once, on the thread of the run loop that it was added to.
///
/// A timer is valid from its creation until it fires or is invalidated. Its fire date stands from
/// its creation on, so time passes for it before it is added to a run loop too; one that is overdue
/// by then fires at once.
///
/// An implementation guarantees:
/// - Both operations may be called from any thread, from the timer's own block too, with locks
///   held. They neither wait for a block that is running nor run one. Of one that comes while the
///   timer fires, it is open whether it still counts, but not whether the block runs twice: never.
/// - The block is destroyed after it has run, or by `invalidate`, or with the timer.
class RunLoopTimer {
 public:
  virtual ~RunLoopTimer() = default;

  /// Moves the fire date to `delay` from now; its run loop notices at once. Does nothing to a timer
  /// that is not valid.
  virtual void fireAfter(std::chrono::microseconds delay) = 0;
  /// Takes the timer off its run loop, which lets go of it. The block does not run unless it is
  /// running already.
  virtual void invalidate() = 0;
};

/// A new timer that is on no run loop yet and will fire once, `interval` from now. `block` is not
/// empty.
[[nodiscard]] std::shared_ptr<RunLoopTimer> CreateRunLoopTimer(std::chrono::microseconds interval,
                                                               Block block);

/// The timers of one thread. It has one mode, the default one. Belongs to its thread, from which
/// alone it is used and with which it ends: timers that are still on it then never fire.
class RunLoop {
 public:
  /// The calling thread's own.
  [[nodiscard]] static RunLoop& current();

  /// Adds a timer, whose block will run in `run`. Holds it until it is no longer valid. Does
  /// nothing when it is on a run loop already or not valid. May be called with locks held.
  virtual void addTimer(const std::shared_ptr<RunLoopTimer>& timer) = 0;

  /// Fires the timers in the order of their fire dates, those added meanwhile too, and returns when
  /// none is left. Blocks without waking up until the earliest fire date, or until another thread
  /// moves a timer ahead of it or takes the last one away. No lock is held while a block runs.
  virtual void run() = 0;

 protected:
  ~RunLoop() = default;
};

/// A thread of one's own. Dropping the handle leaves the thread running.
class WorkerThread {
 public:
  virtual ~WorkerThread() = default;
  /// Has the thread run its body, then destroy it and end. Called once. The process ends when the
  /// system has no thread to give.
  virtual void start() = 0;
};

/// A new thread that has not started. `label`: a string literal that names the thread in tools.
[[nodiscard]] std::unique_ptr<WorkerThread> CreateWorkerThread(std::string_view label, Block body);

/// Holds the calling thread back for that long. A work queue's block that sleeps delays its own
/// serial queue only.
void SleepThread(std::chrono::microseconds duration);

}  // namespace quarvel
