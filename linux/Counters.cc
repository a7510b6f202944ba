#include "platform/Counters.h"

#include "linux/Service.h"

namespace quarvel {

void CountAcceptedMessage() {
  Service::current().store().countAccepted();
}

void CountDroppedMessage(StoreDrop reason) {
  Service::current().store().countDropped(reason);
}

void AddToGauge(Gauge gauge, int difference) {
  Service::current().gauges()[static_cast<std::size_t>(gauge)] += difference;
}

}  // namespace quarvel
