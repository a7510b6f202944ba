#include "platform/Counters.h"

#include "platform/linux/store/ProcessStore.h"
#include "platform/linux/store/StoreStatus.h"

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
  ProcessTelemetryStore()->onItsWay();
}

void CountDroppedMessage(MessageDrop reason) {
  ProcessTelemetryStore()->droppedOnItsWay(ReasonOf(reason));
}

void AddToGauge(Gauge gauge, int difference) {
  ProcessGauges()[static_cast<std::size_t>(gauge)] += difference;
}

}  // namespace quarvel
