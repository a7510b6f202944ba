#include "tests/simulated/SimulatedSinks.h"

#include <fmt/format.h>

#include "platform/Ohmrik.h"
#include "platform/Vistrel.h"
#include "tests/simulated/Simulation.h"

namespace quarvel {

void VistrelSendEventLazy(std::string_view name, const std::function<Payload()>& payload) {
  Simulation& simulation = Simulation::current();
  simulation.note(fmt::format("vistrel {}", name));
  if (simulation.tells(Lie::eventLost)) return;
  simulation.vistrel.events.push_back({std::string(name), payload()});
}

void OhmrikLogRegisteredEvent(std::int32_t, std::string_view name, const Payload& record,
                              std::nullptr_t) {
  Simulation& simulation = Simulation::current();
  simulation.note(fmt::format("ohmrik {}", name));
  simulation.ohmrik.records.push_back(record);
}

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
