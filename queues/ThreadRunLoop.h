#pragma once

#include <chrono>
#include <memory>

#include "platform/RunLoop.h"

namespace quarvel {

/// The run loop of one thread. Owned by its thread, for the life of the thread.
class ThreadRunLoop final : public RunLoop {
 public:
  /// On the thread that the loop belongs to.
  ThreadRunLoop();
  ThreadRunLoop(const ThreadRunLoop&) = delete;
  ThreadRunLoop& operator=(const ThreadRunLoop&) = delete;
  /// Timers that are still on it never fire.
  ~ThreadRunLoop();

  /// The loop's thread. A timer that is on a loop already, or no longer valid, is not added.
  void addTimer(const std::shared_ptr<RunLoopTimer>& timer) override;
  /// The loop's thread. Fires timers in the order of their dates; returns when none is left.
  void run() override;

  /// As `CreateRunLoopTimer`. Any thread; the timer may outlive every loop.
  [[nodiscard]] static std::shared_ptr<RunLoopTimer> createTimer(std::chrono::microseconds interval,
                                                                 Block block);

 private:
  class Timer;   // shared by its creator and the loop that it is on
  class Timers;  // the timers of one loop, by date, with the lock that guards them

  const std::shared_ptr<Timers> timers_;  // shared with the timers, which any thread may move
};

}  // namespace quarvel
