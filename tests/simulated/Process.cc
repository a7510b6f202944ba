#include "platform/Process.h"

#include <fmt/format.h>

#include "tests/simulated/Simulation.h"

namespace quarvel {

std::int32_t OwnProcessIdentifier() {
  return 4711;
}
std::string OwnProcessName() {
  return "quarveld";
}
std::optional<std::string> ProcessCommandName(std::int32_t processIdentifier) {
  EXPECT_GE(processIdentifier, 1);
  const auto& table = Simulation::current().processes;
  const auto found = table.find(processIdentifier);
  return found == table.end() ? std::nullopt : std::optional(found->second);
}
void ExitProcess(int status) {
  Simulation::current().note(fmt::format("exit {}", status));
  TheScheduler().stop();
  throw ThreadEnded{};
}

}  // namespace quarvel
