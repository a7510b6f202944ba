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

/// One message that waits in a throttle: the work, which a duplicate replaces, and the timer that
/// will run it. Every operation may be called from any thread.
class ZQReportingBlockThrottleTimerWrapper {
 public:
  explicit ZQReportingBlockThrottleTimerWrapper(Block block);

  /// Shared, since a reader may still hold what a duplicate has replaced by now.
  [[nodiscard]] std::shared_ptr<Block> block() const;
  /// Destroys the old block, unless somebody holds it, on the calling thread.
  void setBlock(Block block);

  /// Null until it is set.
  [[nodiscard]] std::shared_ptr<RunLoopTimer> timer() const;
  void setTimer(std::shared_ptr<RunLoopTimer> timer);

  /// Has the timer fire that long from now; at once when `seconds` is not positive.
  void sleepFor(double seconds);

 private:
  mutable Mutex mutex_;
  std::shared_ptr<Block> block_ QUARVEL_GUARDED_BY(mutex_);
  std::shared_ptr<RunLoopTimer> timer_ QUARVEL_GUARDED_BY(mutex_);
};

/// Delays messages for a moment, so that of a burst of equal ones only the last is sent. Messages
/// are equal when they have the same key (`buildMessageKey`); each has its own delay
/// (`determineSleepTime`), which every further equal one begins anew.
///
/// The blocks run one at a time on the throttle's worker thread, which takes up new messages when
/// it has none on its run loop: a message that comes while others wait for their delay is looked at
/// after the last of those has run. An idle worker looks every tenth of a second. It holds the
/// throttle, which so lives until `setShouldKeepRunning(false)`.
class ZQReportingBlockThrottle : public std::enable_shared_from_this<ZQReportingBlockThrottle> {
  struct Private {};

 public:
  using Wrapper = ZQReportingBlockThrottleTimerWrapper;
  using TimersInFlight = std::unordered_map<std::string, std::shared_ptr<Wrapper>>;
  using TimerKeys = std::vector<std::string>;

  explicit ZQReportingBlockThrottle(Private);

  /// A new throttle, its worker started.
  [[nodiscard]] static std::shared_ptr<ZQReportingBlockThrottle> init();

  /// Has `block`, which sends `message`, run once the message's delay is over, unless an equal
  /// message comes before that: then the later block runs in its place, and this one is destroyed
  /// by the later caller. From any thread; returns at once. When a message meets the firing of an
  /// equal one, one of the two blocks runs.
  void addMessageBlock(Block block, ReporterID reporterID, const Payload& message,
                       std::uint32_t category, std::uint32_t type);

  /// Waits until no message is pending, for 5 seconds at most; what is pending then stays. Looks
  /// every half second. From any thread but the worker, which it would wait for in vain.
  void waitForCompletion();

  /// What makes messages equal: reporter, category, type, and the payload without the values that
  /// always differ or that it says are not to be compared ("_comparison_field_blacklist", a list of
  /// keys). An excluded key still counts as present. The order of keys plays no part. From any
  /// thread.
  [[nodiscard]] static std::string buildMessageKey(const Payload& payload, ReporterID reporterID,
                                                   std::uint32_t category, std::uint32_t type);

  /// The delay in seconds that the payload asks for ("_throttle_seconds", below 5, in single
  /// precision; may be negative) or 0.5. From any thread.
  [[nodiscard]] static double determineSleepTime(const Payload& payload);

  /// Whether the worker goes on. Once false, it ends at its next look; what is pending then stays.
  [[nodiscard]] bool shouldKeepRunning() const { return shouldKeepRunning_; }
  void setShouldKeepRunning(bool shouldKeepRunning) { shouldKeepRunning_ = shouldKeepRunning; }

  /// Every pending message by its key, as it stands now.
  [[nodiscard]] TimersInFlight timersInFlight() const;
  void setTimersInFlight(TimersInFlight timersInFlight);
  /// The keys of the messages that the worker has not taken up yet, in the order they came.
  [[nodiscard]] TimerKeys unscheduledTimerKeys() const;
  void setUnscheduledTimerKeys(TimerKeys keys);
  [[nodiscard]] std::shared_ptr<WorkerThread> queueThread() const;
  void setQueueThread(std::shared_ptr<WorkerThread> thread);

 private:
  [[nodiscard]] std::shared_ptr<Wrapper> makeWrapper(const std::string& key, Block block,
                                                     double seconds);
  void fire(Wrapper& wrapper, const std::string& key);
  void work();
  void scheduleTimers();
  [[nodiscard]] std::size_t countInFlight() const;
  [[nodiscard]] std::size_t countUnscheduled() const;

  std::atomic<bool> shouldKeepRunning_ = true;

  // Taken before `timersMutex_` where both are held. The platform's timers may be asked under both.
  mutable Mutex unscheduledMutex_;
  TimerKeys unscheduledTimerKeys_ QUARVEL_GUARDED_BY(unscheduledMutex_);

  mutable Mutex timersMutex_;
  TimersInFlight timersInFlight_ QUARVEL_GUARDED_BY(timersMutex_);

  mutable Mutex threadMutex_;
  std::shared_ptr<WorkerThread> queueThread_ QUARVEL_GUARDED_BY(threadMutex_);
};

}  // namespace quarvel
