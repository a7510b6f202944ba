#pragma once

#include <sys/types.h>

#include <atomic>
#include <vector>

#include "base/Block.h"
#include "base/Mutex.h"

namespace quarvel {

class Log;

/// Ends the process of a service, its owner, without running destructors: other threads still use
/// the service. Any thread.
class ProcessExit {
 public:
  /// `log` is flushed last.
  explicit ProcessExit(Log& log) : log_(log) {}
  ProcessExit(const ProcessExit&) = delete;
  ProcessExit& operator=(const ProcessExit&) = delete;

  /// Adds work for the end of the service: run once, the last added first, on the thread that ends
  /// the process or destroys the service. It must soon come to an end by itself, and may log.
  void add(Block work) QUARVEL_EXCLUDES(mutex_);
  /// Runs the work that has not run yet.
  void runWork() QUARVEL_EXCLUDES(mutex_);

  /// Runs the work, flushes the log and ends the process. A second thread that calls this never
  /// returns; the work itself may call it, for another status.
  [[noreturn]] void exit(int status) QUARVEL_EXCLUDES(mutex_);

 private:
  /// Removes the work that was added last; an empty block when there is none.
  [[nodiscard]] Block takeLast() QUARVEL_EXCLUDES(mutex_);

  Log& log_;                      // outlives this
  std::atomic<pid_t> ending_{0};  // the thread that ends the process; 0: none
  Mutex mutex_;
  // Not run yet, in the order in which it was added.
  std::vector<Block> work_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel
