#pragma once

#include <chrono>
#include <memory>
#include <string_view>
#include <utility>

#include "base/Block.h"
#include "base/ThreadAnnotations.h"

namespace quarvel {

/// The platform's classes of urgency, with their numbers.
enum class QualityOfService { background = 9, utility = 17, userInteractive = 33 };

/// Runs blocks of work in the background. As a capability: what is guarded by a serial queue is
/// touched only by blocks that run on it.
///
/// An implementation guarantees:
/// - `async`, `asyncBrief` and `after` return at once, whatever the queue is doing; they never run
///   the block themselves and never refuse it. They may be called from any thread, and from blocks.
/// - A serial queue runs one block at a time, in the order in which they came; each sees the
/// effects of the
///   one before. A concurrent queue runs blocks in any order and several at once.
/// - A block may wait in a `Condition`, or be held back inside a platform call: that delays its own
///   serial queue and nothing else.
/// - A block is destroyed after it has run, before the next of its serial queue begins. Blocks do
/// not
///   throw.
/// - A queue may be destroyed from any thread, from its own blocks too, and with blocks still
///   waiting: those run nevertheless.
class QUARVEL_CAPABILITY("queue") WorkQueue {
 public:
  virtual ~WorkQueue() = default;

  [[nodiscard]] virtual std::string_view label() const = 0;
  virtual void async(Block block) = 0;
  /// As `async`, for a block that takes microseconds and waits for nothing, except that it may be
  /// held back for want of room. The platform may run it on a thread that must never wait, and then
  /// lets it pass instead.
  virtual void asyncBrief(Block block) { async(std::move(block)); }
  /// As `async`, `delay` from now. When the service ends in order, what still waits runs at once.
  virtual void after(std::chrono::milliseconds delay, Block block) = 0;
  /// Whether the calling thread is running a block of this queue.
  [[nodiscard]] virtual bool isCurrent() const = 0;

  /// Says that this block runs on the queue; ends the process when it does not (debug builds).
  void assertCurrent() const QUARVEL_ASSERT_CAPABILITY(this);
};

/// A new serial queue. `label` must be a string literal: it names the queue in tools and logs.
/// A queue without work costs little memory and no thread: there may be a hundred thousand.
[[nodiscard]] std::unique_ptr<WorkQueue> CreateSerialQueue(std::string_view label,
                                                           QualityOfService qualityOfService);

/// The process-wide concurrent queue of the background class.
[[nodiscard]] WorkQueue& BackgroundQueue();

/// The place of the core's process-wide server queue, which lives as long as the other queues. Empty
/// until the core sets it, before any other thread uses it.
[[nodiscard]] std::unique_ptr<WorkQueue>& ProcessServerQueue();

}  // namespace quarvel
