#pragma once

#include <chrono>
#include <memory>

namespace quarvel {

class Pool;
class QueueState;

/// Marks a call that may block its thread for long (a wait, a full queue, a slow device). The pool
/// of the running block then lends another thread to its ready queues, so that the block delays its
/// own serial queue alone. Scopes nest; on a thread of no pool a scope has no effect.
///
/// May be opened and closed with a lock held: the locks of the pools call no foreign code.
class BlockingScope {
 public:
  /// Begins blocking, unless the thread runs blocks inline; returns at once.
  BlockingScope();
  /// Ends blocking: the thread counts as running again. Returns at once.
  ~BlockingScope();
  BlockingScope(const BlockingScope&) = delete;
  BlockingScope& operator=(const BlockingScope&) = delete;

  /// Whether the running block may block. False inside an `InlineRunner`: the caller must then go
  /// on without blocking, and the runner runs no further block.
  [[nodiscard]] static bool isAllowed();
};

/// Lets a thread of no pool, the I/O thread, run short blocks itself while their queue is idle:
/// brief blocks (`WorkQueue::asyncBrief`) that the thread adds to idle queues are kept for
/// `runOne`. Saves two context switches per call.
///
/// Other blocks, and all that are left after 1 ms, go to the pools. A block that runs here must not
/// block (`BlockingScope::isAllowed`).
///
/// Owned by a scope of that thread, one at a time, and used by that thread alone.
class InlineRunner {
 public:
  /// Becomes the calling thread's runner, for 1 ms from now.
  InlineRunner();
  /// Hands the queues that have not run to their pools.
  ~InlineRunner();
  InlineRunner(const InlineRunner&) = delete;
  InlineRunner& operator=(const InlineRunner&) = delete;

  /// Runs the brief blocks of the first queue that was added. Returns false when there is none.
  bool runOne();

  /// The calling thread's runner; null when there is none.
  [[nodiscard]] static InlineRunner* current();
  /// Adds a queue that is ready for a turn. For the queues.
  void add(std::shared_ptr<QueueState> queue, Pool& pool);
  /// Ends inline running: everything from now on goes to the pools.
  void exhaust() { exhausted_ = true; }
  /// Whether the next block goes to its pool. Reads the clock, but not at every call.
  [[nodiscard]] bool isExhausted();

 private:
  const std::chrono::steady_clock::time_point end_;
  bool exhausted_ = false;
  unsigned checks_ = 0;  // calls of `isExhausted`, of which some read the clock
};

}  // namespace quarvel
