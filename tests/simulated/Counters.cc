#include "platform/Counters.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

void CountAcceptedMessage() {
  ++Simulation::current().counters.accepted;
}
void CountDroppedMessage(StoreDrop reason) {
  ++Simulation::current().counters.dropped[static_cast<std::size_t>(reason)];
}
void AddToGauge(Gauge gauge, int difference) {
  Simulation::current().counters.gauges[static_cast<std::size_t>(gauge)] += difference;
}

}  // namespace quarvel
