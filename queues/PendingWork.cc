#include "queues/PendingWork.h"

#include <atomic>
#include <cstdint>

#include "base/Mutex.h"

namespace quarvel {
namespace {

std::atomic<std::int64_t> activities{0};
std::atomic<int> watchers{0};

struct Quiet {
  Mutex mutex;
  ConditionVariable came;
};

// Never destroyed: threads of the pools outlive the end of main.
Quiet& quiet() {
  static Quiet& instance = *new Quiet;
  return instance;
}

}  // namespace

void PendingWorkAdded() {
  activities.fetch_add(1);
}

// The count is changed before the watchers are looked at, and a watcher shows itself before it
// looks at the count: one of the two sees the other.
void PendingWorkDone() {
  if (activities.fetch_sub(1) != 1 || watchers.load() == 0) return;
  const MutexLock lock(quiet().mutex);
  quiet().came.notifyAll();
}

bool WaitUntilIdle(std::chrono::steady_clock::time_point deadline) {
  watchers.fetch_add(1);
  bool inTime = true;
  {
    const MutexLock lock(quiet().mutex);
    while (inTime && activities.load() != 0) {
      inTime = quiet().came.waitUntil(quiet().mutex, deadline);
    }
  }
  watchers.fetch_sub(1);
  return activities.load() == 0;
}

}  // namespace quarvel
