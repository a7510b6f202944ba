#pragma once

#include <chrono>
#include <memory>
#include <string_view>
#include <utility>

#include "base/Block.h"
#include "queues/CallTracker.h"

namespace quarvel {

class InlineRunner;

/// A block with the tracker under which it was queued.
struct WorkItem {
  CallRef tracker;
  Block block;
  bool isBrief = false;

  /// Runs the block, destroys it, and only then lets the tracker go.
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

/// A queue as its pool sees it: work in a line. Shared by the queue, which may go at any time, and
/// by whoever still has to run its blocks.
class QueueState : public std::enable_shared_from_this<QueueState> {
 public:
  explicit QueueState(std::string_view label) : label_(label) {}
  virtual ~QueueState() = default;
  QueueState(const QueueState&) = delete;
  QueueState& operator=(const QueueState&) = delete;

  [[nodiscard]] std::string_view label() const { return label_; }
  /// From any thread.
  virtual void add(WorkItem&& item) = 0;
  /// Runs a bounded number of blocks, so that other queues get their turn. Returns whether the
  /// queue wants another turn. On a pool's thread, once for each turn asked for.
  [[nodiscard]] virtual bool takeTurn() = 0;
  /// The same on a thread that helps, as long as blocks are brief and `help` is not exhausted.
  [[nodiscard]] virtual bool takeBriefTurn(InlineRunner& help) = 0;

 private:
  const std::string_view label_;
};

}  // namespace quarvel
