#include "tests/FolderPlatform.h"

namespace quarvel {

WorkQueues& testing::FolderQueues() {
  static WorkQueues& queues = *new WorkQueues;
  return queues;
}

std::unique_ptr<WorkQueue> CreateSerialQueue(std::string_view label,
                                             QualityOfService qualityOfService) {
  return testing::FolderQueues().createSerialQueue(label, qualityOfService);
}

WorkQueue& BackgroundQueue() {
  return testing::FolderQueues().background();
}

std::unique_ptr<WorkQueue>& ProcessServerQueue() {
  static auto& queue = *new std::unique_ptr<WorkQueue>;
  return queue;
}

std::shared_ptr<Condition> CreateCondition() {
  return testing::FolderQueues().createCondition();
}

}  // namespace quarvel
