#pragma once

#include <cassert>
#include <memory>
#include <utility>

#include "base/ThreadAnnotations.h"
#include "platform/WorkQueue.h"

namespace quarvel {

/// The process-wide serial queue on which all work of all clients runs. Exists from the
/// construction of the service delegate on.
[[nodiscard]] inline WorkQueue& ServerQueue() {
  assert(ProcessServerQueue() != nullptr);
  return *ProcessServerQueue();
}

/// Makes `queue` the process's server queue and releases the one before, whose queued blocks still
/// run. For the delegate's creation, before any other thread uses the queue.
inline void SetServerQueue(std::unique_ptr<WorkQueue> queue) {
  ProcessServerQueue() = std::move(queue);
}

/// The capability of running on the `ServerQueue`, whichever object that is.
class QUARVEL_CAPABILITY("queue") ServerQueueRole {};
inline ServerQueueRole serverQueueRole;

/// Begins every block of the `ServerQueue`.
inline void AssertOnServerQueue() QUARVEL_ASSERT_CAPABILITY(serverQueueRole) {
  ServerQueue().assertCurrent();
}

}  // namespace quarvel
