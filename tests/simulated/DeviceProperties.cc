#include "platform/DeviceProperties.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

std::optional<bool> DevicePropertyBoolean(std::string_view name) {
  EXPECT_EQ(name, "InternalBuild");
  return Simulation::current().internalBuild;
}
std::optional<std::int64_t> DevicePropertyInteger(std::string_view name) {
  EXPECT_EQ(name, "DeviceClassNumber");
  return Simulation::current().deviceClass;
}

}  // namespace quarvel
