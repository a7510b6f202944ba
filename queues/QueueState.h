#pragma once

#include <chrono>
#include <memory>
#include <string_view>
#include <utility>

#include "base/Block.h"
#include "queues/CallTracker.h"

namespace quarvel {

class InlineRunner;
class Pool;

/// A block and the tracker under which it was queued.
struct WorkItem {
  CallRef tracker;       // empty for work that no call caused
  Block block;           // runs once
  bool isBrief = false;  // added by `asyncBrief`: an `InlineRunner` may run it

  /// Runs the block, destroys it, and only then releases the tracker.
  void run() {
    using Clock = std::chrono::steady_clock;
    const bool isTimed = tracker.isDirect();
    const auto began = isTimed ? Clock::now() : Clock::time_point();
    {
      const CallScope scope(CallScope::Of::block, tracker);
      block();
      block = Block();
    }
    if (isTimed) tracker.blockRan(Clock::now() - began);
    tracker = CallRef();
  }
};

/// The blocks of one queue, as its pool sees them. Shared by the queue, which may be destroyed at
/// any time, and by the thread or pool that still has to run its blocks. The pool outlives it.
class QueueState : public std::enable_shared_from_this<QueueState> {
 public:
  /// `label`: a literal, or text that outlives the queue.
  QueueState(std::string_view label, Pool& pool) : label_(label), pool_(pool) {}
  virtual ~QueueState() = default;
  QueueState(const QueueState&) = delete;
  QueueState& operator=(const QueueState&) = delete;

  /// Names the queue, and the thread while it runs the queue's blocks. Any thread.
  [[nodiscard]] std::string_view label() const { return label_; }
  /// The pool whose threads run the blocks. Any thread.
  [[nodiscard]] Pool& pool() const { return pool_; }
  /// Appends a block, and has the pool give the queue a turn unless one is due already. Any thread.
  virtual void add(WorkItem&& item) = 0;
  /// Runs a bounded number of blocks, so that other queues get their turn. Returns whether the
  /// queue wants another turn. On a pool's thread, once for each turn asked for.
  [[nodiscard]] virtual bool takeTurn() = 0;
  /// As `takeTurn`, on the thread of `runner`: as long as blocks are brief and `runner` is not
  /// exhausted.
  [[nodiscard]] virtual bool takeInlineTurn(InlineRunner& runner) = 0;

 private:
  const std::string_view label_;
  Pool& pool_;
};

}  // namespace quarvel
