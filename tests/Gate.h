#pragma once

#include <chrono>
#include <cstddef>
#include <cstdio>
#include <cstdlib>

#include "base/Mutex.h"

namespace quarvel::testing {

/// A latch whose waits end the test program after 30 s, a time that means never.
class Gate {
 public:
  explicit Gate(std::ptrdiff_t count = 1) : left_(count) {}

  void arrive() {
    const MutexLock lock(mutex_);
    --left_;
    changed_.notifyAll();
  }
  void wait() {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    const MutexLock lock(mutex_);
    while (left_ > 0) {
      if (changed_.waitUntil(mutex_, deadline)) continue;
      std::fputs("a wait of the test came to no end\n", stderr);
      std::abort();
    }
  }
  void arriveAndWait() {
    arrive();
    wait();
  }

 private:
  Mutex mutex_;
  ConditionVariable changed_;
  std::ptrdiff_t left_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace quarvel::testing
