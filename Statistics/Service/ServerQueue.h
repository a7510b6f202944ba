#pragma once

#include <memory>

#include "base/ThreadAnnotations.h"
#include "platform/WorkQueue.h"

namespace quarvel {

/// The process-wide serial queue on which all work of all clients runs. Exists from the
/// construction of the service delegate on.
[[nodiscard]] WorkQueue& ServerQueue();

/// Makes `queue` the process's server queue and releases the one before.
void SetServerQueue(std::unique_ptr<WorkQueue> queue);

/// The capability of running on the `ServerQueue`, whichever object that is.
class QUARVEL_CAPABILITY("queue") ServerQueueRole {};
inline ServerQueueRole serverQueueRole;

/// Begins every block of the `ServerQueue`.
inline void AssertOnServerQueue() QUARVEL_ASSERT_CAPABILITY(serverQueueRole) {
  ServerQueue().assertCurrent();
}

}  // namespace quarvel
