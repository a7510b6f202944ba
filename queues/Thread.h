#pragma once

#include <pthread.h>

#include <string>
#include <string_view>

#include "base/Block.h"

namespace quarvel {

/// Starts a detached thread. Its stack of 192 KiB is enough for the deepest payload and small
/// enough for a thousand threads. Signals meant for the process are blocked in it, so that they
/// reach the threads that wait for them. `nice` is the thread's own nice value; a thread inherits
/// its starter's, and cannot go below it without privilege. Returns 0, or the system's error
/// number.
[[nodiscard]] int StartThread(std::string_view name, int nice, Block body);

/// A thread as `StartThread` makes it, but joined by its owner. Used by one thread at a time.
class JoinedThread {
 public:
  JoinedThread() = default;
  JoinedThread(const JoinedThread&) = delete;
  JoinedThread& operator=(const JoinedThread&) = delete;
  /// Waits for the thread to end.
  ~JoinedThread() { join(); }

  /// Called once. Returns 0, or the system's error number.
  [[nodiscard]] int start(std::string_view name, int nice, Block body);
  /// Waits for the thread to end; returns at once when none was started or it was joined before.
  void join();

 private:
  pthread_t thread_{};    // valid while `started_`
  bool started_ = false;  // and not joined
};

/// Sets the calling thread's name in the system's tools: one system call.
void NameThisThread(std::string_view label);

/// The 15 characters that the kernel keeps of a thread's name: the last dotted components of
/// `label` that fit, or the beginning of the last one.
[[nodiscard]] std::string ThreadName(std::string_view label);

}  // namespace quarvel
