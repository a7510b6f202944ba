#include "platform/Vistrel.h"

#include <fmt/format.h>

#include "tests/simulated/Simulation.h"

namespace quarvel {

void VistrelSendEventLazy(std::string_view name, const std::function<Payload()>& payload) {
  Simulation::current().note(fmt::format("vistrel {}", name));
  Simulation::current().analyticsEvents.emplace_back(name, payload());
}

}  // namespace quarvel
