#include "tests/simulated/Simulation.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>

namespace quarvel {

namespace {
Simulation* currentSimulation = nullptr;
}

std::vector<std::string> Journal::lines(std::initializer_list<std::string_view> prefixes) const {
  std::vector<std::string> matching;
  std::ranges::copy_if(lines_, std::back_inserter(matching), [&](const std::string& line) {
    return std::ranges::any_of(prefixes, [&](auto prefix) { return line.starts_with(prefix); });
  });
  return matching;
}

Simulation::Simulation(std::uint64_t seed)
    : random(seed),
      scheduler(seed),
      seedTrace_(__FILE__, __LINE__, fmt::format("QUARVEL_SEED={}", seed)) {
  currentSimulation = this;
}

Simulation::~Simulation() {
  scheduler.stop();
  // Whatever these hold may still use the rest of the platform as it goes.
  listener.release();
  notifications.release();
  orientation = {};
}

Simulation& Simulation::current() {
  if (currentSimulation == nullptr) {
    std::fputs("the platform is used outside a simulation\n", stderr);
    std::abort();
  }
  return *currentSimulation;
}

}  // namespace quarvel
