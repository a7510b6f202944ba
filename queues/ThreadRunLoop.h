#pragma once

#include <chrono>
#include <memory>

#include "platform/RunLoop.h"

namespace quarvel {

/// The run loop of one thread. Owned by its thread, for the life of the thread.
class ThreadRunLoop final : public RunLoop {
 public:
  ThreadRunLoop();
  ThreadRunLoop(const ThreadRunLoop&) = delete;
  ThreadRunLoop& operator=(const ThreadRunLoop&) = delete;
  /// Timers that are still on it never fire.
  ~ThreadRunLoop();

  void addTimer(const std::shared_ptr<RunLoopTimer>& timer) override;
  void run() override;

  /// As `CreateRunLoopTimer`.
  [[nodiscard]] static std::shared_ptr<RunLoopTimer> createTimer(std::chrono::microseconds interval,
                                                                 Block block);

 private:
  class Timer;
  class Timers;

  const std::shared_ptr<Timers> timers_;  // shared with the timers, which any thread may move
};

}  // namespace quarvel
