#include "platform/Counters.h"

#include "linux/Service.h"

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
  Service::current().store().countAccepted();
}

void CountDroppedMessage(MessageDrop reason) {
  Service::current().store().countDropped(ReasonOf(reason));
}

void AddToGauge(Gauge gauge, int difference) {
  Service::current().gauges()[static_cast<std::size_t>(gauge)] += difference;
}

}  // namespace quarvel
