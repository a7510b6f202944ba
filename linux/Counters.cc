#include "platform/Counters.h"

#include "linux/ProcessStore.h"
#include "store/StoreStatus.h"

namespace quarvel {

void CountAcceptedMessage() {
  ProcessTelemetryStore()->countAccepted();
}

void CountDroppedMessage(StoreDrop reason) {
  ProcessTelemetryStore()->countDropped(reason);
}

void AddToGauge(Gauge gauge, int difference) {
  ProcessGauges()[static_cast<std::size_t>(gauge)] += difference;
}

}  // namespace quarvel
