#pragma once

#include <cassert>
#include <chrono>
#include <memory>
#include <string_view>
#include <utility>

#include "base/Block.h"
#include "base/ThreadAnnotations.h"

namespace quarvel {

/// The platform's classes of urgency, with their numbers.
enum class QualityOfService { background = 9, utility = 17, userInteractive = 33 };

/// Runs blocks of work in the background. Also a capability: only blocks that run on a serial queue
/// touch the members that it guards. Owned by its user.
///
/// An implementation guarantees:
/// - `async`, `asyncBrief` and `after` return at once, never run the block themselves and never
///   refuse it. They may be called from any thread, and from blocks.
/// - A serial queue runs one block at a time, in order of arrival; each sees the effects of the one
///   before. A concurrent queue runs several blocks at once, in any order.
/// - A block may wait in a `Condition`, or block inside a platform call. That delays its own serial
///   queue alone.
/// - A block is destroyed after it has run, before the next one of its serial queue begins. Blocks
///   do not throw.
/// - A queue may be destroyed from any thread, from its own blocks too, and with blocks still
///   waiting, which run nevertheless.
class QUARVEL_CAPABILITY("queue") WorkQueue {
 public:
  virtual ~WorkQueue() = default;

  /// The name given at creation. From any thread; lives as long as the process.
  [[nodiscard]] virtual std::string_view label() const = 0;
  /// Queues `block`.
  virtual void async(Block block) = 0;
  /// Like `async`, for a block that takes microseconds and waits for nothing but back-pressure. The
  /// platform may run it on a thread that must never wait; back-pressure does not apply there.
  virtual void asyncBrief(Block block) { async(std::move(block)); }
  /// Like `async`, `delay` from now. An orderly end of the service runs delayed blocks at once.
  virtual void after(std::chrono::milliseconds delay, Block block) = 0;
  /// Whether the calling thread is running a block of this queue.
  [[nodiscard]] virtual bool isCurrent() const = 0;

  /// Asserts that the calling block runs on the queue (debug builds).
  void assertCurrent() const QUARVEL_ASSERT_CAPABILITY(this) { assert(isCurrent()); }
};

/// A new serial queue. `label` is a string literal and names the queue in tools and logs. An idle
/// queue has no thread and costs little memory: there may be a hundred thousand of them.
[[nodiscard]] std::unique_ptr<WorkQueue> CreateSerialQueue(std::string_view label,
                                                           QualityOfService qualityOfService);

/// The process-wide concurrent queue of the background class.
[[nodiscard]] WorkQueue& BackgroundQueue();

/// The place of the core's process-wide server queue, which lives as long as the other queues.
/// Empty until the core sets it, before any other thread uses it.
[[nodiscard]] std::unique_ptr<WorkQueue>& ProcessServerQueue();

}  // namespace quarvel
