#include "queues/PendingWork.h"

namespace quarvel {

// The count changes before `waiters_` is read, and a waiter shows itself before it reads the count:
// one of the two sees the other.
void PendingWork::remove() {
  if (count_.fetch_sub(1) != 1 || waiters_.load() == 0) return;
  const MutexLock lock(mutex_);
  idle_.notifyAll();
}

bool PendingWork::waitUntilIdle(std::chrono::steady_clock::time_point deadline) {
  waiters_.fetch_add(1);
  bool inTime = true;
  {
    const MutexLock lock(mutex_);
    while (inTime && count_.load() != 0) inTime = idle_.waitUntil(mutex_, deadline);
  }
  waiters_.fetch_sub(1);
  return count_.load() == 0;
}

}  // namespace quarvel
