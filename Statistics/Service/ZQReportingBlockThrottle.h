#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "Statistics/ZQReportingUtility.h"
#include "base/Block.h"
#include "base/Mutex.h"
#include "base/Payload.h"
#include "platform/RunLoop.h"

namespace quarvel {

/// One message that waits in a throttle: its block, which a duplicate replaces, and the timer that
/// will run it. Owned by the throttle's map of pending messages. Every operation may be called from
/// any thread.
class ZQReportingBlockThrottleTimerWrapper {
 public:
  /// Begins with `block` and without a timer. `block` may be empty: nothing then runs.
  explicit ZQReportingBlockThrottleTimerWrapper(Block block);

  /// Shared, since a reader may still hold a block that a duplicate has replaced.
  [[nodiscard]] std::shared_ptr<Block> block() const;
  /// Destroys the old block on the calling thread, unless a reader still holds it.
  void setBlock(Block block);

  /// Null until it is set.
  [[nodiscard]] std::shared_ptr<RunLoopTimer> timer() const;
  /// Shares `timer`, which `sleepFor` then moves, and releases the one before.
  void setTimer(std::shared_ptr<RunLoopTimer> timer);

  /// Moves the timer to `seconds` from now; it fires at once when `seconds` is not positive.
  void sleepFor(double seconds);

 private:
  mutable Mutex mutex_;
  std::shared_ptr<Block> block_ QUARVEL_GUARDED_BY(mutex_);
  std::shared_ptr<RunLoopTimer> timer_ QUARVEL_GUARDED_BY(mutex_);
};

/// Coalesces bursts: delays each message, and sends only the last one of several equal messages.
/// Messages are equal when they have the same key (`buildMessageKey`). Each message has a delay
/// (`determineSleepTime`), which a later equal message restarts with its own.
///
/// A library of its own, for programs that link it: the service creates no throttle itself.
///
/// Blocks run one at a time on the throttle's worker thread. The worker takes new messages when its
/// run loop is empty: a message that arrives while others wait for their delay is scheduled after
/// the last of them has run. An idle worker looks every 100 ms. The worker owns the throttle, which
/// therefore lives until `setShouldKeepRunning(false)`.
class ZQReportingBlockThrottle : public std::enable_shared_from_this<ZQReportingBlockThrottle> {
  struct Private {};

 public:
  using Wrapper = ZQReportingBlockThrottleTimerWrapper;
  /// Message key to pending message.
  using TimersInFlight = std::unordered_map<std::string, std::shared_ptr<Wrapper>>;
  /// Message keys in order of arrival.
  using TimerKeys = std::vector<std::string>;

  /// For `init` alone.
  explicit ZQReportingBlockThrottle(Private);

  /// A new throttle with its worker running.
  [[nodiscard]] static std::shared_ptr<ZQReportingBlockThrottle> init();

  /// Runs `block`, which sends `message`, after the message's delay. When an equal message arrives
  /// earlier, its block replaces this one, which the later caller destroys. When it arrives while
  /// this one fires, one of the two blocks runs. From any thread; returns at once.
  void addMessageBlock(Block block, ReporterID reporterID, const Payload& message,
                       std::uint32_t category, std::uint32_t type);

  /// Blocks until no message is pending, for 5 seconds at most, and looks every 500 ms. Messages
  /// that are pending then stay. From any thread but the worker, for which it would wait in vain.
  void waitForCompletion();

  /// The key that equal messages share: reporter, category, type, and the payload without excluded
  /// values. Excluded are values that always differ, and keys that the payload lists under
  /// "_comparison_field_blacklist"; such a key still counts as present. The order of keys does not
  /// matter. From any thread.
  [[nodiscard]] static std::string buildMessageKey(const Payload& payload, ReporterID reporterID,
                                                   std::uint32_t category, std::uint32_t type);

  /// The delay in seconds: "_throttle_seconds" of the payload (below 5, in single precision, may be
  /// negative) or else 0.5. From any thread.
  [[nodiscard]] static double determineSleepTime(const Payload& payload);

  /// Whether the worker goes on. Once false, it ends at its next look; pending messages stay.
  [[nodiscard]] bool shouldKeepRunning() const { return shouldKeepRunning_; }
  void setShouldKeepRunning(bool shouldKeepRunning) { shouldKeepRunning_ = shouldKeepRunning; }

  /// A copy of the pending messages by key. From any thread, like the accessors below.
  [[nodiscard]] TimersInFlight timersInFlight() const;
  /// Replaces all pending messages; a removed one never runs and its block is destroyed.
  void setTimersInFlight(TimersInFlight timersInFlight);
  /// Keys of messages that the worker has not scheduled yet, in order of arrival.
  [[nodiscard]] TimerKeys unscheduledTimerKeys() const;
  /// Replaces the keys. A message that is not scheduled yet and has no key here never runs.
  void setUnscheduledTimerKeys(TimerKeys keys);
  /// The worker's handle. Dropping it leaves the worker running.
  [[nodiscard]] std::shared_ptr<WorkerThread> queueThread() const;
  void setQueueThread(std::shared_ptr<WorkerThread> thread);

 private:
  /// A pending message whose timer calls `fire` `seconds` from now.
  [[nodiscard]] std::shared_ptr<Wrapper> makeWrapper(const std::string& key, Block block,
                                                     double seconds);
  /// Removes the pending message of `key` and its timer, then runs the block of `wrapper`. On the
  /// worker; the block runs with no lock held.
  void fire(Wrapper& wrapper, const std::string& key);
  /// The worker's body.
  void work();
  /// Puts the timers of the unscheduled keys on the worker's run loop.
  void scheduleTimers();
  // For log lines and waits; each takes its own lock.
  [[nodiscard]] std::size_t countInFlight() const;
  [[nodiscard]] std::size_t countUnscheduled() const;

  std::atomic<bool> shouldKeepRunning_ = true;

  // Locked before `timersMutex_` where both are held. Timers may be used with both held.
  mutable Mutex unscheduledMutex_;
  TimerKeys unscheduledTimerKeys_ QUARVEL_GUARDED_BY(unscheduledMutex_);

  mutable Mutex timersMutex_;
  TimersInFlight timersInFlight_ QUARVEL_GUARDED_BY(timersMutex_);

  mutable Mutex threadMutex_;
  std::shared_ptr<WorkerThread> queueThread_ QUARVEL_GUARDED_BY(threadMutex_);
};

}  // namespace quarvel
