#include "platform/Counters.h"

#include "linux/ProcessStore.h"
#include "store/StoreStatus.h"

namespace quarvel {

namespace {

StoreDrop ReasonOf(MessageDrop reason) {
  switch (reason) {
    case MessageDrop::noAgentSession:
      return StoreDrop::noAgentSession;
    case MessageDrop::testServiceType:
      return StoreDrop::testServiceType;
    case MessageDrop::noSuchSession:
      break;
  }
  return StoreDrop::noSuchSession;
}

}  // namespace

void CountAcceptedMessage() {
  ProcessTelemetryStore()->countAccepted();
}

void CountDroppedMessage(MessageDrop reason) {
  ProcessTelemetryStore()->countDropped(ReasonOf(reason));
}

void AddToGauge(Gauge gauge, int difference) {
  ProcessGauges()[static_cast<std::size_t>(gauge)] += difference;
}

}  // namespace quarvel
