#pragma once

#include <chrono>
#include <memory>

#include "queues/QueueState.h"

namespace quarvel {

class Pool;

/// Around work of a thread that belongs to no pool and brings blocks to queues: the brief blocks
/// that it brings to queues at rest are kept for the thread itself, which runs them when it says
/// so, instead of another thread being woken for them. That saves two changes of threads a call.
///
/// A block that runs here is never held back for room in another queue
/// (`BlockingScope::isAllowed`): its rows go in beyond the bound, and everything after it goes to
/// the pools. So does what is not brief, and what is left after a millisecond.
class InlineRunner {
 public:
  InlineRunner();
  /// What was not run goes to the pools.
  ~InlineRunner();
  InlineRunner(const InlineRunner&) = delete;
  InlineRunner& operator=(const InlineRunner&) = delete;

  /// Runs the brief blocks of the queue that was brought work first. False when there is none.
  bool runOne();

  /// The calling thread's; null when it is in none.
  [[nodiscard]] static InlineRunner* current();
  /// Keeps a queue that is ready for its turn.
  void adopt(std::shared_ptr<QueueState> queue, Pool& pool);
  /// From now on nothing is run here.
  void exhaust() { exhausted_ = true; }
  [[nodiscard]] bool isExhausted();

 private:
  const std::chrono::steady_clock::time_point end_;
  bool exhausted_ = false;
  unsigned asked_ = 0;
};

}  // namespace quarvel
