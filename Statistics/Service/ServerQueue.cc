#include "Statistics/Service/ServerQueue.h"

#include <cassert>
#include <utility>

namespace quarvel {

WorkQueue& ServerQueue() {
  WorkQueue* const queue = ProcessServerQueue().get();
  assert(queue != nullptr);
  return *queue;
}

void SetServerQueue(std::unique_ptr<WorkQueue> queue) {
  ProcessServerQueue() = std::move(queue);
}

}  // namespace quarvel
