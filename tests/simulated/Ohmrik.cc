#include "platform/Ohmrik.h"

#include <fmt/format.h>

#include "tests/simulated/Simulation.h"

namespace quarvel {

void OhmrikLogRegisteredEvent(std::int32_t domain, std::string_view name, const Payload& record,
                              std::nullptr_t) {
  Simulation::current().note(fmt::format("ohmrik {} {}", domain, name));
  Simulation::current().powerRecords.push_back(record);
}

}  // namespace quarvel
