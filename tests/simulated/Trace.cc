#include "platform/Trace.h"

#include <fmt/format.h>

#include "tests/simulated/Simulation.h"

namespace quarvel {

void EmitKernelTrace(std::uint32_t code, std::uint64_t, std::uint64_t, std::uint64_t,
                     std::uint64_t) {
  Simulation::current().note(fmt::format("trace {:#x}", code));
}

}  // namespace quarvel
