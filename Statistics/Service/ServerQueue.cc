#include "Statistics/Service/ServerQueue.h"

#include <cassert>
#include <utility>

namespace quarvel {

namespace {

// Set while nothing else runs yet: by the delegate's construction. Never destroyed, since blocks
// may still run while the process exits.
std::unique_ptr<WorkQueue>& Storage() {
  static auto* const queue = new std::unique_ptr<WorkQueue>;
  return *queue;
}

}  // namespace

WorkQueue& ServerQueue() {
  assert(Storage() != nullptr);
  return *Storage();
}

void SetServerQueue(std::unique_ptr<WorkQueue> queue) {
  Storage() = std::move(queue);
}

}  // namespace quarvel
