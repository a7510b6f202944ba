#include "platform/Random.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

std::uint32_t RandomBelow(std::uint32_t bound) {
  SimulatedRandom& random = Simulation::current().random;
  return random.largest ? bound - 1 : static_cast<std::uint32_t>(random.source() % bound);
}

}  // namespace quarvel
