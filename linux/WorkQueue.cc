#include "platform/WorkQueue.h"

#include "linux/Service.h"

namespace quarvel {

std::unique_ptr<WorkQueue> CreateSerialQueue(std::string_view label,
                                             QualityOfService qualityOfService) {
  return Service::current().queues().createSerialQueue(label, qualityOfService);
}

WorkQueue& BackgroundQueue() {
  return Service::current().queues().background();
}

std::unique_ptr<WorkQueue>& ProcessServerQueue() {
  return Service::current().serverQueue();
}

}  // namespace quarvel
