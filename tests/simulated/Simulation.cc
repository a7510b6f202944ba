#include "tests/simulated/Simulation.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdlib>

namespace quarvel {

static Simulation* currentSimulation = nullptr;

Seeds::Seeds() {
  constexpr std::uint64_t kNightlyFactor = 25;
  if (const char* one = std::getenv("QUARVEL_SEED")) {
    first_ = last_ = std::strtoull(one, nullptr, 10);
  } else if (const char* count = std::getenv("QUARVEL_SEEDS")) {
    const std::uint64_t times = std::getenv("QUARVEL_NIGHTLY") == nullptr ? 1 : kNightlyFactor;
    last_ = std::strtoull(count, nullptr, 10) * times;
  }
}

std::vector<std::string> Journal::lines(std::initializer_list<std::string_view> prefixes) const {
  std::vector<std::string> matching;
  std::ranges::copy_if(*this, std::back_inserter(matching), [&](const std::string& line) {
    return std::ranges::any_of(prefixes, [&](auto prefix) { return line.starts_with(prefix); });
  });
  return matching;
}

Simulation::Simulation(std::uint64_t seed)
    : random{std::mt19937(seed)},
      scheduler(seed),
      seedTrace_(__FILE__, __LINE__, fmt::format("QUARVEL_SEED={}", seed)) {
  currentSimulation = this;
}

Simulation::~Simulation() {
  scheduler.stop();
  // Released first: their destructors may still use the rest of the platform.
  listener.release();
  notifications = {};
  orientation = {};
}

Simulation& Simulation::current() {
  if (currentSimulation == nullptr) std::abort();  // the platform is used outside a simulation
  return *currentSimulation;
}

}  // namespace quarvel
